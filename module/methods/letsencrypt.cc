// The Let's Encrypt tool protocol and the LetsEncrypt methods.
#include "module/methods/letsencrypt.h"

#include <errno.h>
#include <glob.h>
#include <stdlib.h>
#include <unistd.h>

#include <memory>
#include <string>

#include "module/archive/cert_id.h"
#include "module/archive/dir_ops.h"
#include "module/common/log.h"
#include "module/common/paths.h"
#include "module/deploy/deploy.h"
#include "module/methods/action_log.h"
#include "module/methods/properties.h"
#include "module/methods/workers.h"
#include "zeph/json_file.h"
#include "zeph/qlibc_exec.h"
#include "zeph/root.h"

namespace {

constexpr int kSuccess = 5502;
constexpr int kGeneralFailure = 5501;
constexpr int kInvalidParams = 5503;
constexpr int kToolFailed = 1;

struct ToolStream {
  FILE* stream;
  ~ToolStream() { QLIBCPclose(stream); }  // accepts null
};

struct LineBuffer {
  char* data = nullptr;
  size_t size = 0;
  ~LineBuffer() { free(data); }
};

// The tool's whole standard output.
std::string ReadAll(FILE* stream) {
  LineBuffer line;
  std::string text;
  ssize_t n;
  while ((n = getdelim(&line.data, &line.size, '\n', stream)) > 0) {
    text.append(line.data, static_cast<size_t>(n));
  }
  return text;
}

Json::Value ToolError(const std::string& msg) {
  Json::Value answer(Json::objectValue);
  answer["error"] = kToolFailed;
  answer["msg"] = msg;
  return answer;
}

std::string StringParam(ZEPH::APIRequest* request, const char* name) {
  const Json::Value v = request->GetParam(name, "");
  return v.isString() ? v.asString() : "";
}

bool BoolParam(ZEPH::APIRequest* request, const char* name, bool fallback) {
  const Json::Value v = request->GetParam(name, fallback);
  return v.isBool() ? v.asBool() : fallback;
}

// "error" as an integer: null and false read as 0, as the JSON library
// converts them; a text or a structure is no number at all.
int ErrorNumber(const Json::Value& answer) {
  const Json::Value& e = answer["error"];
  if (e.isConvertibleTo(Json::intValue)) return e.asInt();
  return kToolFailed;
}

// The tool's answer is parsed leniently: comments are skipped and whatever
// follows the first JSON value is ignored.
bool ParseAnswer(const std::string& text, Json::Value& answer) {
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  std::string errors;
  return reader->parse(text.data(), text.data() + text.size(), &answer, &errors);
}

std::string Message(const Json::Value& answer) {
  const Json::Value& m = answer["msg"];
  return m.isString() ? m.asString() : ZEPH::JsonCompact(m);
}

struct CreateState {
  int code = kGeneralFailure;
  Json::Value error_data;  // null, as for every error of old
  bool replace = false;
  std::string id;
  std::string target;
  std::string work_dir;
  Json::Value data{Json::objectValue};
};

void CreateLe(ZEPH::APIRequest* request, ZEPH::APIResponse* response,
              CreateState& s) {
  const bool as_default = BoolParam(request, "as_default", false);
  const bool user_deletable = BoolParam(request, "user_deletable", true);
  const std::string given_id = StringParam(request, "id");
  const std::string desc = StringParam(request, "desc");
  const std::string domain = StringParam(request, "domain_name");
  const std::string email = StringParam(request, "email");
  if (domain.empty()) {
    s.code = kInvalidParams;
    return;
  }
  if (!given_id.empty()) {
    if (!IsCrtIdValid(given_id)) {
      CERT_LOG("%s is not a valid cert id", given_id.c_str());
      s.code = kInvalidParams;
      return;
    }
    s.replace = true;
    s.id = given_id;
    s.target = ZEPH::cert::CrtDir(given_id);
  } else {
    std::string made_id;
    if (!ZEPH::cert::MakeCrtDir(s.target, made_id)) {
      CERT_LOG("Failed to create a temp directory.");
      return;
    }
    s.id = GetCrtId(s.target);
  }
  const std::string tool_dir = s.id + ".temp";
  s.work_dir = s.target + ".temp";
  if (!CleanDir(s.work_dir, 0700)) {
    CERT_LOG("Failed to clean %s", s.work_dir.c_str());
    return;
  }
  const Json::Value answer =
      RunLetsEncrypt("new-cert", "-d", domain.c_str(), "-m", email.c_str(),
                     "-c", tool_dir.c_str());
  const int error = ErrorNumber(answer);
  if (error != 0) {
    CERT_LOG("Failed to create Let's Encrypt certificate. [%d][%s]", error,
             Message(answer).c_str());
    s.code = LetsEncryptErrorToApiError(error);
    // Several names or a wildcard: the tool's reason goes to the caller,
    // who has more than one name to look at (or needs DNS-01).
    if (domain.find_first_of(",*") != std::string::npos) {
      s.error_data = Json::Value(Json::objectValue);
      s.error_data["msg"] = Message(answer);
    }
    return;
  }
  if (!MoveDir(s.work_dir, s.target)) {
    CERT_LOG("Failed to move %s to %s", s.work_dir.c_str(), s.target.c_str());
    return;
  }
  if (!SetCrtProperty(s.id, desc, as_default, user_deletable)) {
    CERT_LOG("Failed to SetCrtProperty. [%s][%s][%s]", s.id.c_str(),
             desc.c_str(), as_default ? "default" : "default not set");
  }
  if (s.replace) {
    bool restart = false;
    if (!UpdateCertToService(s.id, restart)) {
      CERT_LOG("Failed to update cert for %s", s.id.c_str());
      return;
    }
    response->SetHttpdRestart(restart);
    s.data["restart_httpd"] = restart;
  }
  s.data["id"] = s.id;
  s.code = kSuccess;
  sync();
}

}  // namespace

