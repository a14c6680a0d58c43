// The archive's documents in any state. Input: one byte choosing the document and its
// reader, then its bytes: 0 INFO for "CRT list" and the service look-ups, 1 INFO for the soft
// reset, 2 SERVICES for reset's redeploy, 3 DEFAULT for the fallback to the default. INFO ends
// as written or a JSON object; a sentinel beside the archive ("../" escapes) stays untouched.
#include <json/json.h>
#include <stddef.h>
#include <stdint.h>

#include <string>

#include "fuzz/fuzz_support.h"
#include "module/deploy/deploy.h"
#include "module/deploy/service.h"
#include "module/methods/reset.h"
#include "module/methods/workers.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::fuzz::ArchivePath;
using ZEPH::fuzz::Die;

std::string Sentinel() { return ArchivePath("/../sentinel"); }

void ReadAll(const Json::Value& info) {
  const ZEPH::APIResponse response =
      ZEPH::fuzz::CallOnce(handleCRTList, Json::Value(Json::objectValue), "list");
  if (response.outcome() == ZEPH::APIResponse::Outcome::kError && response.error_code() != 5501) {
    Die("list failed with " + std::to_string(response.error_code()));
  }
  Json::Value service;
  std::string id;
  if (ZEPH::JsonParse(ZEPH::fuzz::WebServiceText(), service)) GetServiceCertID(service, id);
  for (const std::string& name : info.isObject() ? info.getMemberNames() : Json::Value::Members()) {
    Json::Value services;
    GetServiceList(name, services);
  }
}
void CheckInfo(const std::string& written) {
  std::string now;
  Json::Value info;
  if (!ZEPH::fuzz::ReadFile(ArchivePath("/INFO"), &now)) Die("INFO is gone");
  if (now != written && (!ZEPH::JsonParse(now, info) || !info.isObject())) {
    Die("INFO was rewritten into something that is no JSON object");
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  ZEPH::fuzz::RestoreArchive();
  ZEPH::fuzz::WriteFile(Sentinel(), std::string("keep"));
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size < 1) return -1;
  const int mode = data[0] % 4;
  const std::string doc(reinterpret_cast<const char*>(data + 1), size - 1);
  ZEPH::fuzz::RestoreArchive();
  Json::Value info, services(Json::arrayValue), service;
  const char* const docs[] = {"/INFO", "/INFO", "/SERVICES", "/DEFAULT"};
  ZEPH::fuzz::WriteFile(ArchivePath(docs[mode]), doc);
  if (mode == 0) {
    ZEPH::JsonParse(doc, info);
    ReadAll(info);
  } else if (mode == 1 && ZEPH::JsonParse(doc, info)) {
    softReset(info);
  } else if (mode == 2 && ZEPH::JsonFromFile(services, ArchivePath("/SERVICES"))) {
    DeployDefCrt(services, CRT_ACTION_RESET, "");
  } else if (mode == 3) {
    if (ZEPH::JsonParse(ZEPH::fuzz::WebServiceText(), service)) services.append(service);
    GetDefCrtId();
    DeployDefCrt(services, CRT_ACTION_FALLBACK, "fuzzAA");
  }
  if (mode <= 1) CheckInfo(doc);
  std::string sentinel;
  if (!ZEPH::fuzz::ReadFile(Sentinel(), &sentinel) || sentinel != "keep") {
    Die("the sentinel beside the archive was touched");
  }
  return 0;
}
