#include <gtest/gtest.h>

#include "module/methods/action_log.h"
#include "module/methods/methods_test_support.h"

namespace {

using ZEPH::test::ApplianceRoot;

TEST(ActionLog, MessageIdsLevelsAndDisplayNames) {
  ApplianceRoot root;
  const std::string id = root.CreateCertificate("nas1");
  const size_t base = root.Events().size();

  LogAction(CERT_ACTION_DELETE, true, id, "x", "ignored");
  LogAction(CERT_ACTION_SERVICE_SET, false, id, "x", "FTP");
  LogAction(CERT_ACTION_CREATE, false, id, "x", "");
  LogAction(CERT_ACTION_REPLACE, false, id, "x", "");
  LogAction(static_cast<CERT_ACTION>(7), true, id, "x", "");
  LogAction(CERT_ACTION_RECREATE, false, "", "fallback", "");
  ZEPH::test::Run({"/bin/rm", "-rf", root.Archive("/" + id)});
  LogAction(CERT_ACTION_RESET, true, id, "x", "");

  std::vector<Json::Value> events = root.Events();
  ASSERT_EQ(events.size() - base, 4u);
  const struct {
    unsigned id;
    int level;
    const char* text1;
    const char* text2;
  } expected[] = {
      {0x12B00005, 1, "nas1", ""},
      {0x12B00008, 3, "nas1", "FTP"},
      {0x12B00010, 3, "fallback", ""},
      {0x12B00011, 1, "x", ""},
  };
  for (size_t i = 0; i < 4; ++i) {
    const Json::Value& e = events[base + i];
    EXPECT_EQ(e["message_id"].asUInt(), expected[i].id) << i;
    EXPECT_EQ(e["type"].asInt(), 1);
    EXPECT_EQ(e["level"].asInt(), expected[i].level) << i;
    EXPECT_EQ(e["text1"].asString(), expected[i].text1) << i;
    EXPECT_EQ(e["text2"].asString(), expected[i].text2) << i;
    EXPECT_EQ(e["text3"].asString(), "");
  }
  EXPECT_EQ(GetCrtSubjectCN(id), "");
  EXPECT_EQ(GetCrtSubjectCN("../x"), "");
}

}  // namespace
