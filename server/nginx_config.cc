#include "server/nginx_config.h"

#include <map>

namespace ZEPH {
namespace webapid {
namespace {

// @NAME@ is replaced by the setting of that name.
constexpr char kTemplate[] = R"(# Written by zeph-webapid at each start; changes here are lost.
daemon off;
master_process on;
worker_processes 1;
worker_rlimit_nofile 8192;
pid @RUN@/nginx.pid;
error_log stderr error;
@USER@
events {
    worker_connections 4096;
}

http {
    access_log off;
    server_tokens off;
    types {
        text/html html;
        text/javascript js;
        text/css css;
    }
    default_type application/octet-stream;
    charset utf-8;
    charset_types text/css text/javascript;
    sendfile on;

    client_body_temp_path @RUN@/body;
    proxy_temp_path @RUN@/proxy;
    fastcgi_temp_path @RUN@/fastcgi;
    uwsgi_temp_path @RUN@/uwsgi;
    scgi_temp_path @RUN@/scgi;

    client_header_buffer_size 1k;
    large_client_header_buffers 1 16k;
    client_header_timeout 10s;
    client_body_timeout 10s;
    send_timeout 10s;
    keepalive_timeout 10s;
    lingering_time 10s;
    client_max_body_size 1m;
    client_body_buffer_size 16k;
    max_ranges 1;
    limit_conn_zone $binary_remote_addr zone=per_address:1m;
    limit_conn per_address 32;
    limit_conn_status 429;
    limit_conn_log_level error;

    # Whether the request says a body follows.
    map $http_content_length$http_transfer_encoding $zeph_has_body {
        "" 0;
        "0" 0;
        default 1;
    }
    map $uri $zeph_api_path {
        ~^/(api|server)(/|$) 1;
        default 0;
    }
    map $http_content_type $zeph_multipart {
        ~*^multipart/form-data 1;
        default 0;
    }
    map $zeph_multipart:$zeph_api_path $zeph_upload_call {
        1:1 1;
        default 0;
    }
    # What the page's paths refuse: other methods, and any body.
    map $request_method:$zeph_has_body $zeph_page_refusal {
        GET:0 0;
        HEAD:0 0;
        GET:1 413;
        HEAD:1 413;
        default 405;
    }
    map $request_uri $zeph_cache_control {
        ~^/(index\.html|app\.js|api\.js|style\.css)?(\?|$) no-cache;
        default no-store;
    }
    map $status $zeph_error_message {
        400 "bad request";
        403 "forbidden";
        404 "not found";
        405 "method not allowed";
        408 "request timed out";
        411 "length required";
        413 "request too large";
        414 "request line too long";
        415 "compressed request bodies are not accepted";
        416 "range not satisfiable";
        429 "too many requests at once from this address";
        431 "request headers too large";
        502 "the API server is not answering";
        504 "the API server did not answer in time";
        default "the request could not be served";
    }

    server {
        listen @LISTEN@ ssl http2;

        ssl_certificate @CHAIN@;
        ssl_certificate_key @KEY@;
        ssl_protocols TLSv1.2 TLSv1.3;
        ssl_ciphers ECDHE-ECDSA-AES128-GCM-SHA256:ECDHE-RSA-AES128-GCM-SHA256:ECDHE-ECDSA-AES256-GCM-SHA384:ECDHE-RSA-AES256-GCM-SHA384:ECDHE-ECDSA-CHACHA20-POLY1305:ECDHE-RSA-CHACHA20-POLY1305;
        ssl_prefer_server_ciphers off;
        ssl_ecdh_curve X25519:prime256v1:secp384r1;
        ssl_session_cache off;
        ssl_session_tickets off;

        add_header Strict-Transport-Security "max-age=63072000" always;
        add_header Content-Security-Policy "default-src 'self'; frame-ancestors 'none'; base-uri 'none'; form-action 'self'" always;
        add_header X-Content-Type-Options nosniff always;
        add_header X-Frame-Options DENY always;
        add_header Referrer-Policy no-referrer always;
        add_header Cache-Control $zeph_cache_control always;

        error_page 400 403 404 405 408 411 413 414 415 416 429 500 502 503 504 /.zeph-error;
        error_page 494 =431 /.zeph-error;

        # Uploads may be larger than JSON calls; the limit that applies is
        # chosen by the location, before any of the body is read. (Variables
        # keep their values over nginx's internal redirects, such as the one
        # to an error page: the path is matched again.)
        if ($zeph_upload_call) {
            rewrite ^(/(api|server)(/.*)?)$ /.zeph-upload$1 last;
        }

@PAGE@
        location / {
            return 404;
        }

        location ~ ^/(api|server)(/|$) {
            if ($http_content_encoding) {
                return 415;
            }
@PROXY@
        }

        location ^~ /.zeph-upload/ {
            if ($zeph_multipart = 0) {
                return 404;
            }
            if ($http_content_encoding) {
                return 415;
            }
            client_max_body_size 8m;
            rewrite ^/\.zeph-upload(/.*)$ $1 break;
@PROXY@
        }

        location = /.zeph-error {
            internal;
            # Checked again here otherwise, a body too large would be
            # refused once more, in nginx's own words.
            client_max_body_size 0;
            default_type application/json;
            charset off;
            return 200 '{"success":false,"error":{"code":$status,"data":{"message":"$zeph_error_message"}}}\n';
        }
    }
}
)";

constexpr char kProxy[] = R"(            proxy_pass http://unix:@SOCKET@:;
            proxy_request_buffering on;
            proxy_set_header X-Real-IP $remote_addr;
            proxy_hide_header Cache-Control;
            proxy_connect_timeout 5s;
            proxy_send_timeout 60s;
            # Calls that reach an ACME server may take minutes.
            proxy_read_timeout 1h;
            proxy_max_temp_file_size 64m;
)";

void ReplaceAll(std::string* text, const std::string& from,
                const std::string& to) {
  for (size_t at = text->find(from); at != std::string::npos;
       at = text->find(from, at + to.size())) {
    text->replace(at, from.size(), to);
  }
}

std::string PageLocations(const std::string& web_dir) {
  const std::string refusals =
      "            if ($zeph_page_refusal = 413) {\n"
      "                return 413;\n"
      "            }\n"
      "            if ($zeph_page_refusal = 405) {\n"
      "                return 405;\n"
      "            }\n";
  std::string out = "        location = / {\n" + refusals + "            root " +
                    web_dir + ";\n" + "            index index.html;\n" +
                    "        }\n";
  for (const char* file : kPageFiles) {
    out += std::string("        location = /") + file + " {\n" + refusals +
           "            root " + web_dir + ";\n" + "        }\n";
  }
  return out;
}

}  // namespace

