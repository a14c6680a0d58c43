#include "server/token.h"

#include <errno.h>
#include <fcntl.h>
#include <openssl/crypto.h>
#include <openssl/rand.h>
#include <string.h>
#include <strings.h>
#include <sys/stat.h>
#include <unistd.h>

#include "zeph/fd_io.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace webapid {
namespace {

constexpr size_t kTokenBytes = 32;
constexpr size_t kMinTokenLength = 32;
constexpr size_t kMaxTokenLength = 1024;

bool MakeToken(std::string* token) {
  unsigned char raw[kTokenBytes];
  if (RAND_bytes(raw, sizeof(raw)) != 1) return false;
  static const char kHex[] = "0123456789abcdef";
  token->clear();
  for (unsigned char c : raw) {
    token->push_back(kHex[c >> 4]);
    token->push_back(kHex[c & 15]);
  }
  OPENSSL_cleanse(raw, sizeof(raw));
  return true;
}

// Writes a fresh token to a private file beside `path` and links it into
// place. EEXIST from link means another start won the race: not an error,
// the caller reads that token.
bool CreateToken(const std::string& path, std::string* error) {
  std::string token;
  if (!MakeToken(&token)) {
    *error = "cannot make a random token";
    return false;
  }
  std::string temp = path + ".XXXXXX";
  UniqueFd fd(mkostemp(&temp[0], O_CLOEXEC));
  if (!fd) {
    *error = "cannot create " + temp + ": " + strerror(errno);
    return false;
  }
  const bool written = fchmod(fd.get(), 0600) == 0 &&
                       WriteAll(fd.get(), token + "\n") && fsync(fd.get()) == 0;
  const int saved = errno;
  fd.reset();
  const bool linked = written && link(temp.c_str(), path.c_str()) == 0;
  const int link_errno = errno;
  unlink(temp.c_str());
  if (!written) {
    *error = "cannot write " + temp + ": " + strerror(saved);
    return false;
  }
  if (!linked && link_errno != EEXIST) {
    *error = "cannot create " + path + ": " + strerror(link_errno);
    return false;
  }
  return true;
}

}  // namespace

bool LoadOrCreateToken(const std::string& path, std::string* token,
                       std::string* error) {
  if (access(path.c_str(), F_OK) != 0 && !CreateToken(path, error)) {
    return false;
  }
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  struct stat st;
  if (!fd || fstat(fd.get(), &st) != 0) {
    *error = "cannot read " + path + ": " + strerror(errno);
    return false;
  }
  if (!S_ISREG(st.st_mode)) {
    *error = path + " is not a regular file";
    return false;
  }
  if ((st.st_mode & 077) != 0 && fchmod(fd.get(), 0600) != 0) {
    *error = "cannot make " + path + " private: " + strerror(errno);
    return false;
  }
  char buf[kMaxTokenLength + 2];
  size_t got = 0;
  while (got < sizeof(buf)) {
    ssize_t n = read(fd.get(), buf + got, sizeof(buf) - got);
    if (n == 0) break;
    if (n < 0) {
      if (errno == EINTR) continue;
      *error = "cannot read " + path + ": " + strerror(errno);
      return false;
    }
    got += static_cast<size_t>(n);
  }
  std::string text(buf, got);
  OPENSSL_cleanse(buf, sizeof(buf));
  while (!text.empty() && (text.back() == '\n' || text.back() == '\r')) {
    text.pop_back();
  }
  bool printable = !text.empty();
  for (unsigned char c : text) printable = printable && c > 0x20 && c < 0x7f;
  if (!printable || text.size() < kMinTokenLength ||
      text.size() > kMaxTokenLength) {
    *error = path + " does not hold a usable token (one line of at least " +
             std::to_string(kMinTokenLength) + " printable characters)";
    return false;
  }
  *token = std::move(text);
  return true;
}

bool TokenAccepts(const std::string& authorization, const std::string& token) {
  static const char kScheme[] = "Bearer ";
  const size_t scheme_len = sizeof(kScheme) - 1;
  if (authorization.size() < scheme_len ||
      strncasecmp(authorization.c_str(), kScheme, scheme_len) != 0) {
    return false;
  }
  size_t start = scheme_len;
  while (start < authorization.size() && authorization[start] == ' ') ++start;
  size_t end = authorization.size();
  while (end > start && authorization[end - 1] == ' ') --end;
  // The token's length is no secret (it is fixed when the server makes it);
  // its bytes are compared in constant time.
  if (end - start != token.size()) return false;
  return CRYPTO_memcmp(authorization.data() + start, token.data(),
                       token.size()) == 0;
}

}  // namespace webapid
}  // namespace ZEPH
