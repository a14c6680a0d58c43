// Helpers shared by the tests. TempRoot: a fresh appliance root, ZEPH_ROOT (with the
// ZEPH_LOG_FILE) for the test's lifetime, removed afterwards.
#ifndef ZEPH_TESTS_TEST_SUPPORT_H_
#define ZEPH_TESTS_TEST_SUPPORT_H_

#include <sys/types.h>

#include <optional>
#include <set>
#include <string>
#include <vector>

namespace ZEPH::test {

// The module's API names and the paths of the store below a root.
inline constexpr char kCertApi[] = "ZEPH.Core.Certificate";
inline constexpr char kCrt[] = "ZEPH.Core.Certificate.CRT";
inline constexpr char kCsr[] = "ZEPH.Core.Certificate.CSR";
inline constexpr char kService[] = "ZEPH.Core.Certificate.Service";
inline constexpr char kLe[] = "ZEPH.Core.Certificate.LetsEncrypt";
inline constexpr char kArchive[] = "/usr/zeph/etc/certificate/_archive";
// Where the web interface's certificate is deployed.
inline constexpr char kWebCert[] = "/usr/zeph/etc/certificate/system/default/cert.pem";

class TempRoot {
 public:
  TempRoot();
  ~TempRoot();
  TempRoot(const TempRoot&) = delete;
  TempRoot& operator=(const TempRoot&) = delete;
  const std::string& dir() const { return dir_; }
  std::string Path(const std::string& path) const { return dir_ + path; }  // below the root
  std::string Log() const;  // everything logged so far
  bool LogContains(const std::string& text) const;
  void ClearLog() const;  // forgets what was logged so far
 private:
  std::string dir_;
  std::optional<std::string> saved_root_, saved_log_;
};

std::string ReadFile(const std::string& path);
void WriteFile(const std::string& path, const std::string& content, mode_t mode = 0644);
void MakeDirs(const std::string& path);
bool Exists(const std::string& path);
// Everything in `dir` but "." and "..", sorted; empty when it cannot be read.
std::vector<std::string> DirEntries(const std::string& dir);
// The staging and backup directories ("*.temp", "*.bak") below `dir`, which a change must
// remove (and a line saying why, if `dir` could not be walked).
std::vector<std::string> StagingLeftovers(const std::string& dir);
mode_t ModeOf(const std::string& path);

struct CommandResult {
  int status = -1;  // exit status, or -1 when not run / killed
  std::string out, err;
};
// Runs `argv` (argv[0] is a path), capturing output; standard input is a pipe with `input`.
CommandResult Run(const std::vector<std::string>& argv);
CommandResult Run(const std::vector<std::string>& argv, const std::string& input);
std::string BinDir();  // of the built executables and module

// The member names of the ZIP archive at `zip`, and the bytes of its member `name` (by 7z).
std::set<std::string> ZipMembers(const std::string& zip);
std::string ZipMember(const std::string& zip, const std::string& name);
// Checks of PEM texts, false (0, "") for text that is not what is asked. IssuedBy: whether
// `cert_pem` names `ca_pem` as issuer and carries its signature.
bool IssuedBy(const std::string& cert_pem, const std::string& ca_pem);
// IssuedBy for "cert.pem" and the authority "zeph-ca-cert.pem" in `dir`.
bool SignedByOwnAuthority(const std::string& dir);
// Whether the request or certificate was made for private key `key_pem`.
bool RequestFitsKey(const std::string& csr_pem, const std::string& key_pem);
bool CertificateFitsKey(const std::string& cert_pem, const std::string& key_pem);
std::string SubjectCommonName(const std::string& pem);  // of a certificate or request
int KeyBits(const std::string& key_pem);

}  // namespace ZEPH::test

#endif  // ZEPH_TESTS_TEST_SUPPORT_H_
