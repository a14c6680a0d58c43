#include "zeph/api.h"

namespace ZEPH {
namespace {

thread_local DownloadSink* t_download_sink = nullptr;

}  // namespace

APIRequest::APIRequest(Json::Value params) : params_(std::move(params)) {}

Json::Value APIRequest::GetParam(const std::string& name,
                                 const Json::Value& fallback) const {
  if (!params_.isObject() || !params_.isMember(name)) return fallback;
  return params_[name];
}

bool APIRequest::HasParam(const std::string& name) const {
  return params_.isObject() && params_.isMember(name);
}

void APIResponse::SetSuccess(const Json::Value& data) {
  outcome_ = Outcome::kSuccess;
  ++outcome_count_;
  error_code_ = 0;
  data_ = data;
}

void APIResponse::SetError(int code, const Json::Value& data) {
  outcome_ = Outcome::kError;
  ++outcome_count_;
  error_code_ = code;
  data_ = data;
}

DownloadSink::~DownloadSink() = default;

ScopedDownloadSink::ScopedDownloadSink(DownloadSink* sink)
    : previous_(t_download_sink) {
  t_download_sink = sink;
}

ScopedDownloadSink::~ScopedDownloadSink() { t_download_sink = previous_; }

APIDownload::APIDownload() : sink_(t_download_sink) {}

APIDownload::~APIDownload() = default;

void APIDownload::SetHeader(const std::string& name, const std::string& value) {
  headers_.emplace_back(name, value);
}

bool APIDownload::Output(const std::string& path) {
  if (sink_ == nullptr || done_) return false;
  done_ = true;
  return sink_->Deliver(headers_, path);
}

}  // namespace ZEPH
