#include "module/mkcert/generate.h"

#include <errno.h>
#include <stdio.h>
#include <string.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <vector>

#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/mkcert/config_files.h"
#include "zeph/qlibc_exec.h"
#include "zeph/qlibc_file.h"
#include "zeph/qlibc_string.h"
#include "zeph/root.h"
#include "zeph/unique_fd.h"

namespace {

// Wait for the tool, no descriptors but 0-2, stdin and outputs on
// /dev/null, default signal handling: the key and request runs are silent.
constexpr int kQuietRun = 0xBB;

// Null-terminated argument vector of owned copies, freed on every path.
class ArgVector {
 public:
  explicit ArgVector(std::vector<std::string> args) : args_(std::move(args)) {
    for (std::string& a : args_) argv_.push_back(&a[0]);
    argv_.push_back(nullptr);
  }
  char* const* argv() const { return argv_.data(); }

 private:
  std::vector<std::string> args_;
  std::vector<char*> argv_;
};

bool Exists(const std::string& path) {
  return QLIBCFileExist(path.c_str()) != 0;
}

// The products of earlier runs are mode 0400: openssl, unless it runs as
// root, cannot write over them, so a product is removed before the run
// that makes it anew.
bool ClearOutput(const std::string& path) {
  if (unlink(path.c_str()) == 0 || errno == ENOENT) return true;
  MKCERT_LOG("Failed to remove %s [%d]", path.c_str(), errno);
  return false;
}

// A failed run may leave an empty or partial output behind; it must not
// be taken for a product (an export would hand it out).
void DiscardOutput(const std::string& path) { unlink(path.c_str()); }

// genCrt with the keyUsage line of a server extension file chosen.
int GenCrt(const std::string& cfgPath, const std::string& csrPath,
           const std::string& caCrtPath, const std::string& serialPath,
           const std::string& outPath, const std::string& keyPath,
           bool selfSign, int days, const std::string& aliases,
           ZEPH::cert::ServerKeyUsage usage);

}  // namespace

int genKey(const std::string& keyPath, unsigned int bits) {
  // openssl makes keys of any length it is given; one of 100000 bits takes
  // many minutes of a request's time, and a negative length from a request
  // arrives here as a huge one. Beyond this nothing is useful.
  if (keyPath.empty() || bits == 0 || bits > kMaxKeyBits) {
    MKCERT_LOG("Failed to genKey with invalid parameters");
    return -1;
  }
  if (makeParentDir(keyPath) != 0) {
    MKCERT_LOG("Failed to generate directory for %s", keyPath.c_str());
    return -1;
  }
  if (!ClearOutput(keyPath)) return -1;
  const std::string bitsText = std::to_string(bits);
  if (QLIBCExecl(ZEPH::cert::kOpenssl, kQuietRun, "genrsa", "-rand",
                 "/dev/urandom", "-out", keyPath.c_str(), bitsText.c_str(),
                 nullptr) != 0) {
    MKCERT_LOG("Error when execute");
    DiscardOutput(keyPath);
    return -1;
  }
  if (chmod(keyPath.c_str(), 0400) != 0) {
    MKCERT_LOG("chmod %s failed with %d", keyPath.c_str(), errno);
    return -1;
  }
  return 0;
}

int genKeyOfType(const std::string& keyPath, ZEPH::cert::KeyType type,
                 unsigned int bits) {
  if (type == ZEPH::cert::KeyType::kRsa) return genKey(keyPath, bits);
  if (keyPath.empty()) {
    MKCERT_LOG("Failed to genKey with invalid parameters");
    return -1;
  }
  if (makeParentDir(keyPath) != 0) {
    MKCERT_LOG("Failed to generate directory for %s", keyPath.c_str());
    return -1;
  }
  if (!ClearOutput(keyPath)) return -1;
  const char* curve = type == ZEPH::cert::KeyType::kEc384
                          ? "ec_paramgen_curve:P-384"
                          : "ec_paramgen_curve:P-256";
  if (QLIBCExecl(ZEPH::cert::kOpenssl, kQuietRun, "genpkey", "-algorithm",
                 "EC", "-pkeyopt", curve, "-out", keyPath.c_str(),
                 nullptr) != 0) {
    MKCERT_LOG("Error when execute");
    DiscardOutput(keyPath);
    return -1;
  }
  if (chmod(keyPath.c_str(), 0400) != 0) {
    MKCERT_LOG("chmod %s failed with %d", keyPath.c_str(), errno);
    return -1;
  }
  return 0;
}

