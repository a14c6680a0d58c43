// Request, response and download objects of the web API.
//
// A server (or the zephcert command) makes one APIRequest and one
// APIResponse per call, hands both to the handler of the method table row,
// and reads the outcome from the response afterwards. Handlers run on the
// caller's thread; the objects are not shared between threads.
//
// Downloads: a handler that answers with a file makes an APIDownload on its
// stack. The download delivers into the DownloadSink that the caller
// installed for the calling thread with ScopedDownloadSink before calling
// the handler; without a sink, Output fails.
#ifndef ZEPH_API_H_
#define ZEPH_API_H_

#include <json/json.h>

#include <string>
#include <utility>
#include <vector>

#include "zeph/export.h"

namespace ZEPH {

class ZEPH_EXPORT APIRequest {
 public:
  // `params` should be a JSON object; anything else has no parameters.
  explicit APIRequest(Json::Value params = Json::Value(Json::objectValue));

  // The parameter `name`, or `fallback` when absent.
  Json::Value GetParam(const std::string& name,
                       const Json::Value& fallback) const;
  // Whether the parameter `name` is present (a JSON null counts as present).
  bool HasParam(const std::string& name) const;

  const Json::Value& Params() const { return params_; }

 private:
  Json::Value params_;
};

class ZEPH_EXPORT APIResponse {
 public:
  enum class Outcome { kNone, kSuccess, kError };

  // Marks the call successful with `data` as its result.
  void SetSuccess(const Json::Value& data);
  // Marks the call failed with `code` and `data`.
  void SetError(int code, const Json::Value& data);
  // Asks the server to take up the web server's certificate again after the
  // answer is sent.
  void SetHttpdRestart(bool restart) { httpd_restart_ = restart; }
  // False when the handler writes raw bytes itself (a download).
  void SetEnableOutput(bool enable) { enable_output_ = enable; }

  Outcome outcome() const { return outcome_; }
  // How many outcomes were written; a well-behaved handler writes one.
  int outcome_count() const { return outcome_count_; }
  int error_code() const { return error_code_; }
  const Json::Value& data() const { return data_; }
  bool httpd_restart() const { return httpd_restart_; }
  bool enable_output() const { return enable_output_; }

 private:
  Outcome outcome_ = Outcome::kNone;
  int outcome_count_ = 0;
  int error_code_ = 0;
  Json::Value data_;
  bool httpd_restart_ = false;
  bool enable_output_ = true;
};

using HeaderList = std::vector<std::pair<std::string, std::string>>;

// Where a download's bytes go. Implemented by the server and by zephcert.
class ZEPH_EXPORT DownloadSink {
 public:
  virtual ~DownloadSink();
  // Delivers the file at `path` as the answer body with `headers`. True on
  // success.
  virtual bool Deliver(const HeaderList& headers, const std::string& path) = 0;
};

// Installs `sink` as the calling thread's download sink for its lifetime and
// restores the previous one afterwards.
class ZEPH_EXPORT ScopedDownloadSink {
 public:
  explicit ScopedDownloadSink(DownloadSink* sink);
  ~ScopedDownloadSink();
  ScopedDownloadSink(const ScopedDownloadSink&) = delete;
  ScopedDownloadSink& operator=(const ScopedDownloadSink&) = delete;

 private:
  DownloadSink* previous_;
};

class ZEPH_EXPORT APIDownload {
 public:
  APIDownload();
  ~APIDownload();
  APIDownload(const APIDownload&) = delete;
  APIDownload& operator=(const APIDownload&) = delete;

  // Adds a header to the raw answer; call before Output.
  void SetHeader(const std::string& name, const std::string& value);
  // Sends the bytes of the file at `path` as the answer body. False when no
  // sink is installed, the download was already output, or delivery failed.
  bool Output(const std::string& path);

 private:
  DownloadSink* sink_;
  HeaderList headers_;
  bool done_ = false;
};

}  // namespace ZEPH

#endif  // ZEPH_API_H_
