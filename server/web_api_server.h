// The HTTPS web API server around a loaded module.
//
// Routes (all answers JSON unless a download or a static file):
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
//   GET  /...               the administration page's static files, when
//                           the web directory exists (no token needed)
//
// Every path below /api/ and /server/ needs "Authorization: Bearer <token>";
// without it the answer is 401 and no module code runs. Errors of the
// server itself come as HTTP 4xx/5xx with
// {"success": false, "error": {"code": <HTTP status>, "data": {"message":
// ...}}}: 404 unknown API, version or method; 400 malformed JSON or multipart,
// or a server-only "*_tmp" parameter; 413 too large; 415 another content type.
//
// After a call whose method asked for it (SetHttpdRestart(true)) the
// certificate is taken up again before the answer goes out; new TLS
// connections get it, open ones keep theirs (tls_identity.h).
//
// Requests are served by a pool of threads; each call gets its own request,
// response and download objects. One access line is logged per request.
//
// Thread-safety: Stop may be called from any thread (a signal handler
// thread); everything else from the thread that owns the server.
#ifndef ZEPH_SERVER_WEB_API_SERVER_H_
#define ZEPH_SERVER_WEB_API_SERVER_H_

#include <time.h>

#include <memory>
#include <string>

#include "host/module_loader.h"
#include "server/tls_identity.h"

namespace httplib {
class Server;
class SSLServer;
struct Request;
struct Response;
class ContentReader;
}  // namespace httplib

namespace ZEPH {
namespace webapid {

struct ServerSettings {
  std::string address = "127.0.0.1";
  int port = 0;               // 0: any free port
  std::string web_dir;        // static files; served when it exists
  std::string upload_parent;  // where upload directories are made
  std::string services_file;  // the SERVICES file
  std::string events_file;    // the event log
  size_t threads = 16;
};

class WebApiServer {
 public:
  // `module` and `identity` must outlive the server.
  WebApiServer(const LoadedModule* module, TlsIdentity* identity,
               std::string token, ServerSettings settings);
  ~WebApiServer();
  WebApiServer(const WebApiServer&) = delete;
  WebApiServer& operator=(const WebApiServer&) = delete;

  // Sets up TLS and the routes and binds the listening socket. False with
  // a one-line reason in `error`.
  bool Bind(std::string* error);
  // The port bound (after Bind).
  int port() const { return port_; }
  // Serves until Stop. False when the server could not run.
  bool Serve();
  // Stops accepting; requests in progress finish. Safe from any thread.
  void Stop();

  // Sets up `http` to serve this server's routes, limits and logging. Bind
  // does this for its TLS server; a harness may do it for a plain one to
  // feed it requests without a socket.
  void InstallRoutes(httplib::Server& http);

 private:
  bool Authorized(const httplib::Request& req) const;
  void OnCall(const httplib::Request& req, httplib::Response& res,
              const httplib::ContentReader& reader);
  void OnHealth(httplib::Response& res) const;
  void OnServices(httplib::Response& res) const;
  void OnEvents(const httplib::Request& req, httplib::Response& res) const;

  const LoadedModule* module_;
  TlsIdentity* identity_;
  const std::string token_;
  const ServerSettings settings_;
  const time_t started_;
  std::unique_ptr<httplib::SSLServer> http_;
  int port_ = -1;
};

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_WEB_API_SERVER_H_
