// Uploaded PEM files. Input: key, certificate and intermediates, split by NUL bytes. They go
// through the import's content checks, the list's certificate reader, the request check of
// "CSR sign" and the full-chain builder; an accepted set is imported over "fuzzBB", and the
// files are planted in "fuzzBB" for a "CRT list". Every answer must be a documented one.
#include <json/json.h>
#include <stddef.h>
#include <stdint.h>
#include <unistd.h>

#include <algorithm>
#include <string>

#include "fuzz/fuzz_support.h"
#include "module/methods/cert_info.h"
#include "module/methods/workers.h"
#include "module/upload/full_chain.h"
#include "module/upload/sslca_form_handler.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::fuzz::ArchivePath;
using ZEPH::fuzz::Die;
using ZEPH::fuzz::WriteFile;

constexpr int kSuccess = 5502;

std::string Upload(const std::string& name) { return ZEPH::fuzz::Root() + "/upload/" + name; }

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
// The full chain is the files' bytes, each ended by a line feed.
void BuildChain(const std::string& cert, const std::string& inter) {
  const std::string dir = ZEPH::fuzz::Root() + "/chain";
  for (const char* name : {"/chain.pem", "/fullchain.pem"}) unlink((dir + name).c_str());
  WriteFile(dir + "/cert.pem", cert);
  if (!inter.empty()) WriteFile(dir + "/chain.pem", inter);
  if (!genChainCRT(dir)) Die("full chain not built from readable files");
  std::string chain;
  ZEPH::fuzz::ReadFile(dir + "/fullchain.pem", &chain);
  auto ended = [](const std::string& s) { return s.empty() || s.back() == '\n' ? s : s + "\n"; };
  if (chain != ended(cert) + (inter.empty() ? "" : ended(inter))) {
    Die("full chain differs from its parts");
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  ZEPH::fuzz::RestoreArchive();
  ZEPH::fuzz::MakeDirs(ZEPH::fuzz::Root() + "/upload");
  ZEPH::fuzz::MakeDirs(ZEPH::fuzz::Root() + "/chain");
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string all(reinterpret_cast<const char*>(data), size);
  std::string key, cert, inter;
  std::string* parts[] = {&key, &cert, &inter};
  for (size_t i = 0, start = 0; i < 3 && start <= all.size(); ++i) {
    const size_t end = i < 2 ? std::min(all.find('\0', start), all.size()) : all.size();
    *parts[i] = all.substr(start, end - start);
    start = end + 1;
  }
  for (const auto& [name, text] : {std::pair{"key", key}, {"cert", cert}, {"inter_cert", inter}}) {
    WriteFile(Upload(name), text);
  }
  ReadCertificates(Upload("cert"));
  ReadCertificates(Upload("inter_cert"));
  const int csr = SSLCAFormHandler::checkCSRFormat(Upload("inter_cert"));
  if (csr != kSuccess && csr != 5501) Die("CSR check answered " + std::to_string(csr));
  BuildChain(cert, inter);
  // The import then sees the files as the check left them (byte-order marks stripped).
  const int rc = SSLCAFormHandler::checkCAContent(
      Upload("cert").c_str(), Upload("key").c_str(),
      inter.empty() ? nullptr : Upload("inter_cert").c_str());
  if (rc != kSuccess && rc != 5511 && rc != 5514 && rc != 5517 && rc != 5518) {
    Die("content check answered " + std::to_string(rc));
  }
  if (rc == kSuccess) {
    Json::Value params, info;
    params["id"] = "fuzzBB";
    params["desc"] = "imported";
    params["key_tmp"] = Upload("key");
    params["cert_tmp"] = Upload("cert");
    if (!inter.empty()) params["inter_cert_tmp"] = Upload("inter_cert");
    ZEPH::APIRequest request(params);
    ZEPH::APIResponse response;
    SSLCAFormHandler().ProcessJsonReq(&request, &response);
    if (response.outcome_count() != 1) Die("import wrote no single outcome");
    if (!ZEPH::JsonFromFile(info, ArchivePath("/INFO")) || !info.isMember("fuzzBB")) {
      Die("import lost the catalogue entry it replaced");
    }
  }
  WriteFile(ArchivePath("/fuzzBB/cert.pem"), cert);
  WriteFile(ArchivePath("/fuzzBB/zeph-ca-cert.pem"), inter);
  if (ZEPH::fuzz::CallOnce(handleCRTList, Json::Value(Json::objectValue), "list").outcome() !=
      ZEPH::APIResponse::Outcome::kSuccess) {
    Die("list failed over one damaged certificate");
  }
  ZEPH::fuzz::RestoreArchive();
  return 0;
}
