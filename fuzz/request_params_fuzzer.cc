// Request parameters through every wrapper of the method table.
//
// Input: one byte choosing the row, then the parameters as JSON text. The
// workers behind the wrappers are the recording stand-ins of the frame's
// tests, so what is fuzzed is the validation every request passes first.
// For each input the wrapper must write exactly one outcome: either its
// worker ran (and nothing else was written), or the worker did not run and
// the error is one a wrapper may answer, with a null result.
#include <json/json.h>
#include <stddef.h>
#include <stdint.h>

#include <string>

#include "fuzz/fuzz_support.h"
#include "module/frame/table.h"
#include "zeph/api.h"
#include "zeph/json_file.h"

extern std::string g_called_worker;

namespace {

size_t RowCount() {
  size_t n = 0;
  while (gTable[n].handler != nullptr) ++n;
  return n;
}

bool IsWrapperError(int code) {
  return code == 5503 || code == 5510 || code == 5511 || code == 5512;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const size_t rows = RowCount();
  if (size < 1) return -1;
  const ZEPH_API_TABLE& row = gTable[data[0] % rows];
  Json::Value params;
  if (!ZEPH::JsonParse(std::string(reinterpret_cast<const char*>(data + 1), size - 1),
                       params) ||
      !params.isObject()) {
    return -1;  // the server and zephcert only ever pass an object
  }

  g_called_worker.clear();
  const ZEPH::APIResponse response =
      ZEPH::fuzz::CallOnce(row.handler, params, std::string(row.api) + " " + row.method);
  if (g_called_worker.empty()) {
    if (response.outcome() != ZEPH::APIResponse::Outcome::kError ||
        !IsWrapperError(response.error_code()) || !response.data().isNull()) {
      ZEPH::fuzz::Die(std::string(row.api) + " " + row.method +
                      " answered without its worker: " +
                      std::to_string(response.error_code()));
    }
  } else if (response.outcome() != ZEPH::APIResponse::Outcome::kSuccess ||
             response.data().asString() != g_called_worker) {
    ZEPH::fuzz::Die(std::string(row.api) + " " + row.method +
                    " overwrote its worker's answer");
  }
  return 0;
}
