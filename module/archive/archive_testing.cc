#include "module/archive/archive_testing.h"

#include <ctype.h>
#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sys/wait.h>
#include <unistd.h>

#include "test_support.h"
#include "zeph/json_file.h"
#include "zeph/root.h"

namespace ZEPH {
namespace test {
namespace {

bool SelfSigned(const std::string& dir, const std::string& cn, std::string& key, std::string& pem) {
  CommandResult r = Run({"/usr/bin/openssl", "req", "-x509", "-newkey", "ec", "-pkeyopt",
                         "ec_paramgen_curve:prime256v1", "-nodes", "-keyout", dir + "/new.key",
                         "-out", dir + "/new.pem", "-days", "365", "-subj", "/CN=" + cn});
  key = ReadFile(dir + "/new.key");
  pem = ReadFile(dir + "/new.pem");
  Run({"/bin/rm", "-f", dir + "/new.key", dir + "/new.pem"});
  EXPECT_EQ(r.status, 0) << "openssl req: " << r.err;
  return r.status == 0;
}

}  // namespace

std::string CurrentUserName() {
  const struct passwd* pw = getpwuid(geteuid());
  return pw != nullptr ? pw->pw_name : "";
}

bool MakeCertSet(const std::string& dir, const std::string& cn, bool full) {
  MakeDirs(dir);
  std::string key, cert, issuer_key, issuer;
  if (!SelfSigned(dir, cn, key, cert) ||
      (full && !SelfSigned(dir, cn + " issuer", issuer_key, issuer))) {
    return false;
  }
  WriteFile(dir + "/privkey.pem", key, 0600);
  WriteFile(dir + "/cert.pem", cert);
  WriteFile(dir + "/fullchain.pem", cert + issuer);
  if (full) {
    WriteFile(dir + "/chain.pem", issuer);
    WriteFile(dir + "/zeph-ca-cert.pem", issuer);
  }
  return true;
}

std::string MakeArchiveCert(const std::string& id, bool full) {
  const std::string dir = RootPath("/usr/zeph/etc/certificate/_archive/" + id);
  MakeCertSet(dir, id, full);
  return dir;
}

std::string OpensslFingerprint(const std::string& pem_path) {
  CommandResult r = Run(
      {"/usr/bin/openssl", "x509", "-in", pem_path, "-noout", "-fingerprint", "-sha256"});
  std::string hex;
  const size_t eq = r.out.find('=');
  for (size_t i = eq + 1; r.status == 0 && eq != std::string::npos && i < r.out.size(); ++i) {
    const unsigned char c = r.out[i];
    if (isxdigit(c)) hex.push_back(static_cast<char>(tolower(c)));
  }
  return hex;
}

Json::Value ServiceObject(const std::string& subscriber, const std::string& service,
                          bool package, const std::string& owner) {
  Json::Value object(Json::objectValue);
  object["display_name"] = subscriber + " " + service;
  object["subscriber"] = subscriber;
  object["service"] = service;
  object["isPkg"] = package;
  object["owner"] = owner;
  return object;
}

Json::Value JsonArray(std::initializer_list<Json::Value> items) {
  Json::Value array(Json::arrayValue);
  for (const Json::Value& item : items) array.append(item);
  return array;
}

Json::Value InfoEntry(const Json::Value& services) {
  Json::Value entry(Json::objectValue);
  entry["desc"] = "";
  entry["services"] = services;
  entry["user_deletable"] = true;
  return entry;
}

std::string InfoPath() { return RootPath("/usr/zeph/etc/certificate/_archive/INFO"); }

void WriteInfo(const Json::Value& info) {
  MakeDirs(RootPath("/usr/zeph/etc/certificate/_archive"));
  WriteFile(InfoPath(), JsonCompact(info));
}

void WriteInfoText(const std::string& text) {
  if (text.empty()) unlink(InfoPath().c_str()); else WriteFile(InfoPath(), text);
}

Json::Value ReadInfo() {
  Json::Value info;
  return JsonFromFile(info, InfoPath()) ? info : Json::Value();
}

uid_t UnprivilegedUid() { return geteuid() == 0 ? 65534 : geteuid(); }
gid_t UnprivilegedGid() { return geteuid() == 0 ? 65534 : getegid(); }

int RunUnprivileged(const std::function<int()>& body) {
  const pid_t pid = fork();
  if (pid == 0) {
    if (geteuid() == 0 && (setgroups(0, nullptr) != 0 || setgid(UnprivilegedGid()) != 0 ||
                           setuid(UnprivilegedUid()) != 0)) {
      _exit(125);
    }
    _exit(body());
  }
  int status = 0;
  if (pid < 0 || waitpid(pid, &status, 0) != pid || !WIFEXITED(status)) return -1;
  return WEXITSTATUS(status);
}

}  // namespace test
}  // namespace ZEPH
