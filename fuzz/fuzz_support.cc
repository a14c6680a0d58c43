#include "fuzz/fuzz_support.h"

#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>
#include <map>

#include "host/provision.h"
#include "zeph/fd_io.h"
#include "zeph/unique_fd.h"

namespace ZEPH::fuzz {
namespace {

std::string MakeRoot() {
  const char* tmp = getenv("TMPDIR");
  std::string templ = std::string(tmp && *tmp ? tmp : "/tmp") + "/zephfuzz.XXXXXX";
  if (mkdtemp(&templ[0]) == nullptr) Die("mkdtemp failed");
  const std::string dir = std::filesystem::canonical(templ);
  setenv("ZEPH_ROOT", dir.c_str(), 1);
  setenv("ZEPH_LOG_FILE", (dir + "/module.log").c_str(), 1);
  std::string error;
  if (!ProvisionRoot(&error)) Die("cannot provision " + dir + ": " + error);
  return dir;
}
struct Pristine {
  std::string info, services;
  std::map<std::string, std::map<std::string, std::string>> certs;  // files by id and name
};
Pristine MakeArchive() {
  Pristine p;
  if (!ReadFile(ArchivePath("/SERVICES"), &p.services)) Die("cannot read SERVICES");
  for (const std::string id : {"fuzzAA", "fuzzBB"}) {
    const std::string dir = ArchivePath("/" + id);
    std::map<std::string, std::string>& files = p.certs[id];
    MakeDirs(dir);
    const std::string openssl =
        "/usr/bin/openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes "
        "-keyout '" + dir + "/privkey.pem' -out '" + dir + "/cert.pem' -days 365 -subj /CN=" +
        id + " >/dev/null 2>&1";
    if (system(openssl.c_str()) != 0 || !ReadFile(dir + "/privkey.pem", &files["privkey.pem"]) ||
        !ReadFile(dir + "/cert.pem", &files["cert.pem"])) {
      Die("cannot make a certificate set in " + dir);
    }
    files["fullchain.pem"] = files["cert.pem"];
  }
  p.info = "{\"fuzzAA\": {\"desc\": \"default\", \"services\": [" + WebServiceText() +
           "], \"user_deletable\": false}, "
           "\"fuzzBB\": {\"desc\": \"\", \"services\": [], \"user_deletable\": true}}\n";
  return p;
}

}  // namespace

void Die(const std::string& what) {
  fprintf(stderr, "fuzz harness: %s\n", what.c_str());
  abort();
}
const std::string& Root() {
  // Never destroyed: the exit handler removing the root runs after static destructors.
  static const std::string* const root = [] {
    auto* dir = new std::string(MakeRoot());
    atexit([] {
      std::error_code ec;
      std::filesystem::remove_all(Root(), ec);
    });
    return dir;
  }();
  return *root;
}
std::string ArchivePath(const std::string& rest) {
  return Root() + "/usr/zeph/etc/certificate/_archive" + rest;
}
const std::string& WebServiceText() {
  static const std::string text = WebServiceJson(CurrentUserName());
  return text;
}
void RestoreArchive() {
  static const Pristine pristine = MakeArchive();
  WriteFile(ArchivePath("/INFO"), pristine.info);
  WriteFile(ArchivePath("/DEFAULT"), std::string("fuzzAA\n"));
  WriteFile(ArchivePath("/SERVICES"), pristine.services);
  for (const auto& [id, files] : pristine.certs) {
    const std::string dir = ArchivePath("/" + id);
    std::error_code ec;
    std::filesystem::remove_all(dir, ec);
    if (mkdir(dir.c_str(), 0700) != 0) Die("cannot make " + dir);
    for (const auto& [name, text] : files) WriteFile(dir + "/" + name, text);
  }
}
bool ReadFile(const std::string& path, std::string* text) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  text->clear();
  return fd.valid() && ReadAll(fd.get(), *text);
}
void WriteFile(const std::string& path, const uint8_t* data, size_t size) {
  UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  if (!fd.valid() || !WriteAll(fd.get(), reinterpret_cast<const char*>(data), size)) {
    Die("cannot write " + path);
  }
}
void WriteFile(const std::string& path, const std::string& text) {
  WriteFile(path, reinterpret_cast<const uint8_t*>(text.data()), text.size());
}
void MakeDirs(const std::string& path) {
  std::error_code ec;
  std::filesystem::create_directories(path, ec);
  if (ec) Die("cannot make " + path + ": " + ec.message());
}
APIResponse CallOnce(void (*handler)(APIRequest*, APIResponse*), const Json::Value& params,
                     const std::string& what) {
  APIRequest request(params);
  APIResponse response;
  handler(&request, &response);
  if (response.outcome_count() != 1) {
    Die(what + " wrote " + std::to_string(response.outcome_count()) + " outcomes");
  }
  return response;
}

}  // namespace ZEPH::fuzz
