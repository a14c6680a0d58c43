#include "module/methods/action_log.h"

#include <stdint.h>

#include <openssl/pem.h>

#include "module/archive/cert_id.h"
#include "module/common/paths.h"
#include "module/common/ssl_ptr.h"
#include "zeph/root.h"
#include "zeph/system.h"
#include "zeph/unique_fd.h"

namespace {

constexpr int kEventType = 1;
constexpr int kLevelInfo = 1;
constexpr int kLevelError = 3;
constexpr uint32_t kNoMessage = 0;

struct ActionMessages {
  uint32_t success;
  uint32_t failure;  // kNoMessage: failures are not recorded
};

// Indexed by CERT_ACTION. After 0x12B00009 the ids go on at 0x12B00010:
// the log viewer's catalogue is keyed by these exact values.
constexpr ActionMessages kMessages[] = {
    {0x12B00001, 0x12B00002},  // set default
    {0x12B00003, kNoMessage},  // create
    {0x12B00004, kNoMessage},  // replace
    {0x12B00005, 0x12B00006},  // delete
    {0x12B00007, 0x12B00008},  // service set
    {0x12B00009, 0x12B00010},  // recreate
    {0x12B00011, 0x12B00012},  // reset
};

}  // namespace

std::string GetCrtSubjectCN(const std::string& id) {
  if (!IsCrtIdValid(id)) return "";
  const std::string path = ZEPH::RootPath(ZEPH::cert::kArchiveDir) + "/" + id + "/cert.pem";
  ZEPH::UniqueFile file(fopen(path.c_str(), "re"));
  if (!file) return "";
  ZEPH::ssl::X509Ptr cert(PEM_read_X509(file.get(), nullptr, nullptr, nullptr));
  if (!cert) return "";
  char buf[1024] = {0};
  X509_NAME_get_text_by_NID(X509_get_subject_name(cert.get()), NID_commonName,
                            buf, sizeof(buf));
  return buf;
}

void LogAction(CERT_ACTION action, bool success, const std::string& id,
               const std::string& name, const std::string& extra) {
  std::string display;
  if (!id.empty()) display = GetCrtSubjectCN(id);
  if (display.empty()) display = name;
  const int index = static_cast<int>(action);
  if (index < 0 || index >= static_cast<int>(std::size(kMessages))) return;
  const uint32_t message =
      success ? kMessages[index].success : kMessages[index].failure;
  if (message == kNoMessage) return;
  const std::string second = action == CERT_ACTION_SERVICE_SET ? extra : "";
  ZEPHLogSet1(kEventType, success ? kLevelInfo : kLevelError, message,
              display.c_str(), second.c_str(), "", "");
}
