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

const unsigned int kIds[] = {0x12B00001, 0x12B00002, 0x12B00003, 0x12B00004,
                             0x12B00005, 0x12B00006, 0x12B00007, 0x12B00008,
                             0x12B00009, 0x12B00010, 0x12B00011, 0x12B00012};

TEST(EventSentence, EachCertificateActionHasItsOwnSentence) {
  std::set<std::string> named, unnamed;
  for (unsigned int id : kIds) {
    const std::string with = EventSentence(id, "nas1", "FTP");
    const std::string without = EventSentence(id, "", "");
    EXPECT_EQ(with.find("Event 0x"), std::string::npos) << std::hex << id;
    EXPECT_EQ(without.find("\"\""), std::string::npos) << without;
    named.insert(with);
    unnamed.insert(without);
    if (id != 0x12B00011) {
      EXPECT_NE(with.find("\"nas1\""), std::string::npos) << with;
    }
  }
  EXPECT_EQ(named.size(), 12u);
  EXPECT_EQ(unnamed.size(), 12u);

  EXPECT_EQ(EventSentence(0x12B00003, "nas1", ""),
            "Certificate \"nas1\" was created.");
  EXPECT_EQ(EventSentence(0x12B00010, "", ""),
            "A certificate could not be recreated.");
  EXPECT_EQ(EventSentence(0x12B00007, "nas1", "FTP"),
            "Service \"FTP\" now uses certificate \"nas1\".");
  EXPECT_EQ(EventSentence(0x12B00008, "nas1", ""),
            "A service could not be bound to certificate \"nas1\".");
  // The ids between 0x12B00009 and 0x12B00010 are no certificate events.
  EXPECT_EQ(EventSentence(0x12B0000A, "nas1", ""), "Event 0x12B0000A.");

  // The renewal run's warning: name, services, day, days left.
  const char* const kWarnings[][5] = {
      {"nas1", "Web, FTP", "2026-12-01", "12",
       "Certificate \"nas1\" expires in 12 days (on 2026-12-01) and will not be "
       "renewed automatically. Web, FTP use it."},
      {"nas1", "FTP", "2026-12-01", "1",
       "Certificate \"nas1\" expires in 1 day (on 2026-12-01) and will not be renewed "
       "automatically. FTP uses it."},
      {"nas1", "FTP", "2026-12-01", "0",
       "Certificate \"nas1\" expires today (on 2026-12-01) and will not be renewed "
       "automatically. FTP uses it."},
      {"nas1", "FTP", "2026-11-01", "-3",
       "Certificate \"nas1\" expired on 2026-11-01 and is not renewed. FTP uses it."},
      {"", "", "", "", "A certificate expires today and will not be renewed automatically."},
  };
  for (const auto& w : kWarnings) {
    EXPECT_EQ(EventSentence(0x12B00013, w[0], w[1], w[2], w[3]), w[4]);
  }
}

TEST(ReadEvents, NewestFirstWithSentencesAndALimit) {
  TempRoot root;
  const std::string path = ZEPH::RootPath(ZEPH::webapid::kEventsFile);
  Json::Value events;
  ASSERT_TRUE(ReadEvents(path, 10, &events));  // no log yet
  EXPECT_TRUE(events.isArray());
  EXPECT_EQ(events.size(), 0u);

  ASSERT_EQ(ZEPHLogSet1(1, 1, 0x12B00003, "first", "", "", ""), 0);
  ASSERT_EQ(ZEPHLogSet1(1, 3, 0x12B00006, "second", "", "", ""), 0);
  ASSERT_EQ(ZEPHLogSet1(1, 1, 0x12B00007, "third", "Web", "", ""), 0);

  ASSERT_TRUE(ReadEvents(path, 10, &events));
  ASSERT_EQ(events.size(), 3u);
  EXPECT_EQ(events[0]["text1"].asString(), "third");
  EXPECT_EQ(events[0]["message"].asString(),
            "Service \"Web\" now uses certificate \"third\".");
  EXPECT_EQ(events[0]["severity"].asString(), "info");
  EXPECT_EQ(events[1]["message"].asString(),
            "Certificate \"second\" could not be deleted.");
  EXPECT_EQ(events[1]["severity"].asString(), "error");
  EXPECT_EQ(events[1]["message_id"].asUInt(), 0x12B00006u);
  EXPECT_EQ(events[2]["text1"].asString(), "first");

  ASSERT_TRUE(ReadEvents(path, 2, &events));
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[1]["text1"].asString(), "second");
}

TEST(ReadEvents, SkipsBrokenLinesAndReadsOnlyTheTailOfAHugeLog) {
  TempRoot root;
  const std::string path = ZEPH::RootPath(ZEPH::webapid::kEventsFile);
  ZEPH::test::MakeDirs(root.Path("/var/log/zeph"));
  // 5 MiB of old events, then junk, then two events.
  std::string old_line =
      "{\"time\":1,\"type\":1,\"level\":1,\"message_id\":313524225,\"text1\":"
      "\"old\","
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
  EXPECT_EQ(events[1]["message"].asString(),
            "The certificates were reset to a new default certificate.");
  EXPECT_EQ(events[2]["text1"].asString(), "old");
  EXPECT_EQ(events[2]["message"].asString(),
            "Certificate \"old\" was made the default certificate.");

  // The tail alone holds fewer lines than the file.
  ASSERT_TRUE(ReadEvents(path, 1u << 30, &events));
  EXPECT_LT(events.size(), content.size() / old_line.size());
  EXPECT_GT(events.size(), (4u << 20) / old_line.size() - 2);
}

TEST(ReadEvents, AnUnreadableLogIsAnError) {
  TempRoot root;
  ZEPH::test::MakeDirs(root.Path("/log/events.jsonl"));  // a directory
  Json::Value events;
  EXPECT_FALSE(ReadEvents(root.Path("/log/events.jsonl"), 10, &events));
}

}  // namespace
