// JSON documents in files.
//
// The distribution's jsoncpp cannot be given members, so the platform's
// Json::Value::fromFile / toFile are free functions with the same contract.
//
// Thread-safety: safe from any thread.
#ifndef ZEPH_JSON_FILE_H_
#define ZEPH_JSON_FILE_H_

#include <json/json.h>

#include <string>

#include "zeph/export.h"

namespace ZEPH {

// Parses the file at `path` into `value`. False, with `value` untouched,
// when the file is missing, unreadable or not one well-formed JSON document
// (comments are not allowed; trailing content is an error).
ZEPH_EXPORT bool JsonFromFile(Json::Value& value, const std::string& path);

// Writes `value` to `path` (created with mode 0644 or truncated) and syncs
// it to the disk before returning, so that a following rename(2) publishes
// complete content. `styled` true writes indented text, false one compact
// line. False on any failure; the file may then hold partial content.
ZEPH_EXPORT bool JsonToFile(const Json::Value& value, const std::string& path,
                            bool styled);

// Parses `text` as one JSON document; false on malformed text.
ZEPH_EXPORT bool JsonParse(const std::string& text, Json::Value& value);

// One compact line of JSON text for `value`, without a line end.
ZEPH_EXPORT std::string JsonCompact(const Json::Value& value);

}  // namespace ZEPH

#endif  // ZEPH_JSON_FILE_H_
