// zephcert: provisions an appliance root and calls any method of the
// certificate module from the shell, loading the module as the server does.
//
//   zephcert [--root DIR] [--module PATH] init
//   zephcert [--root DIR] [--module PATH] call API METHOD [PARAMS_JSON]
//            [--version N] [--output FILE]
//
// PARAMS_JSON "-" reads the parameters from standard input: the way to pass
// a secret (an export's "passphrase"), which a command line would show to
// every user of the machine.
//
//   zephcert [--root DIR] letsencrypt-settings [-]
//
// shows the settings of the Let's Encrypt tool as the administration page
// sees them (acme/settings.h: PublicView, secrets only as "is set"); with
// "-" it first changes them with the JSON object read from standard input
// (UpdateSettings), which is checked whole: a refusal prints
// {"success": false, "error": {"setting", "message"}} and changes nothing.
//
// The files that the upload parameters ("key_tmp", "cert_tmp",
// "inter_cert_tmp", "csr_tmp", "pkcs12_tmp") name are copied into a private
// directory below the root's /tmp first, and the module gets the copies: a
// caller's files are never changed. An import's files are prepared as the
// server prepares uploads (host/import_preparation.h): any usual format, a
// PKCS#12 bundle ("pkcs12_tmp") and "passphrase"; a refusal is answered as
// an error whose data is {"reason", "message"}, and warnings come as
// "warnings" in the data of a success.
//
// The answer is one JSON object on standard output. A method that answers
// with a download has it written to --output FILE and reported under
// "download"; a download that cannot be written whole leaves no FILE and
// no "download", as a server hands out nothing then.
//
// Exit status: 0 success, 1 the method answered an error, 2 the call could
// not be made (bad arguments, unknown API or method, unloadable module,
// unusable root).
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <iostream>
#include <string>
#include <vector>

#include "acme/settings.h"
#include "host/import_preparation.h"
#include "host/initialize.h"
#include "host/module_loader.h"
#include "host/upload_dir.h"
#include "zeph/api.h"
#include "zeph/fd_io.h"
#include "zeph/json_file.h"
#include "zeph/root.h"
#include "zeph/system.h"
#include "zeph/unique_fd.h"

namespace {

constexpr int kExitOk = 0;
constexpr int kExitApiError = 1;
constexpr int kExitCallFailed = 2;

const char kUsage[] =
    "usage: zephcert [--root DIR] [--module PATH] init\n"
    "       zephcert [--root DIR] [--module PATH] call API METHOD "
    "[PARAMS_JSON|-] [--version N] [--output FILE]\n"
    "       zephcert [--root DIR] letsencrypt-settings [-]\n";

struct Options {
  std::string root;
  bool has_root = false;
  std::string module;
  std::string output;
  int version = 1;
  std::vector<std::string> positional;
};

int Fail(const std::string& message) {
  std::cerr << "zephcert: " << message << "\n";
  return kExitCallFailed;
}

bool ParseArgs(int argc, char** argv, Options& opts, std::string& error) {
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    auto value = [&](std::string& out) {
      if (i + 1 >= argc) {
        error = arg + " needs a value";
        return false;
      }
      out = argv[++i];
      return true;
    };
    if (arg == "--root") {
      if (!value(opts.root)) return false;
      opts.has_root = true;
    } else if (arg == "--module") {
      if (!value(opts.module)) return false;
    } else if (arg == "--output") {
      if (!value(opts.output)) return false;
    } else if (arg == "--version") {
      std::string v;
      if (!value(v)) return false;
      char* end = nullptr;
      long n = strtol(v.c_str(), &end, 10);
      if (v.empty() || *end != '\0' || n < 0 || n > INT_MAX) {
        error = "--version takes a whole number";
        return false;
      }
      opts.version = static_cast<int>(n);
    } else if (arg == "--help" || arg == "-h") {
      error = "";
      return false;
    } else if (arg.size() > 2 && arg.compare(0, 2, "--") == 0) {
      error = "unknown option " + arg;
      return false;
    } else {
      opts.positional.push_back(arg);
    }
  }
  return true;
}

// Makes --root usable: created when `create` is set, then resolved to an
// absolute path and exported as ZEPH_ROOT for the module and its tools.
bool SetUpRoot(const Options& opts, bool create, std::string& error) {
  if (!opts.has_root) return true;
  if (opts.root.empty()) {
    error = "--root needs a directory";
    return false;
  }
  if (create && ZEPHFSMkdirP(opts.root.c_str(), nullptr, 1, 0, 0, 0755) != 0) {
    error = "cannot create root " + opts.root + ": " + strerror(errno);
    return false;
  }
  char resolved[PATH_MAX];
  struct stat st;
  if (realpath(opts.root.c_str(), resolved) == nullptr ||
      stat(resolved, &st) != 0 || !S_ISDIR(st.st_mode)) {
    error = "root " + opts.root + " is not a directory";
    return false;
  }
  setenv("ZEPH_ROOT", resolved, 1);
  return true;
}