Json::Value RunLetsEncrypt(const char* arg1, const char* arg2, const char* arg3,
                           const char* arg4, const char* arg5, const char* arg6,
                           const char* arg7) {
  const std::string tool = ZEPH::RootPath(ZEPH::cert::kLetsEncryptTool);
  ToolStream tool_stream{QLIBCPopen(tool.c_str(), "r", arg1, arg2, arg3, arg4,
                                    arg5, arg6, arg7, nullptr)};
  Json::Value answer(Json::objectValue);
  if (tool_stream.stream == nullptr) {
    answer = ToolError("failed to call zeph-letsencrypt.");
  } else {
    const std::string text = ReadAll(tool_stream.stream);
    if (!ParseAnswer(text, answer)) {
      answer = ToolError("zeph-letsencrypt output is not a json: " + text);
    } else if (!answer.isObject() || !answer.isMember("error")) {
      answer = ToolError("zeph-letsencrypt has no error code.");
    }
  }
  const int error = ErrorNumber(answer);
  // Callers read "error" as a number; one that is none counts as a failure.
  if (!answer["error"].isConvertibleTo(Json::intValue)) answer["error"] = error;
  if (error != 0) {
    if (!answer.isMember("msg")) answer["msg"] = "unknow message.";
    CERT_LOG("zeph-letsencrypt failed. %d [%s]", error, Message(answer).c_str());
  }
  return answer;
}

int LetsEncryptErrorToApiError(int tool_error) {
  switch (tool_error) {
    case 100: return 5520;
    case 101: return 5521;
    case 102: return 5522;
    case 103: return 5523;
    case 104: return 5524;
    case 105: return 5525;
    case 106: return 5526;
    case 108: return 5528;
    case 109: return 5529;
    case 110: return 5530;
    case 200:
    case 205: return 5527;
    default: return kGeneralFailure;
  }
}

void handleLECreate(ZEPH::APIRequest* request, ZEPH::APIResponse* response) {
  CreateState s;
  CreateLe(request, response, s);
  LogAction(s.replace ? CERT_ACTION_REPLACE : CERT_ACTION_CREATE,
            s.code == kSuccess, s.id, "", "");
  if (s.code == kSuccess) {
    response->SetSuccess(s.data);
    return;
  }
  // Unlike a self-signed creation, a failed issuance leaves no empty
  // certificate directory behind.
  if (!s.replace && rmdir(s.target.c_str()) != 0) {
    CERT_LOG("Failed to remove %s (%m)", s.target.c_str());
  }
  if (!RemoveDir(s.work_dir)) CERT_LOG("Failed to remove %s", s.work_dir.c_str());
  response->SetError(s.code, s.error_data);
}

void handleLERenew(ZEPH::APIRequest* request, ZEPH::APIResponse* response) {
  const std::string id = StringParam(request, "id");
  int code = kGeneralFailure;
  Json::Value result(Json::objectValue);
  if (!IsCrtIdValid(id)) {
    CERT_LOG("%s is not a valid cert id", id.c_str());
    code = kInvalidParams;
  } else {
    CERT_LOG("handle le renew. [%s]", id.c_str());
    const Json::Value answer = RunLetsEncrypt("renew", "-c", id.c_str());
    const int error = ErrorNumber(answer);
    bool restart = false;
    if (error != 0) {
      CERT_LOG("Failed to renew Let'sEncrypt certificate. [%d][%s]", error,
               Message(answer).c_str());
      code = LetsEncryptErrorToApiError(error);
    } else if (!UpdateCertToService(id, restart)) {
      CERT_LOG("Failed to updater cert to services for %s", id.c_str());
    } else {
      response->SetHttpdRestart(restart);
      result["restart_httpd"] = restart;
      result["id"] = id;
      code = kSuccess;
      sync();
    }
  }
  LogAction(CERT_ACTION_CREATE, code == kSuccess, id, "", "");
  if (code == kSuccess) {
    response->SetSuccess(result);
  } else {
    response->SetError(code, Json::Value());
  }
}

void handleLEAccountList(ZEPH::APIRequest* /*request*/,
                         ZEPH::APIResponse* response) {
  Json::Value result(Json::objectValue);
  result["email"] = Json::Value(Json::arrayValue);
  const std::string pattern =
      ZEPH::RootPath("/usr/zeph/etc/letsencrypt/account") + "/*/info.json";
  glob_t found{};
  const int rc = glob(pattern.c_str(), 0, nullptr, &found);
  if (rc == 0) {
    for (size_t i = 0; i < found.gl_pathc; ++i) {
      Json::Value info;
      if (!ZEPH::JsonFromFile(info, found.gl_pathv[i]) || !info.isObject()) continue;
      const Json::Value& contact = info["contact"];
      if (!contact.isString() || contact.asString().empty()) continue;
      Json::Value entry(Json::objectValue);
      entry["contact"] = contact;
      result["email"].append(entry);
    }
  } else if (rc != GLOB_NOMATCH) {
    CERT_LOG("Failed to get let's encrypt account info.");
  }
  globfree(&found);
  response->SetSuccess(result);
}
