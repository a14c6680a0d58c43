#include "tools/zeph_letsencrypt/accounts.h"

#include <errno.h>
#include <glob.h>
#include <openssl/sha.h>
#include <stdio.h>
#include <string.h>

#include "tools/zeph_letsencrypt/files.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace letsencrypt {
namespace {

struct GlobResult {
  glob_t g{};
  ~GlobResult() { globfree(&g); }
};

}  // namespace

std::string AccountName(const std::string& directory_url, const std::string& email) {
  const std::string text = directory_url + "\n" + email;
  unsigned char digest[SHA256_DIGEST_LENGTH];
  SHA256(reinterpret_cast<const unsigned char*>(text.data()), text.size(), digest);
  std::string name = "acct-";
  char hex[3];
  for (int i = 0; i < 8; ++i) {
    snprintf(hex, sizeof(hex), "%02x", digest[i]);
    name += hex;
  }
  return name;
}

bool RecordAccount(const std::string& account_root, const std::string& directory_url,
                   const std::string& email, std::string* error) {
  const std::string dir = account_root + "/" + AccountName(directory_url, email);
  const std::string path = dir + "/info.json";
  Json::Value info(Json::objectValue);
  info["contact"] = email;
  info["directory_url"] = directory_url;
  Json::Value current;
  if (JsonFromFile(current, path) && current == info) return true;
  if (!MakeDir(account_root, 0700) || !MakeDir(dir, 0700) ||
      !WriteWhole(path, JsonCompact(info) + "\n", 0600)) {
    *error = "cannot record the account in " + path + ": " + strerror(errno);
    return false;
  }
  return true;
}

std::string OnlyAccountFor(const std::string& account_root,
                           const std::string& directory_url) {
  GlobResult found;
  const std::string pattern = account_root + "/*/info.json";
  if (glob(pattern.c_str(), 0, nullptr, &found.g) != 0) return "";
  std::string only;
  int count = 0;
  for (size_t i = 0; i < found.g.gl_pathc; ++i) {
    Json::Value info;
    if (!JsonFromFile(info, found.g.gl_pathv[i]) || !info.isObject()) continue;
    if (info["directory_url"] != directory_url || !info["contact"].isString()) continue;
    only = info["contact"].asString();
    ++count;
  }
  return count == 1 ? only : "";
}

}  // namespace letsencrypt
}  // namespace ZEPH