// Points descriptor 1 at standard error for its lifetime.
class StdoutToStderr {
 public:
  StdoutToStderr() : saved_(fcntl(1, F_DUPFD_CLOEXEC, 3)) {
    fflush(stdout);
    if (saved_.valid()) dup2(2, 1);
  }
  ~StdoutToStderr() {
    fflush(stdout);
    if (saved_.valid()) dup2(saved_.get(), 1);
  }
  StdoutToStderr(const StdoutToStderr&) = delete;
  StdoutToStderr& operator=(const StdoutToStderr&) = delete;

 private:
  ZEPH::UniqueFd saved_;
};

// Delivers a download into the --output file. A download that cannot be
// written whole is not delivered: what was written of it is removed, so
// that no file cut short is taken for the download.
class FileSink : public ZEPH::DownloadSink {
 public:
  explicit FileSink(std::string path) : path_(std::move(path)) {}

  bool Deliver(const ZEPH::HeaderList& headers,
               const std::string& source) override {
    headers_ = headers;
    if (path_.empty()) {
      // Reported as answered, though not kept.
      delivered_ = true;
      std::cerr << "zephcert: the method answered a download; "
                   "name a file with --output to keep it\n";
      return false;
    }
    if (!Copy(source)) {
      std::cerr << "zephcert: cannot write the download to " << path_ << ": "
                << strerror(errno) << "\n";
      bytes_ = 0;
      return false;
    }
    delivered_ = true;
    return true;
  }

  bool delivered() const { return delivered_; }
  long long bytes() const { return bytes_; }
  const ZEPH::HeaderList& headers() const { return headers_; }

