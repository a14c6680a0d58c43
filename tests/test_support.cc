#include "test_support.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <spawn.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <memory>
#include <sstream>

extern char** environ;

namespace ZEPH::test {
namespace {

std::optional<std::string> GetEnv(const char* name) {
  return getenv(name) ? std::optional<std::string>(getenv(name)) : std::nullopt;
}
void RestoreEnv(const char* name, const std::optional<std::string>& value) {
  value ? setenv(name, value->c_str(), 1) : unsetenv(name);
}
std::string ReadFd(int fd) {
  std::string out;
  char buf[4096];
  for (ssize_t n; (n = read(fd, buf, sizeof(buf))) > 0;) out.append(buf, static_cast<size_t>(n));
  close(fd);
  return out;
}
// With `input`, standard input is a pipe holding it (far below a pipe's capacity).
CommandResult RunWithInput(const std::vector<std::string>& argv, const std::string* input) {
  CommandResult result;
  int out[2], err[2], in[2] = {-1, -1};
  if (pipe2(out, O_CLOEXEC) != 0 || pipe2(err, O_CLOEXEC) != 0) return result;
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  if (input != nullptr) {
    if (pipe2(in, O_CLOEXEC) != 0) return result;
    EXPECT_EQ(write(in[1], input->data(), input->size()), static_cast<ssize_t>(input->size()));
    close(in[1]);
    posix_spawn_file_actions_adddup2(&actions, in[0], 0);
  }
  posix_spawn_file_actions_adddup2(&actions, out[1], 1);
  posix_spawn_file_actions_adddup2(&actions, err[1], 2);
  std::vector<char*> args;
  for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
  args.push_back(nullptr);
  pid_t pid;
  const int rc = posix_spawn(&pid, args[0], &actions, nullptr, args.data(), environ);
  posix_spawn_file_actions_destroy(&actions);
  close(out[1]);
  close(err[1]);
  if (input != nullptr) close(in[0]);
  result.out = ReadFd(out[0]);  // the outputs are small: one is read, then the other
  result.err = ReadFd(err[0]);
  int status = 0;
  if (rc == 0 && waitpid(pid, &status, 0) == pid && WIFEXITED(status)) {
    result.status = WEXITSTATUS(status);
  }
  return result;
}
template <typename T>
using Owned = std::unique_ptr<T, void (*)(T*)>;
// The first object of PEM text `pem` that `read` finds, owned by `free`.
template <typename T>
Owned<T> ReadPem(const std::string& pem, T* (*read)(BIO*, T**, pem_password_cb*, void*),
                 void (*free)(T*)) {
  BIO* bio = BIO_new_mem_buf(pem.data(), static_cast<int>(pem.size()));
  Owned<T> object(bio ? read(bio, nullptr, nullptr, nullptr) : nullptr, free);
  BIO_free(bio);
  ERR_clear_error();
  return object;
}
Owned<X509> Certificate(const std::string& pem) {
  return ReadPem(pem, PEM_read_bio_X509, X509_free);
}
Owned<X509_REQ> Request(const std::string& pem) {
  return ReadPem(pem, PEM_read_bio_X509_REQ, X509_REQ_free);
}
Owned<EVP_PKEY> PrivateKey(const std::string& pem) {
  return ReadPem(pem, PEM_read_bio_PrivateKey, EVP_PKEY_free);
}
// `result`, with OpenSSL's error queue emptied.
bool Cleared(bool result) {
  ERR_clear_error();
  return result;
}
std::string CommonName(X509_NAME* name) {
  char text[256] = "";
  if (name != nullptr) X509_NAME_get_text_by_NID(name, NID_commonName, text, sizeof(text));
  return text;
}

}  // namespace

TempRoot::TempRoot() {
  const char* tmp = getenv("TMPDIR");
  std::string templ = std::string(tmp && *tmp ? tmp : "/tmp") + "/zephtest.XXXXXX";
  char* made = mkdtemp(&templ[0]);
  if (made == nullptr) {
    ADD_FAILURE() << "mkdtemp failed";
    return;
  }
  // Searchable by all, as an appliance's root: nginx's workers (www-data) reach the server's
  // run directory below it.
  chmod(made, 0755);
  dir_ = std::filesystem::canonical(made);
  saved_root_ = GetEnv("ZEPH_ROOT");
  saved_log_ = GetEnv("ZEPH_LOG_FILE");
  setenv("ZEPH_ROOT", dir_.c_str(), 1);
  setenv("ZEPH_LOG_FILE", (dir_ + "/test.log").c_str(), 1);
  MakeDirs(dir_ + "/tmp");
}
TempRoot::~TempRoot() {
  RestoreEnv("ZEPH_ROOT", saved_root_);
  RestoreEnv("ZEPH_LOG_FILE", saved_log_);
  if (!dir_.empty() && getenv("ZEPH_KEEP_TEST_ROOTS") == nullptr) {
    Run({"/bin/chmod", "-R", "u+rwx", dir_});  // read-only directories go too
    Run({"/bin/rm", "-rf", dir_});
  }
}
std::string TempRoot::Log() const { return ReadFile(dir_ + "/test.log"); }
bool TempRoot::LogContains(const std::string& text) const {
  return Log().find(text) != std::string::npos;
}
void TempRoot::ClearLog() const { unlink((dir_ + "/test.log").c_str()); }
std::string ReadFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}
void WriteFile(const std::string& path, const std::string& content, mode_t mode) {
  unlink(path.c_str());
  int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, mode);
  ASSERT_GE(fd, 0) << path;
  ASSERT_EQ(write(fd, content.data(), content.size()), static_cast<ssize_t>(content.size()));
  close(fd);
  chmod(path.c_str(), mode);
}
void MakeDirs(const std::string& path) { Run({"/bin/mkdir", "-p", path}); }
bool Exists(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0;
}
mode_t ModeOf(const std::string& path) {
  struct stat st;
  return stat(path.c_str(), &st) == 0 ? st.st_mode & 07777 : 0;
}
std::vector<std::string> DirEntries(const std::string& dir) {
  std::vector<std::string> names;
  std::error_code ec;
  for (std::filesystem::directory_iterator it(dir, ec), end; !ec && it != end; it.increment(ec)) {
    names.push_back(it->path().filename());
  }
  std::sort(names.begin(), names.end());
  return names;
}
std::vector<std::string> StagingLeftovers(const std::string& dir) {
  std::vector<std::string> found;
  std::error_code ec;
  for (std::filesystem::recursive_directory_iterator it(dir, ec), end; !ec && it != end;
       it.increment(ec)) {
    const std::string ext = it->path().extension();
    if (it->is_directory() && (ext == ".temp" || ext == ".bak")) found.push_back(it->path());
  }
  if (ec) found.push_back(dir + ": " + ec.message());
  return found;
}
CommandResult Run(const std::vector<std::string>& argv) { return RunWithInput(argv, nullptr); }
CommandResult Run(const std::vector<std::string>& argv, const std::string& input) {
  return RunWithInput(argv, &input);
}
std::string BinDir() { return getenv("ZEPH_BIN_DIR") ? getenv("ZEPH_BIN_DIR") : "."; }
std::set<std::string> ZipMembers(const std::string& zip) {
  const CommandResult r = Run({"/usr/bin/7z", "l", "-slt", zip});
  EXPECT_EQ(r.status, 0) << r.out << r.err;
  std::set<std::string> names;
  std::istringstream in(r.out);
  bool entries = false;  // the archive's own "Path = " comes first
  for (std::string line; std::getline(in, line);) {
    if (line == "----------") entries = true;
    if (entries && line.rfind("Path = ", 0) == 0) names.insert(line.substr(7));
  }
  return names;
}
std::string ZipMember(const std::string& zip, const std::string& name) {
  const CommandResult r = Run({"/usr/bin/7z", "e", "-so", zip, name});
  EXPECT_EQ(r.status, 0) << r.err;
  return r.out;
}
bool IssuedBy(const std::string& cert_pem, const std::string& ca_pem) {
  auto cert = Certificate(cert_pem), ca = Certificate(ca_pem);
  return Cleared(cert && ca &&
                 X509_NAME_cmp(X509_get_issuer_name(cert.get()),
                               X509_get_subject_name(ca.get())) == 0 &&
                 X509_verify(cert.get(), X509_get0_pubkey(ca.get())) == 1);
}
bool SignedByOwnAuthority(const std::string& dir) {
  return IssuedBy(ReadFile(dir + "/cert.pem"), ReadFile(dir + "/zeph-ca-cert.pem"));
}
bool RequestFitsKey(const std::string& csr_pem, const std::string& key_pem) {
  auto csr = Request(csr_pem);
  auto key = PrivateKey(key_pem);
  return Cleared(csr && key && X509_REQ_check_private_key(csr.get(), key.get()) == 1);
}
bool CertificateFitsKey(const std::string& cert_pem, const std::string& key_pem) {
  auto cert = Certificate(cert_pem);
  auto key = PrivateKey(key_pem);
  return Cleared(cert && key && X509_check_private_key(cert.get(), key.get()) == 1);
}
std::string SubjectCommonName(const std::string& pem) {
  if (auto cert = Certificate(pem)) return CommonName(X509_get_subject_name(cert.get()));
  if (auto csr = Request(pem)) return CommonName(X509_REQ_get_subject_name(csr.get()));
  return "";
}
int KeyBits(const std::string& key_pem) {
  auto key = PrivateKey(key_pem);
  return key ? EVP_PKEY_bits(key.get()) : 0;
}

}  // namespace ZEPH::test
