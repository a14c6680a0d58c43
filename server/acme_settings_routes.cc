#include "server/acme_settings_routes.h"

#include <httplib.h>

#include <vector>

#include "acme/dns_providers.h"
#include "acme/settings.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace webapid {
namespace {

constexpr size_t kMaxBodyBytes = 1 << 20;
constexpr char kJson[] = "application/json";

void Answer(httplib::Response& res, int status, const Json::Value& body) {
  res.status = status;
  res.set_content(JsonCompact(body) + "\n", kJson);
}

void Success(httplib::Response& res, const Json::Value& data) {
  Json::Value body(Json::objectValue);
  body["success"] = true;
  body["data"] = data;
  Answer(res, 200, body);
}

void Failure(httplib::Response& res, int status, const std::string& message,
             const std::string& setting = "") {
  Json::Value body(Json::objectValue);
  body["success"] = false;
  body["error"]["code"] = status;
  body["error"]["data"]["message"] = message;
  if (!setting.empty()) body["error"]["data"]["setting"] = setting;
  Answer(res, status, body);
}

void Unauthorized(httplib::Response& res) {
  Failure(res, 401, "missing or wrong access token");
  res.set_header("WWW-Authenticate", "Bearer");
}

bool IsJson(const httplib::Request& req) {
  std::string type = req.get_header_value("Content-Type");
  type = type.substr(0, type.find(';'));
  while (!type.empty() && type.back() == ' ') type.pop_back();
  for (char& c : type) c = static_cast<char>(tolower(static_cast<unsigned char>(c)));
  return type.empty() || type == kJson;
}

}  // namespace

void InstallAcmeSettingsRoutes(
    httplib::Server& http, const std::string& state_dir,
    std::function<bool(const httplib::Request&)> authorized) {
  http.Get("/server/letsencrypt/settings",
           [state_dir, authorized](const httplib::Request& req, httplib::Response& res) {
             if (!authorized(req)) return Unauthorized(res);
             acme::Settings settings;
             acme::SettingsError error;
             if (!acme::LoadSettings(state_dir, &settings, &error)) {
               return Failure(res, 500, "the settings cannot be used: " + error.message,
                              error.setting);
             }
             Success(res, acme::PublicView(settings, state_dir));
           });
  // With a content reader, as the server's other POST routes: those are
  // matched before plain handlers.
  http.Post("/server/letsencrypt/settings",
            [state_dir, authorized](const httplib::Request& req, httplib::Response& res,
                                    const httplib::ContentReader& reader) {
              // The body is read to its end either way, so that the
              // connection stays in step; it is kept only when authorised.
              std::string body;
              bool too_large = false;
              const bool keep = authorized(req);
              reader([&](const char* data, size_t size) {
                if (keep && !too_large) {
                  too_large = body.size() + size > kMaxBodyBytes;
                  if (!too_large) body.append(data, size);
                }
                return true;
              });
              if (!keep) return Unauthorized(res);
              if (too_large) return Failure(res, 413, "request body too large");
              Json::Value update;
              if (!IsJson(req)) return Failure(res, 415, "send application/json");
              if (!JsonParse(body.empty() ? "{}" : body, update)) {
                return Failure(res, 400, "the settings must be one JSON object");
              }
              acme::Settings saved;
              acme::SettingsError error;
              if (!acme::UpdateSettings(state_dir, update, &saved, &error)) {
                return Failure(res, 400, error.message, error.setting);
              }
              Success(res, acme::PublicView(saved, state_dir));
            });
  http.Get("/server/letsencrypt/dns-providers",
           [authorized](const httplib::Request& req, httplib::Response& res) {
             if (!authorized(req)) return Unauthorized(res);
             std::vector<std::string> codes;
             if (!acme::DnsProviders(&codes)) {
               return Failure(res, 503, "lego cannot be run to list its DNS providers");
             }
             Json::Value data(Json::objectValue);
             data["providers"] = Json::Value(Json::arrayValue);
             for (const std::string& c : codes) data["providers"].append(c);
             Success(res, data);
           });
  http.Get(R"(/server/letsencrypt/dns-providers/([A-Za-z0-9][A-Za-z0-9._-]*))",
           [authorized](const httplib::Request& req, httplib::Response& res) {
             if (!authorized(req)) return Unauthorized(res);
             Json::Value help;
             if (!acme::DnsProviderHelp(req.matches[1], &help)) {
               return Failure(res, 404, "lego knows no DNS provider of that name");
             }
             Success(res, help);
           });
}

}  // namespace webapid
}  // namespace ZEPH
