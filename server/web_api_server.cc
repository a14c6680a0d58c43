#include "server/web_api_server.h"

#include <errno.h>
#include <httplib.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <strings.h>
#include <unistd.h>

#include <chrono>
#include <exception>
#include <utility>
#include <vector>

#include "host/import_preparation.h"
#include "server/acme_settings_routes.h"
#include "server/call_input.h"
#include "server/event_log.h"
#include "server/http_download.h"
#include "server/listeners.h"
#include "server/log_line.h"
#include "server/token.h"
#include "zeph/api.h"
#include "zeph/json_file.h"
#include "zeph/root.h"

namespace ZEPH {
namespace webapid {
namespace {

constexpr char kJson[] = "application/json";
constexpr size_t kDefaultEvents = 100;
constexpr size_t kMaxEvents = 1000;

// When the request being served began, for the access line; the request's
// thread sets it in the pre-routing handler and the logger reads it.
thread_local std::chrono::steady_clock::time_point t_request_start;
thread_local bool t_request_timed = false;

bool StartsWith(const std::string& text, const char* prefix) {
  return text.compare(0, strlen(prefix), prefix) == 0;
}

// Paths that need the token: the API and the server's own endpoints.
bool IsProtected(const std::string& path) {
  return path == "/api" || path == "/server" || StartsWith(path, "/api/") ||
         StartsWith(path, "/server/");
}

// Whether a body follows the headers. A request with neither
// Content-Length nor Transfer-Encoding has none (it must not be read up to
// the end of the connection).
bool HasBody(const httplib::Request& req) {
  if (req.has_header("Transfer-Encoding")) return true;
  return req.has_header("Content-Length") &&
         req.get_header_value("Content-Length") != "0";
}

// The media type of the request without parameters, in lower case.
std::string MediaType(const httplib::Request& req) {
  std::string type = req.get_header_value("Content-Type");
  type = type.substr(0, type.find(';'));
  while (!type.empty() && (type.back() == ' ' || type.back() == '\t')) {
    type.pop_back();
  }
  for (char& c : type)
    c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
  return type;
}

void SetJson(httplib::Response& res, int status, const Json::Value& body) {
  res.status = status;
  res.set_content(JsonCompact(body) + "\n", kJson);
}

void SetServerError(httplib::Response& res, int status,
                    const std::string& message) {
  Json::Value body(Json::objectValue);
  body["success"] = false;
  body["error"]["code"] = status;
  body["error"]["data"]["message"] = message;
  SetJson(res, status, body);
}

void SetSuccess(httplib::Response& res, const Json::Value& data) {
  Json::Value body(Json::objectValue);
  body["success"] = true;
  body["data"] = data;
  SetJson(res, 200, body);
}

void Unauthorized(httplib::Response& res) {
  SetServerError(res, 401, "missing or wrong access token");
  res.set_header("WWW-Authenticate", "Bearer");
}

// Reads the whole body into `input`. False when the body could not be read
// to its end (malformed, cut off, or past the size limit).
bool ReadBody(const httplib::Request& req, const httplib::ContentReader& reader,
              CallInput* input) {
  if (req.is_multipart_form_data()) {
    return reader(
        [input](const httplib::MultipartFormData& part) {
          return input->BeginPart(part.name, part.filename);
        },
        [input](const char* data, size_t size) {
          return input->AddPartData(data, size);
        });
  }
  return reader([input](const char* data, size_t size) {
    return input->AddJson(data, size);
  });
}

// The method table row for "/api/<API>/<version>/<method>", or null with
// the reason in `why`.
const ZEPH_API_TABLE* FindRow(const LoadedModule& module,
                              const std::string& path, std::string* why) {
  std::vector<std::string> parts;
  size_t start = strlen("/api/");
  for (;;) {
    const size_t slash = path.find('/', start);
    parts.push_back(path.substr(start, slash - start));
    if (slash == std::string::npos) break;
    start = slash + 1;
  }
  if (parts.size() != 3 || parts[0].empty() || parts[2].empty()) {
    *why = "no such path; calls are POST /api/<API>/<version>/<method>";
    return nullptr;
  }
  const std::string& version = parts[1];
  if (version.empty() || version.size() > 9 ||
      version.find_first_not_of("0123456789") != std::string::npos) {
    *why = "version must be a whole number";
    return nullptr;
  }
  const ZEPH_API_TABLE* row =
      module.Find(parts[0], atoi(version.c_str()), parts[2]);
  if (row == nullptr) {
    *why =
        module.HasApi(parts[0]) ? "unknown method or version" : "unknown API";
  }
  return row;
}

const char* StatusText(int status) {
  switch (status) {
    case 400:
      return "bad request";
    case 401:
      return "missing or wrong access token";
    case 404:
      return "not found";
    case 405:
      return "method not allowed";
    case 413:
      return "request too large";
    case 415:
      return "unsupported content type";
    default:
      return status >= 500 ? "internal error" : "request refused";
  }
}

std::string Printable(const std::string& text, size_t max) {
  std::string out;
  for (unsigned char c : text.substr(0, max)) {
    out.push_back(c > 0x20 && c < 0x7f && c != '"' ? static_cast<char>(c)
                                                   : '?');
  }
  return out;
}

}  // namespace

WebApiServer::WebApiServer(const LoadedModule* module, HttpdControl* httpd,
                           std::string token, ServerSettings settings)
    : module_(module),
      httpd_(httpd),
      token_(std::move(token)),
      settings_(std::move(settings)),
      started_(time(nullptr)) {}

WebApiServer::~WebApiServer() = default;

bool WebApiServer::Authorized(const httplib::Request& req) const {
  return TokenAccepts(req.get_header_value("Authorization"), token_);
}

void WebApiServer::Listen(UniqueFd listener) {
  http_ = std::make_unique<ApiHttpServer>();
  InstallRoutes(*http_);
  http_->Adopt(std::move(listener));
}

bool WebApiServer::Serve() { return http_ && http_->listen_after_bind(); }

void WebApiServer::Stop() {
  if (http_) http_->stop();
}

void WebApiServer::InstallRoutes(httplib::Server& http) {
  const size_t threads = settings_.threads;
  http.new_task_queue = [threads] { return new httplib::ThreadPool(threads); };
  // nginx bounds what it passes on; this only stops reading anything more.
  http.set_payload_max_length(CallInput::kMaxBodyBytes);

  http.set_pre_routing_handler(
      [this](const httplib::Request& req, httplib::Response& res) {
        t_request_start = std::chrono::steady_clock::now();
        t_request_timed = true;
        if (!IsProtected(req.path))
          return httplib::Server::HandlerResponse::Unhandled;
        // Requests with a body are turned away by their handler, after the
        // body was read: nginx is still sending it.
        if (!Authorized(req) && !HasBody(req)) {
          Unauthorized(res);
          return httplib::Server::HandlerResponse::Handled;
        }
        return httplib::Server::HandlerResponse::Unhandled;
      });

  http.Post(R"(/api/.*)",
            [this](const httplib::Request& req, httplib::Response& res,
                   const httplib::ContentReader& reader) {
              OnCall(req, res, reader);
            });

  InstallAcmeSettingsRoutes(
      http, RootPath("/usr/zeph/etc/letsencrypt"),
      [this](const httplib::Request& req) { return Authorized(req); });

  // Any other method on the protected paths: read the body, then refuse.
  auto refuse = [this](const httplib::Request& req, httplib::Response& res,
                       const httplib::ContentReader& reader) {
    CallInput drain(settings_.upload_parent);
    drain.Fail(405, "method not allowed");  // read past, store nothing
    if (HasBody(req)) ReadBody(req, reader, &drain);
    if (!Authorized(req)) {
      Unauthorized(res);
    } else {
      SetServerError(res, 405, "method not allowed");
    }
  };
  for (const char* pattern : {R"(/server(/.*)?)", R"(/api)"}) {
    http.Post(pattern, refuse);
  }
  for (const char* pattern : {R"(/server(/.*)?)", R"(/api(/.*)?)"}) {
    http.Put(pattern, refuse);
    http.Patch(pattern, refuse);
    http.Delete(pattern, refuse);
  }

  // GET handlers also check the token: a GET with a body passes the
  // pre-routing check to be read first.
  auto guarded = [this](void (WebApiServer::*handler)(httplib::Response&)
                            const) {
    return
        [this, handler](const httplib::Request& req, httplib::Response& res) {
          if (!Authorized(req)) return Unauthorized(res);
          (this->*handler)(res);
        };
  };
  http.Get("/server/health", guarded(&WebApiServer::OnHealth));
  http.Get("/server/services", guarded(&WebApiServer::OnServices));
  http.Get("/server/events",
           [this](const httplib::Request& req, httplib::Response& res) {
             if (!Authorized(req)) return Unauthorized(res);
             OnEvents(req, res);
           });
  http.Get(R"(/(server|api)(/.*)?)", [this](const httplib::Request& req,
                                            httplib::Response& res) {
    if (!Authorized(req)) return Unauthorized(res);
    if (StartsWith(req.path, "/api")) {
      SetServerError(res, 405, "calls are POST /api/<API>/<version>/<method>");
    } else {
      SetServerError(res, 404, "no such endpoint");
    }
  });

  // Errors without a body (unknown paths, malformed requests) get the
  // JSON error form too.
  http.set_error_handler(
      [](const httplib::Request& /*req*/, httplib::Response& res) {
        if (res.body.empty() && !res.content_provider_) {
          SetServerError(res, res.status, StatusText(res.status));
        }
      });
  http.set_exception_handler([](const httplib::Request& /*req*/,
                                httplib::Response& res, std::exception_ptr ep) {
    std::string what = "unknown";
    try {
      std::rethrow_exception(ep);
    } catch (const std::exception& e) {
      what = e.what();
    } catch (...) {
    }
    LogLine("request failed: " + what);
    SetServerError(res, 500, "internal error");
  });

  http.set_logger([](const httplib::Request& req,
                     const httplib::Response& res) {
    char duration[32] = "-";
    if (t_request_timed) {
      const double ms = std::chrono::duration<double, std::milli>(
                            std::chrono::steady_clock::now() - t_request_start)
                            .count();
      snprintf(duration, sizeof(duration), "%.1fms", ms);
      t_request_timed = false;
    }
    const size_t bytes =
        res.content_provider_ ? res.content_length_ : res.body.size();
    // The listener is nginx's alone: the address it passes is the client's.
    const std::string client = req.get_header_value("X-Real-IP");
    AccessLine((client.empty() ? "-" : Printable(client, 64)) + " \"" +
               Printable(req.method, 16) + " " + Printable(req.path, 256) +
               "\" " + std::to_string(res.status) + " " +
               std::to_string(bytes) + " " + duration);
  });
}

void WebApiServer::OnCall(const httplib::Request& req, httplib::Response& res,
                          const httplib::ContentReader& reader) {
  CallInput input(settings_.upload_parent);
  const bool authorized = Authorized(req);
  std::string why;
  const ZEPH_API_TABLE* row =
      authorized ? FindRow(*module_, req.path, &why) : nullptr;

  // Nothing of an unauthorised or misdirected call is stored: its body is
  // only read past.
  if (!authorized) {
    input.Fail(401, "missing or wrong access token");
  } else if (row == nullptr) {
    input.Fail(404, why);
  }
  const std::string media = MediaType(req);
  if (!req.is_multipart_form_data() && !media.empty() && media != kJson) {
    input.Fail(415, "send application/json or multipart/form-data, not " +
                        Printable(media, 64));
  }
  if (HasBody(req) && !ReadBody(req, reader, &input)) {
    input.Fail(400, "malformed or incomplete request body");
  }

  Json::Value params;
  CallError error;
  if (!input.Finish(&params, &error)) {
    if (error.status == 401) return Unauthorized(res);
    return SetServerError(res, error.status, error.message);
  }

  // What was uploaded for an import is made into the files the module
  // expects, or refused with the reason.
  PreparedImport prepared;
  if (IsImportCall(row->api, row->method)) {
    prepared = PrepareImport(params, input.uploads(), ApplianceHostName());
  }

  APIRequest request(params);
  APIResponse response;
  HttpDownload download;
  try {
    ScopedDownloadSink scope(&download);
    if (prepared.refused) {
      response.SetError(prepared.code, NoteJson(prepared.refusal));
    } else {
      row->handler(&request, &response);
    }
  } catch (const std::exception& e) {
    LogLine(std::string("method ") + row->api + " " + row->method +
            " threw: " + e.what());
    return SetServerError(res, 500, "the method failed");
  } catch (...) {
    LogLine(std::string("method ") + row->api + " " + row->method + " threw");
    return SetServerError(res, 500, "the method failed");
  }

  if (response.httpd_restart()) {
    // The web certificate may have changed: the next connection must see
    // it once the caller has the answer.
    httpd_->RestartRequested();
  }

  if (download.delivered()) return download.Respond(&res);
  switch (response.outcome()) {
    case APIResponse::Outcome::kSuccess: {
      Json::Value data = response.data();
      AddWarnings(prepared.warnings, data);
      return SetSuccess(res, data);
    }
    case APIResponse::Outcome::kError: {
      Json::Value body(Json::objectValue);
      body["success"] = false;
      body["error"]["code"] = response.error_code();
      body["error"]["data"] = response.data();
      return SetJson(res, 200, body);
    }
    case APIResponse::Outcome::kNone:
      res.status = 204;  // the method answered nothing (a download that failed)
      return;
  }
}

void WebApiServer::OnHealth(httplib::Response& res) const {
  Json::Value data(Json::objectValue);
  data["status"] = "ok";
  data["pid"] = static_cast<Json::Int64>(getpid());
  data["uptime_s"] = static_cast<Json::Int64>(time(nullptr) - started_);
  data["certificate"]["sha256"] = httpd_->Fingerprint();
  data["certificate"]["not_after"] = httpd_->NotAfter();
  SetSuccess(res, data);
}

void WebApiServer::OnServices(httplib::Response& res) const {
  Json::Value services;
  if (!JsonFromFile(services, settings_.services_file) || !services.isArray()) {
    return SetServerError(res, 500, "the service registry cannot be read");
  }
  Json::Value data(Json::objectValue);
  data["services"] = services;
  SetSuccess(res, data);
}

void WebApiServer::OnEvents(const httplib::Request& req,
                            httplib::Response& res) const {
  size_t limit = kDefaultEvents;
  if (req.has_param("limit")) {
    const std::string text = req.get_param_value("limit");
    const long value =
        text.size() <= 4 &&
                text.find_first_not_of("0123456789") == std::string::npos
            ? atol(text.c_str())
            : 0;
    if (value < 1 || value > static_cast<long>(kMaxEvents)) {
      return SetServerError(res, 400, "limit must be 1 to 1000");
    }
    limit = static_cast<size_t>(value);
  }
  Json::Value events;
  if (!ReadEvents(settings_.events_file, limit, &events)) {
    return SetServerError(res, 500, "the event log cannot be read");
  }
  Json::Value data(Json::objectValue);
  data["events"] = events;
  SetSuccess(res, data);
}

}  // namespace webapid
}  // namespace ZEPH
