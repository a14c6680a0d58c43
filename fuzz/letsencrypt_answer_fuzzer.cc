// What the Let's Encrypt tool prints, and the account files it leaves.
//
// The tool in the fuzz root is a shell script that prints the input. Each
// input is the answer to a "renew" run directly, to "LetsEncrypt renew" and
// "LetsEncrypt create" (replacing "fuzzBB"), and it is also an account's
// "info.json" for "LetsEncrypt.Account list". Whatever the tool says, the
// module must answer success or one of the codes a tool error maps to, and
// the answer object it passes on always has a numeric "error" and, when that
// is not 0, a "msg".
#include <json/json.h>
#include <stddef.h>
#include <stdint.h>
#include <sys/stat.h>

#include <string>

#include "fuzz/fuzz_support.h"
#include "module/methods/letsencrypt.h"
#include "module/methods/workers.h"
#include "zeph/api.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::fuzz::Die;

std::string AnswerPath() { return ZEPH::fuzz::Root() + "/le-answer"; }
std::string AccountInfo() {
  return ZEPH::fuzz::Root() + "/usr/zeph/etc/letsencrypt/account/fuzz/info.json";
}

bool IsToolCode(int code) {
  return code == 5501 || code == 5503 || (code >= 5520 && code <= 5530);
}

void CheckAnswer(const Json::Value& answer) {
  if (!answer.isObject() || !answer["error"].isConvertibleTo(Json::intValue)) {
    Die("answer without a numeric error: " + ZEPH::JsonCompact(answer));
  }
  if (answer["error"].asInt() != 0 && !answer.isMember("msg")) {
    Die("failure without a message: " + ZEPH::JsonCompact(answer));
  }
}

void Call(void (*handler)(ZEPH::APIRequest*, ZEPH::APIResponse*),
          const Json::Value& params, const char* what) {
  ZEPH::APIRequest request(params);
  ZEPH::APIResponse response;
  handler(&request, &response);
  if (response.outcome_count() != 1) Die(std::string(what) + " wrote no single outcome");
  if (response.outcome() == ZEPH::APIResponse::Outcome::kError &&
      !IsToolCode(response.error_code())) {
    Die(std::string(what) + " answered " + std::to_string(response.error_code()));
  }
}

void ListAccounts() {
  ZEPH::APIRequest request;
  ZEPH::APIResponse response;
  handleLEAccountList(&request, &response);
  if (response.outcome() != ZEPH::APIResponse::Outcome::kSuccess) {
    Die("account list failed");
  }
  for (const Json::Value& entry : response.data()["email"]) {
    if (!entry["contact"].isString() || entry["contact"].asString().empty()) {
      Die("account list passed on a contact that is no text");
    }
  }
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  ZEPH::fuzz::RestoreArchive();
  const std::string tool = ZEPH::fuzz::Root() + "/usr/zeph/sbin/zeph-letsencrypt";
  ZEPH::fuzz::WriteFile(tool, "#!/bin/sh\nexec /bin/cat '" + AnswerPath() + "'\n");
  const std::string account_dir = ZEPH::fuzz::Root() + "/usr/zeph/etc/letsencrypt/account/fuzz";
  const char* argv[] = {"/bin/mkdir", "-p", account_dir.c_str(), nullptr};
  if (chmod(tool.c_str(), 0755) != 0 || !ZEPH::fuzz::RunQuietly(argv)) {
    Die("cannot install the stand-in tool");
  }
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  ZEPH::fuzz::WriteFile(AnswerPath(), data, size);
  ZEPH::fuzz::WriteFile(AccountInfo(), data, size);

  CheckAnswer(RunLetsEncrypt("renew", "-c", "fuzzBB"));
  Json::Value renew;
  renew["id"] = "fuzzBB";
  Call(handleLERenew, renew, "renew");
  Json::Value create;
  create["id"] = "fuzzBB";
  create["domain_name"] = "nas.example";
  create["email"] = "admin@nas.example";
  Call(handleLECreate, create, "create");
  ListAccounts();
  ZEPH::fuzz::RestoreArchive();
  return 0;
}
