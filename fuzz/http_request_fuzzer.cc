// Raw HTTP into the web API server's routes on an httplib server without a socket: each input
// is one connection of up to four pipelined requests, served by the frame's real wrappers over
// recording workers (request line, headers, token, JSON and multipart bodies, routing). No
// upload directory may outlive its request.
#include <stddef.h>
#include <stdint.h>

#include <filesystem>
#include <string>
#include <string_view>

#include <httplib.h>

#include "fuzz/fuzz_support.h"
#include "host/module_loader.h"
#include "server/web_api_server.h"

namespace {

using ZEPH::fuzz::Die;

constexpr char kToken[] = "fuzz-token-0123456789abcdef";

class MemoryStream : public httplib::Stream {
 public:
  MemoryStream(const uint8_t* data, size_t size) : in_(reinterpret_cast<const char*>(data), size) {}
  bool is_readable() const override { return pos_ < in_.size(); }
  bool is_writable() const override { return true; }
  ssize_t read(char* ptr, size_t size) override {
    const size_t n = in_.copy(ptr, size, pos_);
    pos_ += n;
    return static_cast<ssize_t>(n);
  }
  ssize_t write(const char* ptr, size_t size) override {
    out_.append(ptr, size);
    return static_cast<ssize_t>(size);
  }
  void get_remote_ip_and_port(std::string& ip, int& port) const override {
    ip = "127.0.0.1";
    port = 40000;
  }
  void get_local_ip_and_port(std::string& ip, int& port) const override {
    ip = "127.0.0.1";
    port = 8443;
  }
  socket_t socket() const override { return INVALID_SOCKET; }
  bool exhausted() const { return pos_ >= in_.size(); }
  const std::string& out() const { return out_; }
 private:
  std::string_view in_;
  size_t pos_ = 0;
  std::string out_;
};
class MemoryServer : public httplib::Server {
 public:
  // Serves one request from `stream`; false when the connection is done.
  bool ServeOne(MemoryStream& stream) {
    bool closed = false;
    process_request(stream, false, closed, [](httplib::Request& req) {
      req.remote_addr = "127.0.0.1";
      req.remote_port = 40000;
    });
    return !closed && !stream.exhausted();
  }
};
// The httpd in front: nothing to restart, a fixed certificate.
struct NoHttpd : ZEPH::webapid::HttpdControl {
  void RestartRequested() override {}
  std::string Fingerprint() const override { return "00:11"; }
  std::string NotAfter() const override { return "never"; }
};
// Made once, never destroyed: the module, the server and its routes.
NoHttpd* const g_httpd = new NoHttpd;
MemoryServer* const g_http = new MemoryServer;
std::string UploadParent() { return ZEPH::fuzz::Root() + "/uploads"; }

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  std::string error;
  ZEPH::LoadedModule* module =
      ZEPH::LoadedModule::Open(ZEPH::ExecutableDir() + "/zeph_recording_module.so", &error)
          .release();
  if (module == nullptr) Die("cannot load the recording module: " + error);
  ZEPH::webapid::ServerSettings settings;
  settings.upload_parent = UploadParent();
  settings.services_file = ZEPH::fuzz::ArchivePath("/SERVICES");
  settings.events_file = ZEPH::fuzz::Root() + "/events.jsonl";
  ZEPH::fuzz::MakeDirs(settings.upload_parent);
  static auto* const api = new ZEPH::webapid::WebApiServer(module, g_httpd, kToken, settings);
  api->InstallRoutes(*g_http);
  // One access line per request would drown a fuzz run's own output.
  g_http->set_logger([](const httplib::Request&, const httplib::Response&) {});
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  MemoryStream stream(data, size);
  for (int i = 0; i < 4 && g_http->ServeOne(stream); ++i) continue;
  if (!stream.out().empty() && stream.out().compare(0, 9, "HTTP/1.1 ") != 0) {
    Die("an answer that is no HTTP/1.1 response");
  }
  std::error_code ec;
  if (!std::filesystem::is_empty(UploadParent(), ec) || ec) {
    Die("an upload directory outlived its request");
  }
  return 0;
}