int genCsr(const std::string& cfgPath, const std::string& keyPath,
           const std::string& csrPath, _tag_CSR_ARGUMENT* subject) {
  if (cfgPath.empty() || keyPath.empty() || csrPath.empty() ||
      subject == nullptr) {
    MKCERT_LOG("Failed to generate csr with invalid paramters");
    return -1;
  }
  if (!Exists(keyPath)) {
    MKCERT_LOG("Key is not existed");
    return -1;
  }
  if (makeParentDir(csrPath) != 0) {
    MKCERT_LOG("Failed to generate directory for %s", csrPath.c_str());
    return -1;
  }
  if (modifyCsrCfg(cfgPath, subject) != 0) {
    MKCERT_LOG("Failed to generate csr config file failed");
    return -1;
  }
  if (!ClearOutput(csrPath)) return -1;
  // Subject values arrive as UTF-8. Without -utf8 the tool takes each byte
  // for a character of its own and stores every non-ASCII letter twice
  // encoded; ASCII subjects come out the same either way, and are made
  // with the plain command line.
  const char* utf8 = SubjectIsAscii(*subject) ? nullptr : "-utf8";
  if (QLIBCExecl(ZEPH::cert::kOpenssl, kQuietRun, "req", "-config",
                 cfgPath.c_str(), "-new",
                 ZEPH::cert::SigningDigestOption(keyPath), "-key",
                 keyPath.c_str(),
                 "-out", csrPath.c_str(), utf8, nullptr) != 0) {
    MKCERT_LOG("Create CSR failed, command");
    DiscardOutput(csrPath);
    return -1;
  }
  if (chmod(csrPath.c_str(), 0400) != 0) {
    MKCERT_LOG("Failed to chmod %s [%d]", csrPath.c_str(), errno);
    return -1;
  }
  return 0;
}

int genCrt(const std::string& cfgPath, const std::string& csrPath,
           const std::string& caCrtPath, const std::string& serialPath,
           const std::string& outPath, const std::string& keyPath,
           bool selfSign, int days, const std::string& aliases) {
  return GenCrt(cfgPath, csrPath, caCrtPath, serialPath, outPath, keyPath,
                selfSign, days, aliases,
                ZEPH::cert::ServerKeyUsage::kSignatureAndEncipherment);
}

namespace {

int GenCrt(const std::string& cfgPath, const std::string& csrPath,
           const std::string& caCrtPath, const std::string& serialPath,
           const std::string& outPath, const std::string& keyPath,
           bool selfSign, int days, const std::string& aliases,
           ZEPH::cert::ServerKeyUsage usage) {
  if (cfgPath.empty() || csrPath.empty() || caCrtPath.empty() ||
      keyPath.empty() || days < 1 || HasLineBreak(aliases)) {
    MKCERT_LOG("genCrt params invalid");
    return -1;
  }
  if (!Exists(csrPath)) {
    MKCERT_LOG("Csr is not existed");
    return -1;
  }
  if (!Exists(keyPath)) {
    MKCERT_LOG("Key is not existed");
    return -1;
  }

  std::string output;
  if (selfSign) {
    output = caCrtPath;
    generateCACNF(cfgPath.c_str());
  } else {
    if (serialPath.empty() || outPath.empty()) {
      MKCERT_LOG("genCrt params invalid");
      return -1;
    }
    if (!Exists(serialPath)) {
      MKCERT_LOG("Serial file is not existed");
      return -1;
    }
    output = outPath;
    // Failures of the alias list and of the extension file are logged and
    // otherwise left to show as the tool's failure: the run goes ahead.
    ZEPH::UniqueSzList list(QLIBCSzListAlloc(512));
    if (!list) {
      MKCERT_LOG("Out of memory!! size=512");
    } else if (QLIBCStrSep(aliases.c_str(), ";", list.get()) != 0) {
      MKCERT_LOG("String separate failed.");
    }
    generateServerCNF(cfgPath.c_str(), list.get(), usage);
  }

  if (makeParentDir(output) != 0) {
    MKCERT_LOG("generate directory failed");
    return -1;
  }
  std::vector<std::string> args = {ZEPH::cert::kOpenssl,
                                   "x509",
                                   "-extfile",
                                   cfgPath,
                                   "-days",
                                   std::to_string(days),
                                   "-in",
                                   csrPath,
                                   "-req",
                                   ZEPH::cert::SigningDigestOption(keyPath),
                                   "-out"};
  if (selfSign) {
    args.insert(args.end(), {caCrtPath, "-signkey", keyPath});
  } else {
    args.insert(args.end(), {outPath, "-CAserial", serialPath, "-CA", caCrtPath,
                             "-CAkey", keyPath});
  }
  if (!ClearOutput(output)) return -1;
  ArgVector argv(std::move(args));
  if (QLIBCExecv(argv.argv()[0], argv.argv(), 1) != 0) {
    MKCERT_LOG("Error when execute");
    DiscardOutput(output);
    return -1;
  }
  if (chmod(output.c_str(), 0400) < 0) {
    MKCERT_LOG("chmod(%s) failed", output.c_str());
    return -1;
  }
  return 0;
}

}  // namespace

