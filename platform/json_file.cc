#include "zeph/json_file.h"

#include <errno.h>
#include <fcntl.h>
#include <unistd.h>

#include <memory>
#include <sstream>

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
  char buf[16384];
  for (;;) {
    ssize_t n = read(fd.get(), buf, sizeof(buf));
    if (n == 0) return true;
    if (n < 0) {
      if (errno == EINTR) continue;
      QLIBC_SET_ERROR(QLIBC_ERR_IO);
      return false;
    }
    out.append(buf, static_cast<size_t>(n));
  }
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
  size_t done = 0;
  while (done < text.size()) {
    ssize_t n = write(fd.get(), text.data() + done, text.size() - done);
    if (n < 0) {
      if (errno == EINTR) continue;
      QLIBC_SET_ERROR(QLIBCErrFromErrno(errno));
      return false;
    }
    done += static_cast<size_t>(n);
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
