#include "acme/base64url.h"

namespace ZEPH {
namespace acme {
namespace {

constexpr char kAlphabet[] =
    "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-_";

int Value(char c) {
  if (c >= 'A' && c <= 'Z') return c - 'A';
  if (c >= 'a' && c <= 'z') return c - 'a' + 26;
  if (c >= '0' && c <= '9') return c - '0' + 52;
  if (c == '-') return 62;
  if (c == '_') return 63;
  return -1;
}

}  // namespace

std::string Base64UrlEncode(const std::string& bytes) {
  std::string out;
  unsigned int acc = 0;
  int bits = 0;
  for (unsigned char c : bytes) {
    acc = (acc << 8) | c;
    bits += 8;
    while (bits >= 6) {
      bits -= 6;
      out.push_back(kAlphabet[(acc >> bits) & 0x3f]);
    }
  }
  if (bits > 0) out.push_back(kAlphabet[(acc << (6 - bits)) & 0x3f]);
  return out;
}

bool Base64UrlDecode(const std::string& text, std::string* out) {
  std::string t = text;
  while (!t.empty() && t.back() == '=') t.pop_back();
  if (t.size() % 4 == 1) return false;
  out->clear();
  unsigned int acc = 0;
  int bits = 0;
  for (char c : t) {
    const int v = Value(c);
    if (v < 0) return false;
    acc = (acc << 6) | static_cast<unsigned int>(v);
    bits += 6;
    if (bits >= 8) {
      bits -= 8;
      out->push_back(static_cast<char>((acc >> bits) & 0xff));
    }
  }
  return true;
}

}  // namespace acme
}  // namespace ZEPH