const char* const kPageFiles[4] = {"index.html", "app.js", "api.js",
                                   "style.css"};

std::string CheckNginxPath(const std::string& path) {
  for (unsigned char c : path) {
    if (c <= 0x20 || c == 0x7f || c == '"' || c == '\'' || c == ';' ||
        c == '{' || c == '}' || c == '\\' || c == '$' || c == '#') {
      return "the path " + path +
             " holds a character nginx's configuration cannot take";
    }
  }
  return "";
}

std::string NginxConfigText(const NginxSettings& s) {
  std::string text = kTemplate;
  ReplaceAll(&text, "@PAGE@\n", PageLocations(s.web_dir));
  ReplaceAll(&text, "@PROXY@\n", kProxy);
  const std::map<std::string, std::string> values = {
      {"@RUN@", s.run_dir},
      {"@LISTEN@", s.listen},
      {"@CHAIN@", s.chain_path},
      {"@KEY@", s.key_path},
      {"@SOCKET@", s.api_socket},
      {"@USER@", s.worker_user.empty()
                     ? "# Not started as root: the workers run as its user."
                     : "user " + s.worker_user + ";"},
  };
  for (const auto& v : values) ReplaceAll(&text, v.first, v.second);
  return text;
}

}  // namespace webapid
}  // namespace ZEPH
