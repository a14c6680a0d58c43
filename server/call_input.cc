#include "server/call_input.h"

#include <errno.h>
#include <string.h>

#include "zeph/fd_io.h"
#include "zeph/json_file.h"

namespace ZEPH {
namespace webapid {
namespace {

bool IsFilePart(const std::string& name) {
  for (const char* part : kUploadParts) {
    if (name == part) return true;
  }
  return false;
}

std::string Printable(const std::string& text) {
  std::string out;
  for (unsigned char c : text.substr(0, 64)) {
    out.push_back(c >= 0x20 && c < 0x7f ? static_cast<char>(c) : '?');
  }
  return out;
}

}  // namespace

bool IsServerOnlyParam(const std::string& name) {
  for (const char* part : kUploadParts) {
    if (name == std::string(part) + "_tmp") return true;
  }
  return false;
}

CallInput::CallInput(std::string upload_parent)
    : upload_dir_(std::move(upload_parent), "zeph-webapid-upload") {}

void CallInput::Fail(int status, const std::string& message) {
  if (error_.status == 0) {
    error_.status = status;
    error_.message = message;
  }
  part_fd_.reset();
}

bool CallInput::Count(size_t size) {
  total_ += size;
  if (total_ > kMaxBodyBytes) {
    Fail(413, "request body over " + std::to_string(kMaxBodyBytes) + " bytes");
    return false;
  }
  return true;
}

bool CallInput::AddJson(const char* data, size_t size) {
  mode_ = Mode::kJson;
  if (!Count(size)) return false;
  if (error_.status != 0) return true;  // drain
  if (json_.size() + size > kMaxJsonBytes) {
    Fail(413, "JSON body over 1 MiB");
    json_.clear();
    return true;
  }
  json_.append(data, size);
  return true;
}

bool CallInput::BeginPart(const std::string& name,
                          const std::string& filename) {
  mode_ = Mode::kMultipart;
  part_fd_.reset();
  part_ = name;
  part_size_ = 0;
  part_is_params_ = false;
  if (error_.status != 0) return true;
  if (name == "params") {
    if (have_params_part_) {
      Fail(400, "more than one part \"params\"");
      return true;
    }
    have_params_part_ = true;
    part_is_params_ = true;
    return true;
  }
  if (!IsFilePart(name)) {
    Fail(400, "unexpected part \"" + Printable(name) + "\"");
    return true;
  }
  if (uploads_.count(name) != 0) {
    Fail(400, "more than one part \"" + name + "\"");
    return true;
  }
  if (!OpenUpload(name)) return true;
  uploads_[name].filename = filename;
  return true;
}

bool CallInput::AddPartData(const char* data, size_t size) {
  if (!Count(size)) return false;
  if (error_.status != 0) return true;  // drain
  part_size_ += size;
  if (part_is_params_) {
    if (part_size_ > kMaxJsonBytes) {
      Fail(413, "part \"params\" over 1 MiB");
      return true;
    }
    json_.append(data, size);
    return true;
  }
  if (!part_fd_ || !WriteAll(part_fd_.get(), data, size)) {
    Fail(500, "cannot store upload part \"" + part_ + "\": " + strerror(errno));
  }
  return true;
}

bool CallInput::OpenUpload(const std::string& name) {
  std::string path, why;
  part_fd_ = upload_dir_.Create(name, &path, &why);
  if (!part_fd_) {
    Fail(500, "cannot store upload part \"" + name + "\": " + why);
    return false;
  }
  uploads_[name].path = path;
  return true;
}

bool CallInput::Finish(Json::Value* params, CallError* error) {
  part_fd_.reset();
  if (error_.status != 0) {
    *error = error_;
    return false;
  }
  Json::Value parsed(Json::objectValue);
  if (!json_.empty() && !JsonParse(json_, parsed)) {
    *error = {400, mode_ == Mode::kMultipart
                       ? "part \"params\" is not valid JSON"
                       : "body is not valid JSON"};
    return false;
  }
  if (!parsed.isObject()) {
    *error = {400, "parameters must be one JSON object"};
    return false;
  }
  for (const std::string& name : parsed.getMemberNames()) {
    if (IsServerOnlyParam(name)) {
      *error = {400, "parameter \"" + name +
                         "\" is set by the server from an uploaded file part"};
      return false;
    }
  }
  for (const auto& entry : uploads_) {
    const std::string& name = entry.first;
    parsed[name + "_tmp"] = entry.second.path;
    if (!parsed.isMember(name)) {
      parsed[name] =
          entry.second.filename.empty() ? name : entry.second.filename;
    }
  }
  params->swap(parsed);
  return true;
}

}  // namespace webapid
}  // namespace ZEPH
