// Request parameters (after a byte choosing the table row) through every wrapper over
// recording workers: the worker ran and its answer stands, or a wrapper's error, null data.
#include <json/json.h>
#include <stddef.h>
#include <stdint.h>

#include <string>

#include "fuzz/fuzz_support.h"
#include "module/frame/table.h"
#include "zeph/api.h"
#include "zeph/json_file.h"

extern std::string g_called_worker;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const size_t rows = [] {
    size_t n = 0;
    while (gTable[n].handler != nullptr) ++n;
    return n;
  }();
  Json::Value params;
  if (size < 1 ||
      !ZEPH::JsonParse(std::string(reinterpret_cast<const char*>(data + 1), size - 1), params) ||
      !params.isObject()) {
    return -1;  // the server and zephcert only ever pass an object
  }
  const ZEPH_API_TABLE& row = gTable[data[0] % rows];
  const std::string what = std::string(row.api) + " " + row.method;
  g_called_worker.clear();
  const ZEPH::APIResponse response = ZEPH::fuzz::CallOnce(row.handler, params, what);
  const int code = response.error_code();
  if (g_called_worker.empty()) {
    if (response.outcome() != ZEPH::APIResponse::Outcome::kError ||
        (code != 5503 && code != 5510 && code != 5511 && code != 5512) ||
        !response.data().isNull()) {
      ZEPH::fuzz::Die(what + " answered without its worker: " + std::to_string(code));
    }
  } else if (response.outcome() != ZEPH::APIResponse::Outcome::kSuccess ||
             response.data().asString() != g_called_worker) {
    ZEPH::fuzz::Die(what + " overwrote its worker's answer");
  }
  return 0;
}
