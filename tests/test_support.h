// Helpers shared by the tests. TempRoot gives each test its own appliance
// root: a fresh directory that becomes ZEPH_ROOT (and holds the
// ZEPH_LOG_FILE) for the test's lifetime and is removed afterwards.
#ifndef ZEPH_TESTS_TEST_SUPPORT_H_
#define ZEPH_TESTS_TEST_SUPPORT_H_

#include <sys/types.h>

#include <optional>
#include <set>
#include <string>
#include <vector>

namespace ZEPH {
namespace test {

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
void WriteFile(const std::string& path, const std::string& content,
               mode_t mode = 0644);
void MakeDirs(const std::string& path);
bool Exists(const std::string& path);
// Everything in `dir` but "." and "..", sorted; empty when it cannot be read.
std::vector<std::string> DirEntries(const std::string& dir);
// The directories below `dir` named "*.temp" or "*.bak": the staging and
// backup directories a change makes, which must go with it (and a line
// saying why, if `dir` could not be walked).
std::vector<std::string> StagingLeftovers(const std::string& dir);
mode_t ModeOf(const std::string& path);

struct CommandResult {
  int status = -1;  // exit status, or -1 when not run / killed
  std::string out;
  std::string err;
};

// Runs `argv` (argv[0] is the program path), capturing output; standard
// input is the test's own, or a pipe holding `input`.
CommandResult Run(const std::vector<std::string>& argv);
CommandResult Run(const std::vector<std::string>& argv, const std::string& input);

std::string BinDir();  // of the built executables and module

// The names of the members of the ZIP archive at `zip` (by "7z l -slt").
std::set<std::string> ZipMembers(const std::string& zip);
// The bytes of member `name` of the archive at `zip`.
std::string ZipMember(const std::string& zip, const std::string& name);

// Checks of PEM texts; false (0, "") for text that is not what is asked.
// Whether `cert_pem` names `ca_pem` as its issuer and carries its signature.
bool IssuedBy(const std::string& cert_pem, const std::string& ca_pem);
// IssuedBy for "cert.pem" and the authority "zeph-ca-cert.pem" in `dir`.
bool SignedByOwnAuthority(const std::string& dir);
// Whether the request or certificate was made for private key `key_pem`.
bool RequestFitsKey(const std::string& csr_pem, const std::string& key_pem);
bool CertificateFitsKey(const std::string& cert_pem, const std::string& key_pem);
std::string SubjectCommonName(const std::string& pem);  // of a certificate or request
int KeyBits(const std::string& key_pem);

}  // namespace test
}  // namespace ZEPH

#endif  // ZEPH_TESTS_TEST_SUPPORT_H_
