// The PEM files a user uploads for an import, and the certificate files
// that "CRT list" reads back from the archive.
//
// Input: the private key, the certificate and the intermediate
// certificate(s), separated by NUL bytes (missing parts are empty). Each
// input goes through the import's content checks, the certificate reader
// of the list, the request check of "CSR sign" and the full-chain
// builder; a set the checks accept is imported over "fuzzBB", and the
// certificate and intermediate are also planted in "fuzzBB" for a
// "CRT list". Every answer must be one its reader documents.
#include <json/json.h>
#include <stddef.h>
#include <stdint.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "fuzz/fuzz_support.h"
#include "module/methods/cert_info.h"
#include "module/methods/workers.h"
#include "module/upload/full_chain.h"
#include "module/upload/sslca_form_handler.h"
#include "zeph/api.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::fuzz::ArchivePath;
using ZEPH::fuzz::Die;

constexpr int kSuccess = 5502;

struct Parts {
  std::string key, cert, inter;
};

Parts Split(const uint8_t* data, size_t size) {
  const std::string all(reinterpret_cast<const char*>(data), size);
  Parts p;
  std::string* slots[] = {&p.key, &p.cert, &p.inter};
  size_t start = 0;
  for (int i = 0; i < 3; ++i) {
    const size_t end = i < 2 ? all.find('\0', start) : std::string::npos;
    *slots[i] = all.substr(start, end == std::string::npos ? std::string::npos
                                                           : end - start);
    if (end == std::string::npos) break;
    start = end + 1;
  }
  return p;
}

std::string Upload(const std::string& name) {
  return ZEPH::fuzz::Root() + "/upload/" + name;
}

void ReadCertificates(const std::string& path) {
  Json::Value params;
  params["additional"].append("valid_from");
  params["additional"].append("valid_till");
  ZEPH::APIRequest request(params);
  Json::Value out(Json::arrayValue);
  const int rc = getCertificateInfo(path, out, &request);
  if (rc != 0 && rc != 3) Die("certificate reader answered " + std::to_string(rc));
  if (rc == 0 && out.empty()) Die("certificate reader found nothing but said so");
  for (const Json::Value& c : out) {
    if (!c["subject"].isObject() || !c["issuer"].isObject() || !c["type"].isString()) {
      Die("certificate reader gave an incomplete entry: " + ZEPH::JsonCompact(c));
    }
  }
}

int CheckContent(const Parts& p) {
  const int rc = SSLCAFormHandler::checkCAContent(
      Upload("cert").c_str(), Upload("key").c_str(),
      p.inter.empty() ? nullptr : Upload("inter_cert").c_str());
  if (rc != kSuccess && rc != 5511 && rc != 5514 && rc != 5517 && rc != 5518) {
    Die("content check answered " + std::to_string(rc));
  }
  return rc;
}

void BuildChain(const Parts& p) {
  const std::string dir = ZEPH::fuzz::Root() + "/chain";
  for (const char* name : {"/cert.pem", "/chain.pem", "/fullchain.pem"}) {
    unlink((dir + name).c_str());
  }
  ZEPH::fuzz::WriteFile(dir + "/cert.pem", p.cert);
  if (!p.inter.empty()) ZEPH::fuzz::WriteFile(dir + "/chain.pem", p.inter);
  if (!genChainCRT(dir)) Die("full chain not built from readable files");
  std::string chain;
  ZEPH::fuzz::ReadFile(dir + "/fullchain.pem", &chain);
  // Each file contributes its bytes, with a line feed added where missing.
  auto ended = [](const std::string& s) {
    return s.empty() || s.back() == '\n' ? s : s + "\n";
  };
  if (chain != ended(p.cert) + (p.inter.empty() ? "" : ended(p.inter))) {
    Die("full chain differs from its parts");
  }
}

void ImportOverExisting(bool with_inter) {
  Json::Value params;
  params["id"] = "fuzzBB";
  params["desc"] = "imported";
  params["key_tmp"] = Upload("key");
  params["cert_tmp"] = Upload("cert");
  if (with_inter) params["inter_cert_tmp"] = Upload("inter_cert");
  ZEPH::APIRequest request(params);
  ZEPH::APIResponse response;
  SSLCAFormHandler handler;
  handler.ProcessJsonReq(&request, &response);
  if (response.outcome_count() != 1) Die("import wrote no single outcome");
  Json::Value info;
  if (!ZEPH::JsonFromFile(info, ArchivePath("/INFO")) || !info.isMember("fuzzBB")) {
    Die("import lost the catalogue entry it replaced");
  }
}

void ListPlanted(const Parts& p) {
  ZEPH::fuzz::WriteFile(ArchivePath("/fuzzBB/cert.pem"), p.cert);
  ZEPH::fuzz::WriteFile(ArchivePath("/fuzzBB/zeph-ca-cert.pem"), p.inter);
  ZEPH::APIRequest request;
  ZEPH::APIResponse response;
  handleCRTList(&request, &response);
  if (response.outcome() != ZEPH::APIResponse::Outcome::kSuccess) {
    Die("list failed over one damaged certificate");
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  ZEPH::fuzz::RestoreArchive();
  for (const char* dir : {"/upload", "/chain"}) {
    if (mkdir((ZEPH::fuzz::Root() + dir).c_str(), 0700) != 0) Die("cannot make " + std::string(dir));
  }
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const Parts p = Split(data, size);
  ZEPH::fuzz::WriteFile(Upload("key"), p.key);
  ZEPH::fuzz::WriteFile(Upload("cert"), p.cert);
  ZEPH::fuzz::WriteFile(Upload("inter_cert"), p.inter);
  ReadCertificates(Upload("cert"));
  ReadCertificates(Upload("inter_cert"));
  const int csr = SSLCAFormHandler::checkCSRFormat(Upload("inter_cert"));
  if (csr != kSuccess && csr != 5501) Die("CSR check answered " + std::to_string(csr));
  BuildChain(p);
  // The content check strips byte-order marks in place: the import sees
  // the files as they are now, as it would after its own check.
  const bool accepted = CheckContent(p) == kSuccess;
  if (accepted) ImportOverExisting(!p.inter.empty());
  ListPlanted(p);
  ZEPH::fuzz::RestoreArchive();
  return 0;
}