 private:
  // Copies `source` into the output file; false (errno set) when it could
  // not be copied whole, and then the output file is gone.
  bool Copy(const std::string& source) {
    ZEPH::UniqueFd in(open(source.c_str(), O_RDONLY | O_CLOEXEC));
    if (!in) return false;
    ZEPH::UniqueFd out(
        open(path_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    if (!out) return false;
    bool whole = false;
    char buf[65536];
    for (;;) {
      ssize_t n = read(in.get(), buf, sizeof(buf));
      if (n == 0) {
        whole = true;
        break;
      }
      if (n < 0) {
        if (errno == EINTR) continue;
        break;
      }
      if (!ZEPH::WriteAll(out.get(), buf, static_cast<size_t>(n))) break;
      bytes_ += n;
    }
    if (whole && close(out.release()) == 0) return true;
    const int saved = errno;
    unlink(path_.c_str());
    errno = saved;
    return false;
  }

  std::string path_;
  ZEPH::HeaderList headers_;
  bool delivered_ = false;
  long long bytes_ = 0;
};

std::unique_ptr<ZEPH::LoadedModule> LoadModule(const Options& opts,
                                              std::string& error) {
  const std::string path =
      opts.module.empty() ? ZEPH::DefaultCertificateModulePath() : opts.module;
  return ZEPH::LoadedModule::Open(path, &error);
}

Json::Value Answer(const ZEPH::APIResponse& response, const FileSink& sink) {
  Json::Value out(Json::objectValue);
  const bool error =
      response.outcome() == ZEPH::APIResponse::Outcome::kError;
  out["success"] = !error;
  if (error) {
    out["error"]["code"] = response.error_code();
    out["error"]["data"] = response.data();
  } else {
    out["data"] = response.data();
  }
  out["httpd_restart"] = response.httpd_restart();
  if (sink.delivered()) {
    Json::Value headers(Json::objectValue);
    for (const auto& h : sink.headers()) headers[h.first] = h.second;
    out["download"]["headers"] = headers;
    out["download"]["bytes"] = static_cast<Json::Int64>(sink.bytes());
  }
  return out;
}

int Call(const Options& opts) {
  if (opts.positional.size() < 3 || opts.positional.size() > 4) {
    std::cerr << kUsage;
    return kExitCallFailed;
  }
  const std::string& api = opts.positional[1];
  const std::string& method = opts.positional[2];
  Json::Value params(Json::objectValue);
  if (opts.positional.size() == 4) {
    std::string text = opts.positional[3];
    if (text == "-") {
      text.clear();
      if (!ZEPH::ReadAll(STDIN_FILENO, text)) {
        return Fail(std::string("cannot read the parameters: ") + strerror(errno));
      }
    }
    if (!ZEPH::JsonParse(text, params) || !params.isObject()) {
      return Fail("parameters must be one JSON object");
    }
  }
  std::string error;
  if (!SetUpRoot(opts, false, error)) return Fail(error);

  auto module = LoadModule(opts, error);
  if (!module) return Fail(error);
  const ZEPH_API_TABLE* row = module->Find(api, opts.version, method);
  if (row == nullptr) {
    if (!module->HasApi(api)) return Fail("unknown API " + api);
    return Fail("unknown method " + method + " (version " +
                std::to_string(opts.version) + ") of " + api);
  }

  // The module may change the files it is handed (a byte-order mark is
  // stripped in place): it gets private copies, never the caller's files.
  ZEPH::UploadDir uploads(ZEPH::RootPath("/tmp"), "zephcert-upload");
  if (!ZEPH::CopyUploadParams(params, uploads, &error)) return Fail(error);

  // What is brought for an import is made into the files the module
  // expects, or refused with the reason.
  ZEPH::PreparedImport prepared;
  if (ZEPH::IsImportCall(api, method)) {
    prepared = ZEPH::PrepareImport(params, uploads, ZEPH::ApplianceHostName());
  }

  ZEPH::APIRequest request(params);
  ZEPH::APIResponse response;
  FileSink sink(opts.output);
  if (prepared.refused) {
    response.SetError(prepared.code, ZEPH::NoteJson(prepared.refusal));
  } else {
    // The tools the module runs inherit standard output; send what they
    // print to standard error so that the answer stays one JSON object.
    StdoutToStderr guard;
    ZEPH::ScopedDownloadSink scope(&sink);
    row->handler(&request, &response);
  }
  Json::Value answer = Answer(response, sink);
  if (answer["success"].asBool()) AddWarnings(prepared.warnings, answer["data"]);
  std::cout << ZEPH::JsonCompact(answer) << std::endl;
  return response.outcome() == ZEPH::APIResponse::Outcome::kError
             ? kExitApiError
             : kExitOk;
}

int LetsEncryptSettings(const Options& opts) {
  if (opts.positional.size() > 2 ||
      (opts.positional.size() == 2 && opts.positional[1] != "-")) {
    std::cerr << kUsage;
    return kExitCallFailed;
  }
  std::string error;
  if (!SetUpRoot(opts, false, error)) return Fail(error);
  const std::string dir = ZEPH::RootPath("/usr/zeph/etc/letsencrypt");
  ZEPH::acme::Settings settings;
  ZEPH::acme::SettingsError refused;
  bool ok = true;
  if (opts.positional.size() == 2) {
    std::string text;
    Json::Value update;
    if (!ZEPH::ReadAll(STDIN_FILENO, text)) {
      return Fail(std::string("cannot read the settings: ") + strerror(errno));
    }
    if (!ZEPH::JsonParse(text, update)) return Fail("the settings must be one JSON object");
    ok = ZEPH::acme::UpdateSettings(dir, update, &settings, &refused);
  } else {
    ok = ZEPH::acme::LoadSettings(dir, &settings, &refused);
  }
  Json::Value out(Json::objectValue);
  out["success"] = ok;
  if (ok) {
    out["data"] = ZEPH::acme::PublicView(settings, dir);
  } else {
    out["error"]["setting"] = refused.setting;
    out["error"]["message"] = refused.message;
  }
  std::cout << ZEPH::JsonCompact(out) << std::endl;
  return ok ? kExitOk : kExitApiError;
}

int Init(const Options& opts) {
  if (opts.positional.size() != 1) {
    std::cerr << kUsage;
    return kExitCallFailed;
  }
  std::string error;
  if (!SetUpRoot(opts, true, error)) return Fail(error);
  auto module = LoadModule(opts, error);
  if (!module) return Fail(error);
  if (!ZEPH::InitializeRoot(*module, &error)) return Fail(error);
  return kExitOk;
}

}  // namespace

int main(int argc, char** argv) {
  Options opts;
  std::string error;
  if (!ParseArgs(argc, argv, opts, error)) {
    if (!error.empty()) std::cerr << "zephcert: " << error << "\n";
    std::cerr << kUsage;
    return kExitCallFailed;
  }
  if (opts.positional.empty()) {
    std::cerr << kUsage;
    return kExitCallFailed;
  }
  const std::string& command = opts.positional[0];
  if (command == "call") return Call(opts);
  if (command == "init") return Init(opts);
  if (command == "letsencrypt-settings") return LetsEncryptSettings(opts);
  return Fail("unknown command " + command);
}
