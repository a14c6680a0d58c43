// The configuration zeph-webapid writes for nginx, the appliance's httpd.
//
// nginx listens on the public socket (handed over at its start) with TLS,
// HTTP/1.1 and HTTP/2, and:
//
//   - serves the administration page's own files (kPageFiles; "/" is
//     index.html) from the web directory, GET and HEAD only, without a
//     body; any other path outside the API is 404;
//   - passes /api and /server (and everything below) to zeph-webapid's
//     private socket, only once the request body is whole;
//   - answers its own refusals in the API's error form
//     {"success": false, "error": {"code": N, "data": {"message": ...}}}.
//
// Limits: request line and headers 16 KiB; bodies 1 MiB, 8 MiB for
// multipart/form-data on the API (uploads); no body on the page's paths;
// compressed bodies (Content-Encoding) refused on the API with 415; one
// range at most; 10 s to send the headers and between pieces of a body or
// an answer; 32 requests at once per client address (each HTTP/2 stream
// counts), beyond which 429.
//
// TLS 1.2 and 1.3 only, TLS 1.2 with ECDHE and AEAD ciphers; no session
// resumption, so that every connection made after a reload sees the
// certificate now in use. Every answer carries HSTS, a
// Content-Security-Policy the page meets (default-src 'self',
// frame-ancestors 'none'), nosniff, a Referrer-Policy and X-Frame-Options;
// API answers "Cache-Control: no-store", the page's files "no-cache".
//
// Thread-safety: plain functions.
#ifndef ZEPH_SERVER_NGINX_CONFIG_H_
#define ZEPH_SERVER_NGINX_CONFIG_H_

#include <string>

namespace ZEPH {
namespace webapid {

// The files the administration page is made of, relative to the web
// directory; nothing else of it is served.
extern const char* const kPageFiles[4];

struct NginxSettings {
  std::string listen;       // "host:port" of the public socket (HostPort)
  std::string run_dir;      // pid file and temporary directories below it
  std::string web_dir;      // where kPageFiles are
  std::string api_socket;   // zeph-webapid's Unix socket
  std::string chain_path;   // the certificate chain nginx presents
  std::string key_path;     // and its key
  std::string worker_user;  // empty: workers run as the master's user
};

// The whole configuration file. Paths must not hold quotes, braces,
// semicolons, blanks or control characters (CheckNginxPath).
std::string NginxConfigText(const NginxSettings& settings);

// Empty when `path` can be written into the configuration as it is; else
// why not.
std::string CheckNginxPath(const std::string& path);

}  // namespace webapid
}  // namespace ZEPH

#endif  // ZEPH_SERVER_NGINX_CONFIG_H_
