// zeph-webapid's own HTTP server: the web API behind nginx.
//
// nginx (httpd.h) terminates TLS, serves the page's files, enforces the
// limits on requests and passes whole requests for /api and /server to
// this server's private socket (listeners.h), one request a connection.
//
// Routes (all answers JSON unless a download):
//
//   POST /api/<API name>/<version>/<method>   call one row of the method
//        table; body: a JSON object, or multipart/form-data (call_input.h).
//        Answer 200 {"success": true, "data": ...} or
//        {"success": false, "error": {"code": N, "data": ...}}; a download
//        streams the file with the method's headers; a method that answers
//        nothing (an export that found no file) gets 204.
//   GET  /server/health     {"status": "ok", "pid", "uptime_s", "certificate"}
//   GET  /server/services   the registered services (the SERVICES file)
//   GET  /server/events     the action log, newest first, ?limit=N (1-1000,
//                           default 100), each entry with its "message"
//   GET, POST /server/letsencrypt/...  the Let's Encrypt tool's settings
//                           and lego's DNS providers (acme_settings_routes.h)
//
// Every route needs "Authorization: Bearer <token>"; without it the answer
// is 401 and no module code runs. Errors of the server itself come as HTTP
// 4xx/5xx with {"success": false, "error": {"code": <HTTP status>, "data":
// {"message": ...}}}: 404 unknown API, version, method or path; 405 another
// HTTP method; 400 malformed JSON or multipart, or a server-only "*_tmp"
// parameter; 413 a JSON part over 1 MiB; 415 another content type. A
// request with a body is answered after the body was read, so that nginx
// never has its request cut off.
//
// The uploads of an import are prepared before the module sees them
// (host/import_preparation.h): a refusal is answered as the module's error
// with data {"reason", "message"}, and the warnings of a success come as
// "warnings" in its data.
//
// After a call whose method asked for it (SetHttpdRestart(true)) the httpd
// takes up the certificate before the answer goes out (HttpdControl).
//
// Requests are served by a pool of threads; each call gets its own request,
// response and download objects. One access line is logged per request,
// with the client address nginx passes in "X-Real-IP".
//
// Thread-safety: Stop may be called from any thread (a signal handler
// thread); everything else from the thread that owns the server.
#ifndef ZEPH_SERVER_WEB_API_SERVER_H_
#define ZEPH_SERVER_WEB_API_SERVER_H_

#include <time.h>

#include <memory>
#include <string>

#include "host/module_loader.h"
#include "zeph/unique_fd.h"

namespace httplib {
class Server;
struct Request;
struct Response;
class ContentReader;
}  // namespace httplib

namespace ZEPH {
namespace webapid {

class ApiHttpServer;

// What the API asks of the httpd in front of it.
class HttpdControl {
 public:
  virtual ~HttpdControl() = default;
  // A method asked for the httpd's restart: the web administration
  // service's certificate may have changed. Returns once new connections
  // get the certificate now deployed (or it was refused).
  virtual void RestartRequested() = 0;
  // The certificate new connections get: SHA-256 fingerprint and notAfter.
  virtual std::string Fingerprint() const = 0;
  virtual std::string NotAfter() const = 0;
};

struct ServerSettings {
  std::string upload_parent;  // where upload directories are made
  std::string services_file;  // the SERVICES file
  std::string events_file;    // the event log
  size_t threads = 16;
};

class WebApiServer {
 public:
  // `module` and `httpd` must outlive the server.
  WebApiServer(const LoadedModule* module, HttpdControl* httpd,
               std::string token, ServerSettings settings);
  ~WebApiServer();
  WebApiServer(const WebApiServer&) = delete;
  WebApiServer& operator=(const WebApiServer&) = delete;

  // Sets up the routes on the listening socket `listener` (listeners.h).
  void Listen(UniqueFd listener);
  // Serves until Stop. False when the server could not run.
  bool Serve();
  // Stops accepting; requests in progress finish. Safe from any thread.
  void Stop();

  // Sets up `http` to serve this server's routes and logging. Listen does
  // this for its own server; a harness may do it for another one to feed
  // it requests without a socket.
  void InstallRoutes(httplib::Server& http);

 private:
  bool Authorized(const httplib::Request& req) const;
  void OnCall(const httplib::Request& req, httplib::Response& res,
              const httplib::ContentReader& reader);
  void OnHealth(httplib::Response& res) const;
  void OnServices(httplib::Response& res) const;
  void OnEvents(const httplib::Request& req, httplib::Response& res) const;

  const LoadedModule* module_;
  HttpdControl* httpd_;
  const std::string token_;
  const ServerSettings settings_;
  const time_t started_;
  std::unique_ptr<ApiHttpServer> http_;
};

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_WEB_API_SERVER_H_
