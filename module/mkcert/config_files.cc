#include "module/mkcert/config_files.h"

#include <libgen.h>
#include <stdio.h>

#include <vector>

#include "module/common/log.h"
#include "module/common/paths.h"
#include "zeph/qlibc_exec.h"
#include "zeph/qlibc_string.h"
#include "zeph/unique_fd.h"

namespace {

constexpr char kCaExtensions[] =
    "extensions = x509v3\n"
    "[ x509v3 ]\n"
    "subjectAltName   = email:copy\n"
    "basicConstraints = CA:true,pathlen:0\n"
    "nsComment        = \"mod_ssl generated custom CA certificate\"\n"
    "nsCertType       = sslCA\n";

constexpr char kServerExtensionsHead[] =
    "extensions = x509v3\n"
    "[ x509v3 ]\n"
    "subjectAltName   = email:copy\n"
    "nsComment        = \"mod_ssl generated custom server certificate\"\n"
    "nsCertType       = server\n";
constexpr char kRsaKeyUsage[] =
    "keyUsage         = critical, digitalSignature, keyEncipherment\n";
constexpr char kEcKeyUsage[] = "keyUsage         = critical, digitalSignature\n";
constexpr char kServerExtensionsTail[] =
    "extendedKeyUsage = serverAuth, clientAuth\n";

// "e": the stream's descriptor must not leak into the openssl children that
// other threads may be starting at the same time.
ZEPH::UniqueFile OpenForWriting(const char* path) {
  return ZEPH::UniqueFile(fopen(path, "we"));
}

// One "key = 'value'" line of the request configuration, the key padded to
// 32 columns. Empty values give no line.
void WriteDnLine(FILE* f, const char* key, const std::string& value) {
  if (value.empty()) return;
  fprintf(f, "%-32s= '%s'\n", key, value.c_str());
}

}  // namespace

int makeParentDir(const std::string& path) {
  if (path.empty()) {
    MKCERT_LOG("Failed to generate directory with invalid parameters");
    return -1;
  }
  // dirname may modify its argument, so it works on a private copy.
  std::vector<char> copy(path.begin(), path.end());
  copy.push_back('\0');
  const char* dir = dirname(copy.data());
  if (QLIBCExec(ZEPH::cert::kMkdir, "-p", dir, nullptr, nullptr) != 0) {
    MKCERT_LOG("Exec mkdir failed");
    return -1;
  }
  return 0;
}

namespace {

// Makes the parent directory of an extension file and opens the file for
// writing; null, with the failure logged, when either step fails.
ZEPH::UniqueFile MakeExtensionFile(const char* path) {
  if (makeParentDir(path) != 0) {
    MKCERT_LOG("generate directory failed");
    return nullptr;
  }
  ZEPH::UniqueFile f = OpenForWriting(path);
  if (!f) MKCERT_LOG_LIBERR("fopen %s failed", path);
  return f;
}

}  // namespace

int generateCACNF(const char* path) {
  if (path == nullptr || *path == '\0') {
    MKCERT_LOG_LIBERR("CA CNF name is null or empty.");
    return -1;
  }
  ZEPH::UniqueFile f = MakeExtensionFile(path);
  if (!f) return -1;
  fputs(kCaExtensions, f.get());
  return 0;
}

int generateServerCNF(const char* path, QLIBSZLIST* aliases) {
  return generateServerCNF(
      path, aliases, ZEPH::cert::ServerKeyUsage::kSignatureAndEncipherment);
}

int generateServerCNF(const char* path, QLIBSZLIST* aliases,
                      ZEPH::cert::ServerKeyUsage usage) {
  if (path == nullptr || *path == '\0') {
    MKCERT_LOG_LIBERR("Server CNF name is null or empty.");
    return -1;
  }
  if (aliases == nullptr) {
    MKCERT_LOG("alias list is null");
    return -1;
  }
  ZEPH::UniqueFile f = MakeExtensionFile(path);
  if (!f) return -1;
  fputs(kServerExtensionsHead, f.get());
  fputs(usage == ZEPH::cert::ServerKeyUsage::kSignatureOnly ? kEcKeyUsage
                                                            : kRsaKeyUsage,
        f.get());
  fputs(kServerExtensionsTail, f.get());
  // The second subjectAltName key of the section overrides the first one
  // ("email:copy") in the tool; it is written only when there is an alias.
  int written = 0;
  for (int i = 0; i < aliases->count; ++i) {
    const char* alias = QLIBCSzListGet(aliases, i);
    if (alias == nullptr || *alias == '\0') continue;
    fputs(written == 0 ? "subjectAltName = \"" : ", ", f.get());
    fprintf(f.get(), BlQLIBIsIpAddr(alias) == 1 ? "IP:%s" : "DNS:%s", alias);
    ++written;
  }
  if (written > 0) fputs("\"\n", f.get());
  return 0;
}

int modifyCsrCfg(const std::string& cfgPath, _tag_CSR_ARGUMENT* subject) {
  if (cfgPath.empty() || subject == nullptr || SubjectIsInvalid(*subject)) {
    MKCERT_LOG_LIBERR("modifyCsrCfg sanity failed.");
    return -1;
  }
  if (makeParentDir(cfgPath) != 0) {
    MKCERT_LOG("generate directory failed");
    return -1;
  }
  ZEPH::UniqueFile f = OpenForWriting(cfgPath.c_str());
  if (!f) {
    MKCERT_LOG_LIBERR("Open %s failed", cfgPath.c_str());
    return -1;
  }
  fputs("[ req ]\n", f.get());
  fprintf(f.get(), "%-32s= %s\n", "default_bits", "1024");
  fprintf(f.get(), "%-32s= %s\n", "distinguished_name", "req_DN");
  fprintf(f.get(), "%-32s= %s\n", "prompt", "no");
  fputs("[ req_DN ]\n", f.get());
  WriteDnLine(f.get(), "countryName", subject->country);
  WriteDnLine(f.get(), "stateOrProvinceName", subject->state);
  WriteDnLine(f.get(), "localityName", subject->city);
  WriteDnLine(f.get(), "0.organizationName", subject->organization);
  WriteDnLine(f.get(), "organizationalUnitName", subject->department);
  WriteDnLine(f.get(), "commonName", subject->common_name);
  WriteDnLine(f.get(), "emailAddress", subject->email);
  return 0;
}
