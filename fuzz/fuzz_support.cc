#include "fuzz/fuzz_support.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <spawn.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <map>
#include <string>

#include "host/provision.h"
#include "zeph/fd_io.h"
#include "zeph/unique_fd.h"

extern char** environ;

namespace ZEPH {
namespace fuzz {
namespace {

std::string MakeRoot() {
  const char* tmp = getenv("TMPDIR");
  std::string templ = std::string(tmp && *tmp ? tmp : "/tmp") + "/zephfuzz.XXXXXX";
  if (mkdtemp(&templ[0]) == nullptr) Die("mkdtemp failed");
  char resolved[PATH_MAX];
  std::string dir = realpath(templ.c_str(), resolved) ? resolved : templ;
  setenv("ZEPH_ROOT", dir.c_str(), 1);
  setenv("ZEPH_LOG_FILE", (dir + "/module.log").c_str(), 1);
  std::string error;
  if (!ProvisionRoot(&error)) Die("cannot provision " + dir + ": " + error);
  return dir;
}

// A certificate directory's files, by name.
using DirFiles = std::map<std::string, std::string>;

struct Pristine {
  std::string info;
  std::string services;
  std::map<std::string, DirFiles> certs;  // by id
};

const char* const kIds[] = {"fuzzAA", "fuzzBB"};

std::string ReadText(const std::string& path) {
  std::string text;
  if (!ReadFile(path, &text)) Die("cannot read " + path);
  return text;
}

// The regular files of `dir`; false when something else (a directory, a
// link) is in it or it cannot be read.
bool ReadDirFiles(const std::string& dir, DirFiles* files) {
  files->clear();
  DIR* d = opendir(dir.c_str());
  if (d == nullptr) return false;
  bool plain = true;
  while (const dirent* e = readdir(d)) {
    const std::string name = e->d_name;
    if (name == "." || name == "..") continue;
    struct stat st;
    const std::string path = dir + "/" + name;
    if (lstat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode) ||
        !ReadFile(path, &(*files)[name])) {
      plain = false;
    }
  }
  closedir(d);
  return plain;
}

Pristine MakeArchive() {
  Pristine p;
  p.services = ReadText(ArchivePath("/SERVICES"));
  for (const char* id : kIds) {
    const std::string dir = ArchivePath(std::string("/") + id);
    MakeCertSet(dir, id);
    if (!ReadDirFiles(dir, &p.certs[id])) Die("cannot read " + dir);
  }
  p.info = std::string("{\"fuzzAA\": {\"desc\": \"default\", \"services\": [") +
           WebServiceText() +
           "], \"user_deletable\": false}, "
           "\"fuzzBB\": {\"desc\": \"\", \"services\": [], "
           "\"user_deletable\": true}}\n";
  return p;
}

// Puts a certificate directory back as it was first made; only what
// differs is touched, so that an input that changed nothing costs nothing.
void RestoreCertDir(const std::string& dir, const DirFiles& want) {
  DirFiles now;
  if (!ReadDirFiles(dir, &now)) {
    const char* rm_argv[] = {"/bin/rm", "-rf", dir.c_str(), nullptr};
    if (!RunQuietly(rm_argv)) Die("cannot remove " + dir);
    now.clear();
  }
  if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) Die("cannot make " + dir);
  for (const auto& [name, text] : now) {
    if (want.count(name) == 0) unlink((dir + "/" + name).c_str());
  }
  for (const auto& [name, text] : want) {
    const auto found = now.find(name);
    if (found == now.end() || found->second != text) {
      const std::string path = dir + "/" + name;
      unlink(path.c_str());  // the module leaves its files read-only
      WriteFile(path, text);
    }
  }
}

void RemoveRoot() {
  const char* argv[] = {"/bin/rm", "-rf", Root().c_str(), nullptr};
  RunQuietly(argv);
}

}  // namespace

void Die(const std::string& what) {
  fprintf(stderr, "fuzz harness: %s\n", what.c_str());
  abort();
}

const std::string& Root() {
  // Never destroyed: the exit handler that removes the root runs after the
  // destructors of ordinary statics.
  static const std::string* const root = [] {
    auto* dir = new std::string(MakeRoot());
    atexit(RemoveRoot);
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
    RestoreCertDir(ArchivePath("/" + id), files);
  }
}

bool ReadFile(const std::string& path, std::string* text) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  text->clear();
  return fd.valid() && ReadAll(fd.get(), *text);
}

void WriteFile(const std::string& path, const uint8_t* data, size_t size) {
  UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
  if (!fd.valid() || !WriteAll(fd.get(), reinterpret_cast<const char*>(data), size)) Die("cannot write " + path);
}

void WriteFile(const std::string& path, const std::string& text) {
  WriteFile(path, reinterpret_cast<const uint8_t*>(text.data()), text.size());
}

bool RunQuietly(const char* const* argv) {
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, 1, "/dev/null", O_WRONLY, 0);
  posix_spawn_file_actions_addopen(&actions, 2, "/dev/null", O_WRONLY, 0);
  pid_t pid;
  const int rc = posix_spawn(&pid, argv[0], &actions, nullptr,
                             const_cast<char* const*>(argv), environ);
  posix_spawn_file_actions_destroy(&actions);
  if (rc != 0) return false;
  int status = 0;
  while (waitpid(pid, &status, 0) < 0) {
    if (errno != EINTR) return false;
  }
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

void MakeCertSet(const std::string& dir, const std::string& cn) {
  const std::string key = dir + "/privkey.pem";
  const std::string cert = dir + "/cert.pem";
  const std::string fullchain = dir + "/fullchain.pem";
  const std::string subject = "/CN=" + cn;
  const char* mkdir_argv[] = {"/bin/mkdir", "-p", dir.c_str(), nullptr};
  const char* req_argv[] = {"/usr/bin/openssl", "req", "-x509", "-newkey", "ec",
                            "-pkeyopt", "ec_paramgen_curve:P-256", "-nodes",
                            "-keyout", key.c_str(), "-out", cert.c_str(),
                            "-days", "365", "-subj", subject.c_str(), nullptr};
  const char* copy_argv[] = {"/bin/cp", cert.c_str(), fullchain.c_str(), nullptr};
  if (!RunQuietly(mkdir_argv) || !RunQuietly(req_argv) || !RunQuietly(copy_argv)) {
    Die("cannot make a certificate set in " + dir);
  }
}

}  // namespace fuzz
}  // namespace ZEPH
