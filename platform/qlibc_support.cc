#include "zeph/qlibc_support.h"

#include <string.h>

#include <fstream>
#include <string>

#include "zeph/root.h"

namespace {

std::string Trim(const std::string& s) {
  const char* blanks = " \t\r";
  size_t b = s.find_first_not_of(blanks);
  if (b == std::string::npos) return std::string();
  size_t e = s.find_last_not_of(blanks);
  return s.substr(b, e - b + 1);
}

}  // namespace

extern "C" {

int QLIBCSupportGet(const char* key) {
  if (key == nullptr || *key == '\0') return 0;
  std::ifstream in(ZEPH::RootPath("/usr/zeph/etc/features.conf"));
  std::string line;
  int value = 0;
  // The last line for a key wins, as in any key=value file.
  while (std::getline(in, line)) {
    std::string t = Trim(line);
    if (t.empty() || t[0] == '#') continue;
    size_t eq = t.find('=');
    if (eq == std::string::npos || Trim(t.substr(0, eq)) != key) continue;
    value = Trim(t.substr(eq + 1)) == "yes" ? 1 : 0;
  }
  return value;
}

}  // extern "C"
