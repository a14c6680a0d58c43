// The Let's Encrypt tool's answer (a stand-in script prints the input) to a direct "renew",
// "LetsEncrypt renew" and "create" over "fuzzBB", and the input as an account's info.json for
// "Account list": answers are success or a tool error's code, with a numeric "error" and a "msg".
#include <json/json.h>
#include <stddef.h>
#include <stdint.h>
#include <sys/stat.h>

#include <string>

#include "fuzz/fuzz_support.h"
#include "module/methods/letsencrypt.h"
#include "module/methods/workers.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::fuzz::Die;

std::string AnswerPath() { return ZEPH::fuzz::Root() + "/le-answer"; }
std::string AccountDir() { return ZEPH::fuzz::Root() + "/usr/zeph/etc/letsencrypt/account/fuzz"; }

void Call(void (*handler)(ZEPH::APIRequest*, ZEPH::APIResponse*), const Json::Value& params,
          const char* what) {
  const ZEPH::APIResponse response = ZEPH::fuzz::CallOnce(handler, params, what);
  const int code = response.error_code();
  if (response.outcome() == ZEPH::APIResponse::Outcome::kError &&
      code != 5501 && code != 5503 && (code < 5520 || code > 5530)) {
    Die(std::string(what) + " answered " + std::to_string(code));
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  ZEPH::fuzz::RestoreArchive();
  const std::string tool = ZEPH::fuzz::Root() + "/usr/zeph/sbin/zeph-letsencrypt";
  ZEPH::fuzz::WriteFile(tool, "#!/bin/sh\nexec /bin/cat '" + AnswerPath() + "'\n");
  if (chmod(tool.c_str(), 0755) != 0) Die("cannot install the stand-in tool");
  ZEPH::fuzz::MakeDirs(AccountDir());
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  ZEPH::fuzz::WriteFile(AnswerPath(), data, size);
  ZEPH::fuzz::WriteFile(AccountDir() + "/info.json", data, size);
  const Json::Value answer = RunLetsEncrypt("renew", "-c", "fuzzBB");
  if (!answer.isObject() || !answer["error"].isConvertibleTo(Json::intValue)) {
    Die("answer without a numeric error: " + ZEPH::JsonCompact(answer));
  }
  if (answer["error"].asInt() != 0 && !answer.isMember("msg")) {
    Die("failure without a message: " + ZEPH::JsonCompact(answer));
  }
  Json::Value params;
  params["id"] = "fuzzBB";
  Call(handleLERenew, params, "renew");
  params["domain_name"] = "nas.example";
  params["email"] = "admin@nas.example";
  Call(handleLECreate, params, "create");
  const ZEPH::APIResponse accounts =
      ZEPH::fuzz::CallOnce(handleLEAccountList, Json::Value(Json::objectValue), "account list");
  if (accounts.outcome() != ZEPH::APIResponse::Outcome::kSuccess) Die("account list failed");
  for (const Json::Value& entry : accounts.data()["email"]) {
    if (!entry["contact"].isString() || entry["contact"].asString().empty()) {
      Die("account list passed on a contact that is no text");
    }
  }
  ZEPH::fuzz::RestoreArchive();
  return 0;
}