int genServerCrt(const std::string& csrPath, const std::string& caCrtPath,
                 const std::string& outPath, const std::string& caKeyPath,
                 int days, const std::string& aliases) {
  return genServerCrt(csrPath, caCrtPath, outPath, caKeyPath, days, aliases,
                      ZEPH::cert::ServerKeyUsage::kSignatureAndEncipherment);
}

int genServerCrt(const std::string& csrPath, const std::string& caCrtPath,
                 const std::string& outPath, const std::string& caKeyPath,
                 int days, const std::string& aliases,
                 ZEPH::cert::ServerKeyUsage usage) {
  const std::string serial = ZEPH::RootPath(ZEPH::cert::kSerialFile);
  if (!Exists(serial) && genSerial() != 0) return -1;
  return GenCrt(ZEPH::RootPath(ZEPH::cert::kServerCrtCfg), csrPath, caCrtPath,
                serial, outPath, caKeyPath, false, days, aliases, usage);
}

int genCACrt(const std::string& caCrtPath, const std::string& caKeyPath) {
  return genCrt(ZEPH::RootPath(ZEPH::cert::kCaCrtCfg),
                ZEPH::RootPath(ZEPH::cert::kCaCsr), caCrtPath, "", "",
                caKeyPath, true, 366, "");
}

int genSerial() {
  char address[32];
  char serial[32];
  memset(address, 0, sizeof(address));
  memset(serial, 0, sizeof(serial));

  ZEPH::UniqueFile in(
      fopen(ZEPH::RootPath(ZEPH::cert::kMacAddressFile).c_str(), "re"));
  if (!in) {
    MKCERT_LOG("Open /proc/sys/kernel/zeph_mac_address1 failed");
    return -1;
  }
  if (fscanf(in.get(), "%31s", address) != 1) {
    MKCERT_LOG("Fetch /proc/sys/kernel/zeph_mac_address1 failed");
    return -1;
  }
  // The first eight characters of the address are skipped on purpose: the
  // time makes the number fresh, the tail of the address tells apart
  // appliances of one series that make their authority in the same second.
  const char* tail = strlen(address) > 8 ? address + 8 : "";
  snprintf(serial, sizeof(serial), "%lld%s",
           static_cast<long long>(time(nullptr)), tail);

  ZEPH::UniqueFile out(
      fopen(ZEPH::RootPath(ZEPH::cert::kSerialFile).c_str(), "we"));
  if (!out) {
    MKCERT_LOG("Open /usr/zeph/etc/ssl/.mkcert.serial failed");
    return -1;
  }
  fputs(serial, out.get());
  if (strlen(serial) % 2 != 0) fputc('1', out.get());
  return 0;
}
