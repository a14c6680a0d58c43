#include "zeph/json_file.h"

#include <errno.h>
#include <fcntl.h>
#include <unistd.h>

#include <memory>
#include <sstream>

#include "zeph/fd_io.h"
#include "zeph/qlibc_error.h"
#include "zeph/unique_fd.h"

namespace ZEPH {
namespace {

bool ReadFile(const std::string& path, std::string& out) {
  UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC));
  if (!fd) {
    QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
    return false;
  }
  if (!ReadAll(fd.get(), out)) {
    QLIBC_SET_ERROR(QLIBC_ERR_IO);
    return false;
  }
  return true;
}

}  // namespace

bool JsonParse(const std::string& text, Json::Value& value) {
  Json::CharReaderBuilder builder;
  Json::CharReaderBuilder::strictMode(&builder.settings_);
  builder["strictRoot"] = false;
  builder["allowTrailingCommas"] = false;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value parsed;
  std::string errors;
  if (!reader->parse(text.data(), text.data() + text.size(), &parsed, &errors)) {
    return false;
  }
  value.swap(parsed);
  return true;
}

std::string JsonCompact(const Json::Value& value) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = "";
  builder["emitUTF8"] = true;
  return Json::writeString(builder, value);
}

bool JsonFromFile(Json::Value& value, const std::string& path) {
  std::string text;
  if (!ReadFile(path, text)) return false;
  if (!JsonParse(text, value)) {
    QLIBC_SET_ERROR(QLIBC_ERR_INVALID_ARGUMENT);
    return false;
  }
  return true;
}

bool JsonToFile(const Json::Value& value, const std::string& path,
                bool styled) {
  std::string text;
  if (styled) {
    Json::StreamWriterBuilder builder;
    builder["indentation"] = "  ";
    builder["emitUTF8"] = true;
    text = Json::writeString(builder, value) + "\n";
  } else {
    text = JsonCompact(value) + "\n";
  }
  UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644));
  if (!fd) {
    QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
    return false;
  }
  if (!WriteAll(fd.get(), text)) {
    QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
    return false;
  }
  // The caller renames the file into place next; the content must be on
  // the disk first or a power cut could publish an empty file.
  if (fsync(fd.get()) != 0 || close(fd.release()) != 0) {
    QLIBC_SET_ERROR(QLIBC_ERR_IO);
    return false;
  }
  return true;
}

}  // namespace ZEPH
