// Benchmark of "CRT list" on an archive of 1,000 certificates, against a
// bare loop that opens and parses the same "cert.pem" and
// "zeph-ca-cert.pem" files with OpenSSL.
//
//   list_bench [COUNT] [RUNS]     (defaults: 1000 certificates, 11 runs)
//
// The archive is made in-process below a private root: one CA and one
// 1024-bit key shared by every certificate, each certificate signed anew,
// so that each "cert.pem" is a distinct certificate to parse.
#include <openssl/pem.h>
#include <openssl/rsa.h>
#include <openssl/x509v3.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <time.h>

#include <algorithm>
#include <cstdio>
#include <string>
#include <vector>

#include "bench/common/bench_util.h"
#include "module/common/ssl_ptr.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_exec.h"
#include "zeph/root.h"
#include "zeph/unique_fd.h"

namespace {

using ZEPH::bench::Median;
using ZEPH::bench::Now;
using ZEPH::ssl::EvpPkeyPtr;
using ZEPH::ssl::X509Ptr;

EvpPkeyPtr MakeKey() {
  EvpPkeyPtr key(EVP_PKEY_new());
  RSA* rsa = RSA_new();
  BIGNUM* e = BN_new();
  BN_set_word(e, RSA_F4);
  RSA_generate_key_ex(rsa, 1024, e, nullptr);
  BN_free(e);
  EVP_PKEY_assign_RSA(key.get(), rsa);
  return key;
}

X509Ptr MakeCert(const std::string& cn, long serial, EVP_PKEY* key,
                 X509* issuer, EVP_PKEY* issuer_key) {
  X509Ptr cert(X509_new());
  X509_set_version(cert.get(), 2);
  ASN1_INTEGER_set(X509_get_serialNumber(cert.get()), serial);
  X509_gmtime_adj(X509_getm_notBefore(cert.get()), 0);
  X509_gmtime_adj(X509_getm_notAfter(cert.get()), 366L * 86400);
  X509_set_pubkey(cert.get(), key);
  X509_NAME* name = X509_get_subject_name(cert.get());
  X509_NAME_add_entry_by_txt(name, "C", MBSTRING_ASC,
                             reinterpret_cast<const unsigned char*>("TW"), -1, -1, 0);
  X509_NAME_add_entry_by_txt(name, "CN", MBSTRING_ASC,
                             reinterpret_cast<const unsigned char*>(cn.c_str()), -1, -1, 0);
  X509_set_issuer_name(cert.get(), issuer ? X509_get_subject_name(issuer) : name);
  X509V3_CTX ctx;
  X509V3_set_ctx(&ctx, issuer ? issuer : cert.get(), cert.get(), nullptr, nullptr, 0);
  const std::string san = "DNS:" + cn + ",IP:10.0.0.1";
  X509_EXTENSION* ext =
      X509V3_EXT_conf_nid(nullptr, &ctx, NID_subject_alt_name, san.c_str());
  X509_add_ext(cert.get(), ext, -1);
  X509_EXTENSION_free(ext);
  X509_sign(cert.get(), issuer_key, EVP_sha256());
  return cert;
}

void WritePem(const std::string& path, X509* cert) {
  ZEPH::UniqueFile f(fopen(path.c_str(), "we"));
  PEM_write_X509(f.get(), cert);
}

void WriteKey(const std::string& path, EVP_PKEY* key) {
  ZEPH::UniqueFile f(fopen(path.c_str(), "we"));
  PEM_write_PrivateKey(f.get(), key, nullptr, nullptr, 0, nullptr, nullptr);
}

std::vector<std::string> MakeArchive(int count) {
  const std::string archive = ZEPH::RootPath("/usr/zeph/etc/certificate/_archive");
  EvpPkeyPtr ca_key = MakeKey();
  X509Ptr ca = MakeCert("Bench CA", 1, ca_key.get(), nullptr, ca_key.get());
  EvpPkeyPtr key = MakeKey();
  Json::Value info(Json::objectValue);
  std::vector<std::string> ids;
  for (int i = 0; i < count; ++i) {
    char id[16];
    snprintf(id, sizeof(id), "b%05d", i);
    const std::string dir = archive + "/" + id;
    mkdir(dir.c_str(), 0700);
    X509Ptr cert = MakeCert(std::string("host") + std::to_string(i) + ".example",
                            i + 2, key.get(), ca.get(), ca_key.get());
    WritePem(dir + "/cert.pem", cert.get());
    WritePem(dir + "/fullchain.pem", cert.get());
    WriteKey(dir + "/privkey.pem", key.get());
    WritePem(dir + "/zeph-ca-cert.pem", ca.get());
    info[id]["desc"] = "bench";
    info[id]["services"] = Json::Value(Json::arrayValue);
    info[id]["user_deletable"] = true;
    ids.push_back(id);
  }
  ZEPH::JsonToFile(info, archive + "/INFO", true);
  return ids;
}

// What the list must do at the least: parse both PEM files of every
// certificate.
void BareParse(const std::vector<std::string>& ids) {
  const std::string archive = ZEPH::RootPath("/usr/zeph/etc/certificate/_archive");
  for (const std::string& id : ids) {
    for (const char* name : {"/cert.pem", "/zeph-ca-cert.pem"}) {
      ZEPH::UniqueFile f(fopen((archive + "/" + id + name).c_str(), "re"));
      X509Ptr cert(PEM_read_X509(f.get(), nullptr, nullptr, nullptr));
      if (!cert) abort();
    }
  }
}

size_t CallList() {
  const ZEPH::APIResponse r =
      ZEPH::bench::Call("ZEPH.Core.Certificate.CRT", "list", Json::Value(Json::objectValue));
  return r.data()["certificates"].size();
}

}  // namespace

int main(int argc, char** argv) {
  const int count = argc > 1 ? atoi(argv[1]) : 1000;
  const int runs = argc > 2 ? atoi(argv[2]) : 11;
  ZEPH::bench::BenchRoot root("list_bench");
  const std::vector<std::string> ids = MakeArchive(count);
  if (CallList() != ids.size()) {
    fprintf(stderr, "list did not answer every certificate\n");
    return 1;
  }
  std::vector<double> list_times, bare_times;
  for (int i = 0; i < runs; ++i) {
    double t = Now();
    CallList();
    list_times.push_back(Now() - t);
    t = Now();
    BareParse(ids);
    bare_times.push_back(Now() - t);
  }
  const double list = Median(list_times), bare = Median(bare_times);
  printf("certificates: %d, runs: %d\n", count, runs);
  printf("list (module):      median %.1f ms\n", list * 1000);
  printf("bare PEM parse:     median %.1f ms\n", bare * 1000);
  printf("ratio list / bare:  %.2f (target <= 1.50)\n", list / bare);
  const std::string name = "list " + std::to_string(count);
  ZEPH::bench::Result(name, "CRT list, median", list * 1000, "ms");
  ZEPH::bench::Result(name, "bare PEM parse, median", bare * 1000, "ms");
  ZEPH::bench::Result(name, "ratio (target <= 1.50)", list / bare, "x");
  return 0;
}
