// Deployments from many processes at once while lock-free readers watch
// INFO: the INFO lock must serialise every read-modify-write, and the
// rename in WriteCertInfo must keep every read whole.
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <map>
#include <string>
#include <vector>

#include "module/archive/archive_testing.h"
#include "module/deploy/deploy.h"
#include "module/deploy/service.h"
#include "test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::test::ServiceObject;

constexpr int kWriters = 8;
constexpr int kRounds = 6;
const char* const kCerts[] = {"AAAAAA", "BBBBBB", "CCCCCC"};

std::string CertFor(int writer, int round) {
  return kCerts[(writer + round) % 3];
}
std::string Name(int writer) { return "svc" + std::to_string(writer); }

// Reads INFO without the lock until `stop` exists: every read must parse
// to an object binding no service twice, and every few reads a lookup
// under the shared lock must succeed. 0 when all went well.
int ReadUntilStopped(const std::string& stop) {
  long reads = 0;
  for (; access(stop.c_str(), F_OK) != 0; ++reads) {
    Json::Value info;
    if (!ZEPH::JsonFromFile(info, ZEPH::test::InfoPath()) || !info.isObject())
      return 1;
    std::map<std::string, int> seen;
    for (const std::string& id : info.getMemberNames()) {
      for (const Json::Value& service : info[id]["services"]) {
        if (++seen[service["service"].asString()] > 1) return 2;
      }
    }
    std::string id;
    if (reads % 4 == 0 && !GetServiceCertID(ServiceObject("sub", Name(0)), id))
      return 3;
  }
  return reads > 0 ? 0 : 4;
}

// Binds its own service to the certificate of each round in turn, once
// `go` reaches its end.
int BindInRounds(int writer, int go) {
  char byte;
  if (read(go, &byte, 1) != 0) return 10;
  std::string previous;
  for (int round = 0; round < kRounds; ++round) {
    const std::string target = CertFor(writer, round);
    if (!DeployCrt(target,
                   ZEPH::test::JsonArray({ServiceObject("sub", Name(writer))}),
                   previous, CRT_ACTION_SET)) {
      return 20 + round;
    }
    previous = target;
  }
  return 0;
}

TEST(DeployConcurrencyTest, ParallelBindingsLoseNoUpdate) {
  ZEPH::test::TempRoot root;
  Json::Value info(Json::objectValue);
  for (const char* id : kCerts) {
    ZEPH::test::MakeArchiveCert(id);
    info[id] = ZEPH::test::InfoEntry();
  }
  ZEPH::test::WriteInfo(info);
  const std::string stop = root.Path("/stop");
  const pid_t reader = fork();
  ASSERT_GE(reader, 0);
  if (reader == 0) _exit(ReadUntilStopped(stop));

  int go[2];
  ASSERT_EQ(pipe(go), 0);
  std::vector<pid_t> writers;
  for (int w = 0; w < kWriters; ++w) {
    const pid_t pid = fork();
    if (pid == 0) {
      close(go[1]);
      _exit(BindInRounds(w, go[0]));
    }
    writers.push_back(pid);
  }
  close(go[0]);
  close(go[1]);  // all writers start together
  for (int w = 0; w < kWriters; ++w) {
    int status = -1;
    waitpid(writers[w], &status, 0);
    EXPECT_EQ(status, 0) << "writer " << w;
  }
  ZEPH::test::WriteFile(stop, "");
  int status = -1;
  waitpid(reader, &status, 0);
  EXPECT_EQ(status, 0) << "reader";

  // Each service is bound exactly once, to its last round's certificate,
  // and holds that certificate's files.
  const Json::Value final_info = ZEPH::test::ReadInfo();
  for (int w = 0; w < kWriters; ++w) {
    const std::string expected = CertFor(w, kRounds - 1);
    std::vector<std::string> bound_to;
    for (const char* id : kCerts) {
      for (const Json::Value& service : final_info[id]["services"]) {
        if (service["service"].asString() == Name(w)) bound_to.push_back(id);
      }
    }
    EXPECT_EQ(bound_to, std::vector<std::string>{expected}) << Name(w);
    EXPECT_EQ(
        ZEPH::test::ReadFile(root.Path("/usr/zeph/etc/certificate/sub/" +
                                       Name(w) + "/cert.pem")),
        ZEPH::test::ReadFile(root.Path("/usr/zeph/etc/certificate/_archive/" +
                                       expected + "/cert.pem")));
  }
  EXPECT_EQ(root.Log().find("Failed"), std::string::npos) << root.Log();
}

}  // namespace
