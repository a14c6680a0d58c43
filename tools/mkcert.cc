// mkcert: makes a fresh self-signed certificate set in the archive.
//
//   mkcert NAME
//
// Writes the five files of a certificate set (privkey.pem, cert.pem,
// fullchain.pem, zeph-ca-cert.pem, zeph-ca-privkey.pem) into the archive
// directory NAME, that is "<root>/usr/zeph/etc/certificate/_archive/NAME",
// with a new authority and a new server key. The root is ZEPH_ROOT, as for
// the module. Exit status 0 on success; otherwise one line on standard error
// and status 1 (the set could not be made) or 2 (bad command line).
//
// What the set is made from:
//   - When NAME is "<id>.temp" and "<id>" is a certificate of the archive
//     (its directory holds cert.pem), the new set keeps that certificate's
//     subject, subject alternative names and key type and length, and its
//     authority's subject and key type and length when zeph-ca-cert.pem is there
//     (else the default authority). This is how the module's "recreate"
//     method renews a certificate's keys: it empties "<id>.temp", runs the
//     tool and moves the result onto "<id>". See tools/cert_template.h for
//     exactly what is kept. A certificate that exists but cannot be read is
//     an error rather than a reason to fall back to the defaults: the caller
//     asked for the same certificate, not for some certificate.
//   - Otherwise the default set of the appliance (genDefaultCrt's subjects,
//     2048-bit keys, alias "arvelon").
//
// Rules:
//   - NAME is a single directory name: not empty, no "/", not "." or "..".
//   - The archive directory must exist; NAME is created in it (mode 0700)
//     when missing and must be a directory when present. Earlier files of a
//     set in it are replaced; other files there are left alone.
//   - The generation is the module's own (genCASet, then genCertSet, under
//     the module's generation lock), so the set, the working files and the
//     diagnostic lines (syslog, and ZEPH_LOG_FILE when set) are exactly
//     those of the module. The tool
//     links the module's shared object rather than a second copy of its
//     code: the functions it calls are exported for other components anyway,
//     and the appliance then has one implementation of key generation,
//     updated in one place.
//   - openssl's chatter is kept off the tool's standard output and error, so
//     that a caller sees nothing on success and one line on failure.
#include <errno.h>
#include <fcntl.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <iostream>
#include <string>

#include "module/common/paths.h"
#include "module/mkcert/cert_set.h"
#include "module/mkcert/generation_lock.h"
#include "tools/cert_template.h"
#include "zeph/qlibc_file.h"
#include "zeph/root.h"
#include "zeph/unique_fd.h"

namespace {

constexpr int kExitFailed = 1;
constexpr int kExitUsage = 2;
constexpr char kTempSuffix[] = ".temp";

// Points standard output and error at /dev/null while it lives (children
// inherit that), and back at the originals when it goes.
class QuietOutput {
 public:
  QuietOutput()
      : out_(fcntl(STDOUT_FILENO, F_DUPFD_CLOEXEC, 3)),
        err_(fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 3)) {
    ZEPH::UniqueFd null(open("/dev/null", O_WRONLY | O_CLOEXEC));
    if (null && out_ && err_) {
      dup2(null.get(), STDOUT_FILENO);
      dup2(null.get(), STDERR_FILENO);
    }
  }
  ~QuietOutput() {
    if (out_) dup2(out_.get(), STDOUT_FILENO);
    if (err_) dup2(err_.get(), STDERR_FILENO);
  }
  QuietOutput(const QuietOutput&) = delete;
  QuietOutput& operator=(const QuietOutput&) = delete;

 private:
  ZEPH::UniqueFd out_;
  ZEPH::UniqueFd err_;
};

int Fail(int status, const std::string& message) {
  std::cerr << "mkcert: " << message << std::endl;
  return status;
}

bool IsDirectoryName(const std::string& name) {
  return !name.empty() && name != "." && name != ".." &&
         name.find('/') == std::string::npos;
}

bool EndsWith(const std::string& s, const std::string& suffix) {
  return s.size() > suffix.size() &&
         s.compare(s.size() - suffix.size(), suffix.size(), suffix) == 0;
}

// Makes `dir` (mode 0700) unless it is a directory already.
bool MakeTarget(const std::string& dir, std::string* error) {
  if (mkdir(dir.c_str(), 0700) == 0) return true;
  if (errno == EEXIST && QLIBCFileCheckDir(dir.c_str())) return true;
  *error = "cannot create " + dir + ": " +
           (errno == EEXIST ? std::string("not a directory") : strerror(errno));
  return false;
}

// Removes the files of an earlier set: they are mode 0400, and openssl
// cannot write over them unless it runs as root.
bool RemoveSetFiles(const std::string& dir, std::string* error) {
  for (const char* name :
       {ZEPH::cert::kSetKey, ZEPH::cert::kSetCert, ZEPH::cert::kSetFullchain,
        ZEPH::cert::kSetCaCert, ZEPH::cert::kSetCaKey}) {
    const std::string path = dir + "/" + name;
    if (unlink(path.c_str()) != 0 && errno != ENOENT) {
      *error = "cannot remove " + path + ": " + strerror(errno);
      return false;
    }
  }
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) return Fail(kExitUsage, "usage: mkcert NAME");
  const std::string name = argv[1];
  if (!IsDirectoryName(name)) {
    return Fail(kExitUsage, "invalid certificate name '" + name + "'");
  }
  const std::string archive = ZEPH::RootPath(ZEPH::cert::kArchiveDir);
  if (!QLIBCFileCheckDir(archive.c_str())) {
    return Fail(kExitFailed, "no certificate archive at " + archive);
  }

  std::string error;
  ZEPH::mkcert::CertTemplate set = ZEPH::mkcert::DefaultTemplate();
  if (EndsWith(name, kTempSuffix)) {
    const std::string source =
        archive + "/" + name.substr(0, name.size() - strlen(kTempSuffix));
    const std::string source_cert = source + "/" + ZEPH::cert::kSetCert;
    if (QLIBCFileExist(source_cert.c_str()) &&
        !ZEPH::mkcert::TemplateFromDir(source, &set, &error)) {
      return Fail(kExitFailed, error);
    }
  }

  const std::string target = archive + "/" + name;
  if (!MakeTarget(target, &error) || !RemoveSetFiles(target, &error)) {
    return Fail(kExitFailed, error);
  }
  bool authority_made = false;
  bool server_made = false;
  {
    // The module's generation lock, as CRT create holds it: the work files
    // are shared with every other generation on the appliance.
    ZEPH::cert::GenerationLock lock(
        ZEPH::cert::GenerationLock::Use::kCertificateSet);
    if (!lock.Lock()) {
      return Fail(kExitFailed, "cannot take the generation lock (see the log)");
    }
    QuietOutput quiet;
    authority_made = genCASetOfType(&set.authority, set.authority_type,
                                    set.authority_bits, target) == 0;
    server_made =
        authority_made && genCertSetOfType(&set.server, set.server_type,
                                           set.server_bits, set.aliases,
                                           target) == 0;
  }
  if (!authority_made) {
    return Fail(kExitFailed, "cannot make the certificate authority in " +
                                 target + " (see the log)");
  }
  if (!server_made) {
    return Fail(kExitFailed, "cannot make the server certificate in " + target +
                                 " (see the log)");
  }
  return 0;
}
