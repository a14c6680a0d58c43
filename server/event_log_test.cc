#include "server/event_log.h"

#include <gtest/gtest.h>

#include <set>

#include "test_support.h"
#include "zeph/root.h"
#include "zeph/system.h"

namespace {

using ZEPH::test::TempRoot;
using ZEPH::webapid::EventSentence;
using ZEPH::webapid::ReadEvents;

TEST(EventSentence, EachCertificateActionHasItsOwnSentence) {
  std::set<std::string> named, unnamed;
  for (unsigned int id : {0x12B00001, 0x12B00002, 0x12B00003, 0x12B00004, 0x12B00005, 0x12B00006,
                          0x12B00007, 0x12B00008, 0x12B00009, 0x12B00010, 0x12B00011, 0x12B00012}) {
    const std::string with = EventSentence(id, "nas1", "FTP"), without = EventSentence(id, "", "");
    EXPECT_EQ(with.find("Event 0x"), std::string::npos) << std::hex << id;
    EXPECT_EQ(without.find("\"\""), std::string::npos) << without;
    if (id != 0x12B00011) {
      EXPECT_NE(with.find("\"nas1\""), std::string::npos) << with;
    }
    named.insert(with);
    unnamed.insert(without);
  }
  EXPECT_EQ(named.size(), 12u);
  EXPECT_EQ(unnamed.size(), 12u);

  // id, name, services, day, days left: the sentence.
  const char* const kRows[][6] = {
      {"0x12B00003", "nas1", "", "", "", "Certificate \"nas1\" was created."},
      {"0x12B00010", "", "", "", "", "A certificate could not be recreated."},
      {"0x12B00007", "nas1", "FTP", "", "", "Service \"FTP\" now uses certificate \"nas1\"."},
      {"0x12B00008", "nas1", "", "", "", "A service could not be bound to certificate \"nas1\"."},
      {"0x12B0000A", "nas1", "", "", "", "Event 0x12B0000A."},
      {"0x12B00013", "nas1", "Web, FTP", "2026-12-01", "12",
       "Certificate \"nas1\" expires in 12 days (on 2026-12-01) and will not be renewed automatically. "
       "Web, FTP use it."},
      {"0x12B00013", "nas1", "FTP", "2026-12-01", "1",
       "Certificate \"nas1\" expires in 1 day (on 2026-12-01) and will not be renewed automatically. "
       "FTP uses it."},
      {"0x12B00013", "nas1", "FTP", "2026-12-01", "0",
       "Certificate \"nas1\" expires today (on 2026-12-01) and will not be renewed automatically. "
       "FTP uses it."},
      {"0x12B00013", "nas1", "FTP", "2026-11-01", "-3",
       "Certificate \"nas1\" expired on 2026-11-01 and is not renewed. FTP uses it."},
      {"0x12B00013", "", "", "", "", "A certificate expires today and will not be renewed automatically."},
  };
  for (const auto& r : kRows) {
    EXPECT_EQ(EventSentence(std::stoul(r[0], nullptr, 16), r[1], r[2], r[3], r[4]), r[5]);
  }
}

TEST(ReadEvents, NewestFirstWithSentencesSeveritiesAndALimit) {
  TempRoot root;
  const std::string path = ZEPH::RootPath(ZEPH::webapid::kEventsFile);
  Json::Value events;
  ASSERT_TRUE(ReadEvents(path, 10, &events));  // no log yet
  EXPECT_EQ(events, Json::Value(Json::arrayValue));

  ASSERT_EQ(ZEPHLogSet1(1, 1, 0x12B00003, "first", "", "", ""), 0);
  ASSERT_EQ(ZEPHLogSet1(1, 3, 0x12B00006, "second", "", "", ""), 0);
  ASSERT_EQ(ZEPHLogSet1(1, 2, 0x12B00013, "third", "Web", "2026-12-01", "5"), 0);
  ASSERT_EQ(ZEPHLogSet1(1, 1, 0x12B00007, "fourth", "Web", "", ""), 0);
  ASSERT_TRUE(ReadEvents(path, 10, &events));
  ASSERT_EQ(events.size(), 4u);
  // text1, message, severity of each, newest first.
  const char* const kExpected[][3] = {
      {"fourth", "Service \"Web\" now uses certificate \"fourth\".", "info"},
      {"third", "Certificate \"third\" expires in 5 days (on 2026-12-01) and will not be renewed "
                "automatically. Web uses it.", "warning"},
      {"second", "Certificate \"second\" could not be deleted.", "error"},
      {"first", "Certificate \"first\" was created.", "info"},
  };
  for (Json::ArrayIndex i = 0; i < events.size(); ++i) {
    EXPECT_EQ(events[i]["text1"].asString(), kExpected[i][0]);
    EXPECT_EQ(events[i]["message"].asString(), kExpected[i][1]);
    EXPECT_EQ(events[i]["severity"].asString(), kExpected[i][2]);
  }
  EXPECT_EQ(events[2]["message_id"].asUInt(), 0x12B00006u);
  ASSERT_TRUE(ReadEvents(path, 2, &events));
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[1]["text1"].asString(), "third");

  // A directory where the log should be is an error.
  ZEPH::test::MakeDirs(root.Path("/log/events.jsonl"));
  EXPECT_FALSE(ReadEvents(root.Path("/log/events.jsonl"), 10, &events));
}

TEST(ReadEvents, SkipsBrokenLinesAndReadsOnlyTheTailOfAHugeLog) {
  TempRoot root;
  const std::string path = ZEPH::RootPath(ZEPH::webapid::kEventsFile);
  ZEPH::test::MakeDirs(root.Path("/var/log/zeph"));
  // 5 MiB of old events, then junk, then two events.
  const std::string old_line =
      "{\"time\":1,\"type\":1,\"level\":1,\"message_id\":313524225,\"text1\":\"old\","
      "\"text2\":\"\",\"text3\":\"\",\"text4\":\"\"}\n";
  std::string content;
  while (content.size() < (5u << 20)) content += old_line;
  content += "not json\n[1,2]\n{\"message_id\":\"text\"}\n\n";
  ZEPH::test::WriteFile(path, content);
  ASSERT_EQ(ZEPHLogSet1(1, 1, 0x12B00011, "", "", "", ""), 0);
  ASSERT_EQ(ZEPHLogSet1(1, 1, 0x12B00005, "gone", "", "", ""), 0);

  Json::Value events;
  ASSERT_TRUE(ReadEvents(path, 1000, &events));
  ASSERT_EQ(events.size(), 1000u);
  EXPECT_EQ(events[0]["text1"].asString(), "gone");
  EXPECT_EQ(events[1]["message"].asString(), "The certificates were reset to a new default certificate.");
  EXPECT_EQ(events[2]["message"].asString(), "Certificate \"old\" was made the default certificate.");
  // The tail alone holds fewer lines than the file.
  ASSERT_TRUE(ReadEvents(path, 1u << 30, &events));
  EXPECT_LT(events.size(), content.size() / old_line.size());
  EXPECT_GT(events.size(), (4u << 20) / old_line.size() - 2);
}

}  // namespace
