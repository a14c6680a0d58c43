#include <fcntl.h>
#include <gtest/gtest.h>
#include <openssl/err.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <string>

#include "module/archive/archive_testing.h"
#include "module/archive/cert_id.h"
#include "module/archive/checksum.h"
#include "module/archive/dir_ops.h"
#include "module/archive/expiry.h"
#include "module/archive/file_lock.h"
#include "module/archive/info.h"
#include "test_support.h"
#include "zeph/json_file.h"

namespace {

using ZEPH::cert::ArchiveDir;
using ZEPH::test::Exists;
using ZEPH::test::InfoEntry;
using ZEPH::test::InfoPath;
using ZEPH::test::JsonArray;
using ZEPH::test::MakeDirs;
using ZEPH::test::ModeOf;
using ZEPH::test::ReadFile;
using ZEPH::test::ServiceObject;
using ZEPH::test::WriteInfo;

void WriteFile(const std::string& path, const std::string& content, mode_t mode = 0644) {
  MakeDirs(path.substr(0, path.rfind('/')));
  ZEPH::test::WriteFile(path, content, mode);
}

class ArchiveTest : public ::testing::Test {
 protected:
  std::string P(const std::string& rel) const { return root_.Path("/" + rel); }
  std::string Archive(const std::string& rest = "") const { return ArchiveDir() + rest; }
  ZEPH::test::TempRoot root_;
};

TEST_F(ArchiveTest, IdsAndPathsStayInsideTheArchive) {
  ZEPH::test::Run({"/bin/rm", "-rf", Archive()});
  std::string path, id, path2, id2;
  EXPECT_FALSE(ZEPH::cert::MakeCrtDir(path, id));  // no archive yet
  MakeDirs(Archive());
  ASSERT_TRUE(ZEPH::cert::MakeCrtDir(path, id));
  ASSERT_TRUE(ZEPH::cert::MakeCrtDir(path2, id2));
  EXPECT_NE(id, id2);
  auto alnum = [](unsigned char c) { return isalnum(c) != 0; };
  EXPECT_TRUE(id.size() == 6 && std::all_of(id.begin(), id.end(), alnum)) << id;
  EXPECT_TRUE(path == Archive("/" + id) && ModeOf(path) == 0700u) << path;
  for (const char* name : {"a.b", "..x", "Ab3xYz", "Ab3xYz/sub"}) {
    for (const char* file : {"privkey.pem", "cert.pem", "fullchain.pem"}) {
      WriteFile(Archive("/") + name + "/" + file, "x");
    }
  }
  MakeDirs(Archive("d/Ab3xYz"));
  // "//Ab3xYz": the character after the prefix is taken.
  const std::pair<std::string, const char*> paths[] = {
      {Archive("/Ab3xYz"), "Ab3xYz"}, {Archive("/Ab3xYz/sub"), "Ab3xYz"},
      {Archive("//Ab3xYz"), "/Ab3xYz"}, {Archive("/Ab3xYz/cert.pem"), ""}, {Archive("/x"), ""},
      {Archive("/"), ""}, {Archive(), ""}, {"", ""}, {Archive("d/Ab3xYz"), ""},
      {"/usr/zeph/etc/certificate/_archive/Ab3xYz", ""}};
  for (const auto& row : paths) EXPECT_EQ(GetCrtId(row.first), row.second) << row.first;
  // A NUL byte would cut the path short: "Ab3xYz\0x" would look up Ab3xYz.
  const std::string nul_id("Ab3xYz\0x", 8), nul("\0", 1);
  for (const char* bad : {"", ".", "..", "a/b", "a.b", "..x", "/Ab3xYz", "Ab3xYz/", "Missing"}) {
    EXPECT_FALSE(IsCrtIdValid(bad)) << bad;
  }
  EXPECT_FALSE(IsCrtIdValid(nul_id) || IsCrtIdValid(nul) || IsCrtIdName(nul_id) ||
               IsCrtIdName(nul));
  EXPECT_EQ(root_.Log(), "");  // refusals without looking, or no directory
  EXPECT_TRUE(IsCrtIdValid("Ab3xYz"));
  unlink(Archive("/Ab3xYz/fullchain.pem").c_str());
  EXPECT_FALSE(IsCrtIdValid("Ab3xYz"));
  const std::string sys = P("usr/zeph/etc/certificate/");
  for (const char* dir : {"a/sub", "b"}) MakeDirs(sys + dir);
  WriteFile(sys + "a/cert.pem", "c");
  MakeDirs(P("usr/zeph/etc/etc"));
  MakeDirs(P("usr/local/etc/certificate/pkg/svc"));
  WriteFile(P("outside"), "s");
  ASSERT_EQ(symlink(P("usr").c_str(), (sys + "link").c_str()), 0);
  ASSERT_EQ(symlink(P("outside").c_str(), (sys + "a/out").c_str()), 0);
  ASSERT_EQ(symlink("../b", (sys + "a/to_b").c_str()), 0);
  ASSERT_EQ(symlink("cert.pem", (sys + "a/alias.pem").c_str()), 0);
  const struct { bool local; const char *base, *name; bool valid; } rows[] = {
      {false, "a", "", true}, {false, "a", "cert.pem", true}, {false, "a/sub/..", "sub", true},
      {false, "a", "alias.pem", true}, {false, "a/to_b", "", true}, {true, "pkg", "svc", true},
      {false, "", "", false}, {false, "x/../../etc", "", false}, {false, "a", "../b", false},
      {false, "a", "..", false}, {false, ".", "", false}, {false, "missing", "", false},
      {false, "a", "missing", false}, {true, "a", "", false}, {false, "link", "", false},
      {true, "../../../zeph/etc/certificate/a", "", false}, {false, "a", "out", false}};
  for (const auto& r : rows) EXPECT_EQ(IsCrtPathValid(r.local, r.base, r.name), r.valid) << r.base;
}

TEST_F(ArchiveTest, ChecksumsTakeTheFirstCertificateAndExpiryReadsIt) {
  for (const char* set : {"AAAAAA", "BBBBBB", "CCCCCC"}) ZEPH::test::MakeArchiveCert(set);
  auto cert = [&](const std::string& set) { return Archive("/" + set + "/cert.pem"); };
  const std::string b = ZEPH::test::OpensslFingerprint(cert("BBBBBB"));
  const std::string c = ZEPH::test::OpensslFingerprint(cert("CCCCCC"));
  ASSERT_EQ(b.size(), 64u);
  WriteFile(cert("CCCCCC"), ReadFile(cert("CCCCCC")) + ReadFile(cert("AAAAAA")));
  Json::Value info(Json::objectValue);
  info["AAAAAA"] = InfoEntry();
  info["CCCCCC"] = InfoEntry(JsonArray({ServiceObject("zeta", "last")}));
  info["BBBBBB"] =
      InfoEntry(JsonArray({ServiceObject("system", "default"), ServiceObject("pkg", "web", true)}));
  WriteInfo(info);
  Json::Value list, expected;  // a null value becomes the array
  ASSERT_TRUE(GenCrtChecksum(list));
  ASSERT_TRUE(ZEPH::JsonParse(  // sorted by id, then in array order
      R"([{"service": "default", "subscriber": "system", "checksum": ")" + b +
      R"("}, {"service": "web", "subscriber": "pkg", "checksum": ")" + b +
      R"("}, {"service": "last", "subscriber": "zeta", "checksum": ")" + c + R"("}])", expected));
  EXPECT_EQ(list, expected);
  info["AAAAAA"] = InfoEntry(JsonArray({ServiceObject("system", "default")}));
  info["BBBBBB"] = Json::Value(Json::objectValue);  // no "services"
  WriteInfo(info);
  ZEPH::test::MakeCertSet(P("elsewhere"), "other");
  // What cert.pem of CCCCCC becomes (null: as it is, while BBBBBB lacks "services"); the
  // OpenSSL queue is cleared before it is printed.
  const struct { const char* file; std::string line; } faults[] = {
      {nullptr, "Incorrect format for " + InfoPath()},
      {"link", "Invalid path for " + cert("CCCCCC") + ", " + P("elsewhere/cert.pem") + "."},
      {"", "Realpath " + cert("CCCCCC") + " failed. No such file or directory"},
      {"not a certificate\n", "Read X509 failed. []"}};
  for (const auto& row : faults) {
    if (row.file != nullptr) {
      info.removeMember("BBBBBB");
      WriteInfo(info);
      unlink(cert("CCCCCC").c_str());
      if (std::string(row.file) == "link") {
        ASSERT_EQ(symlink(P("elsewhere/cert.pem").c_str(), cert("CCCCCC").c_str()), 0);
      } else if (*row.file) {
        WriteFile(cert("CCCCCC"), row.file);
      }
    }
    list = Json::Value(Json::arrayValue);
    EXPECT_FALSE(GenCrtChecksum(list)) << row.line;
    EXPECT_TRUE(root_.LogContains(row.line)) << row.line;
    ASSERT_EQ(list.size(), 1u);  // what was appended stays
    EXPECT_EQ(list[0]["service"], "default");
  }
  for (const char* text : {"", "{\"AAAAAA\": ", "[1]"}) {  // missing, broken, no object
    ZEPH::test::WriteInfoText(text);
    root_.ClearLog();
    EXPECT_FALSE(GenCrtChecksum(list)) << text;
    EXPECT_TRUE(root_.LogContains("Open " + InfoPath() + " failed. ")) << text;
  }
  const std::string dir = P("certs");
  ASSERT_TRUE(ZEPH::test::MakeCertSet(dir, "expiry"));  // 365 days
  const std::string valid = dir + "/cert.pem", expired = dir + "/expired.pem";
  ZEPH::test::Run({"/usr/bin/openssl", "req", "-new", "-key", dir + "/privkey.pem", "-subj",
                   "/CN=dated", "-out", dir + "/dated.csr"});
  ASSERT_EQ(ZEPH::test::Run({"/usr/bin/openssl", "x509", "-req", "-in", dir + "/dated.csr", "-key",
                             dir + "/privkey.pem", "-days", "-1", "-out", expired}).status, 0);
  WriteFile(dir + "/valid-first.pem", ReadFile(valid) + ReadFile(expired));
  WriteFile(dir + "/expired-first.pem", ReadFile(expired) + ReadFile(valid));
  const struct { std::string file; int days; bool expires; } expiry[] = {
      {expired, 0, true}, {dir + "/expired-first.pem", 0, true}, {valid, 400, true},
      {valid, 300, false}, {dir + "/valid-first.pem", 0, false}, {dir + "/missing.pem", 0, false},
      {dir + "/privkey.pem", 10000, false}};
  for (const auto& r : expiry) EXPECT_EQ(isPemExpire(r.file, r.days), r.expires) << r.file;
  EXPECT_EQ(ERR_peek_error(), 0u);
  MakeDirs(Archive("/Le1234"));
  EXPECT_FALSE(CertificateRenewable("Le1234"));
  WriteFile(Archive("/Le1234/renew.json"), "");  // the content does not matter
  EXPECT_TRUE(CertificateRenewable("Le1234"));
}

TEST_F(ArchiveTest, InfoIsWrittenWholeAndDropsOnlyUnusedEntries) {
  const std::string info_path = InfoPath(), temp = info_path + ".temp";
  WriteFile(temp, "{\"half\": ");  // left by a crashed writer
  Json::Value catalog(Json::objectValue);
  catalog["unused"] = InfoEntry();
  catalog["other"] = InfoEntry(JsonArray({ServiceObject("s", "v")}));
  catalog["other"]["extra"] = "kept";
  ASSERT_TRUE(WriteCertInfo(catalog));
  EXPECT_EQ(ZEPH::test::ReadInfo(), catalog);
  EXPECT_FALSE(Exists(temp));
  ASSERT_TRUE(DropCertInfo("unused"));
  catalog.removeMember("unused");
  EXPECT_EQ(ZEPH::test::ReadInfo(), catalog);
  // An unknown id succeeds without a rewrite (which would change the inode).
  struct stat before, after;
  stat(info_path.c_str(), &before);
  EXPECT_TRUE(DropCertInfo("absent"));
  stat(info_path.c_str(), &after);
  EXPECT_EQ(before.st_ino, after.st_ino);
  Json::Value no_services = InfoEntry(), not_array = InfoEntry();
  no_services.removeMember("services");
  not_array["services"] = "none";
  const std::string wrong = "Wrong info: [Ab3xYz]", broken = "Broken [" + info_path + "].[0x";
  // A null entry: INFO is `text`.
  const struct { Json::Value entry; const char* text; std::string line; } refusals[] = {
      {InfoEntry(JsonArray({ServiceObject("system", "default")})), "", wrong},
      {no_services, "", wrong}, {not_array, "", wrong}, {Json::Value("text"), "", wrong},
      {Json::Value(), "{\"Ab3xYz\": {", broken}, {Json::Value(), "[]", broken},
      {Json::Value(), "", broken}};
  for (const auto& row : refusals) {
    catalog["Ab3xYz"] = row.entry;
    if (row.entry.isNull()) ZEPH::test::WriteInfoText(row.text); else WriteInfo(catalog);
    const std::string text = ReadFile(info_path);
    root_.ClearLog();
    EXPECT_FALSE(DropCertInfo("Ab3xYz")) << row.line;
    EXPECT_TRUE(root_.LogContains(row.line)) << row.line;
    EXPECT_EQ(ReadFile(info_path), text);
    EXPECT_EQ(Exists(info_path), !text.empty());
  }
  catalog.removeMember("Ab3xYz");
  WriteInfo(catalog);
  const std::string written = ReadFile(info_path);
  MakeDirs(temp);  // the temp file cannot be written
  EXPECT_FALSE(WriteCertInfo(Json::objectValue));
  EXPECT_EQ(ReadFile(info_path), written);
  rmdir(temp.c_str());
  ASSERT_EQ(unlink(info_path.c_str()), 0);
  MakeDirs(info_path + "/inside");  // the rename cannot replace it
  EXPECT_FALSE(WriteCertInfo(catalog));
  unlink(ZEPH::cert::InfoLockPath().c_str());
  ASSERT_EQ(rmdir(P("tmp").c_str()), 0);
  EXPECT_FALSE(DropCertInfo("Ab3xYz"));
  EXPECT_TRUE(root_.LogContains("Lock list file [" + ZEPH::cert::InfoLockPath() + "] failed"));
}

TEST_F(ArchiveTest, DirectoriesAreMovedWithABackupAndCopiesAreReadOnly) {
  const uid_t uid = ZEPH::test::UnprivilegedUid();
  const gid_t gid = ZEPH::test::UnprivilegedGid();
  auto expect_file = [](const std::string& file, const std::string& content, uid_t owner,
                        gid_t group, bool old_times) {
    struct stat st;
    ASSERT_EQ(stat(file.c_str(), &st), 0) << file;
    EXPECT_EQ(ReadFile(file), content);
    EXPECT_TRUE((st.st_mode & 07777) == 0400u && st.st_uid == owner && st.st_gid == group) << file;
    EXPECT_TRUE(!old_times || st.st_mtim.tv_sec == 1000000000) << file;
  };
  MakeDirs(P("tree/a/b"));
  WriteFile(P("tree/a/b/key.pem"), "k", 0400);
  chmod(P("tree/a/b").c_str(), 0500);
  ASSERT_TRUE(RemoveDir(P("tree")));
  EXPECT_FALSE(Exists(P("tree")) || RemoveDir(P("tree")));
  MakeDirs(P("work/old"));
  ASSERT_TRUE(CleanDir(P("work"), 0700) && CleanDir(P("new/parents/staging"), 0755));
  EXPECT_FALSE(Exists(P("work/old")));
  EXPECT_TRUE(ModeOf(P("work")) == 0700u && ModeOf(P("new/parents/staging")) == 0755u);
  WriteFile(P("plain"), "keep me");  // a plain file is neither removed nor cleaned
  EXPECT_FALSE(RemoveDir(P("plain")) || CleanDir(P("plain"), 0755));
  EXPECT_EQ(ReadFile(P("plain")), "keep me");
  MakeDirs(P("same"));
  EXPECT_TRUE(MoveDir(P("same"), P("same")));
  EXPECT_FALSE(MoveDir(P("gone"), P("gone")));  // the directory test comes first
  WriteFile(P("src/cert.pem"), "new");
  ASSERT_TRUE(MoveDir(P("src"), P("dst")));  // no target yet: no backup
  EXPECT_EQ(ReadFile(P("dst/cert.pem")), "new");
  WriteFile(P("src2/cert.pem"), "newer");
  WriteFile(P("dst/old.pem"), "old");
  MakeDirs(P("dst.bak/stale"));  // a stale backup is cleared first
  ASSERT_TRUE(MoveDir(P("src2"), P("dst")));
  EXPECT_EQ(ReadFile(P("dst/cert.pem")), "newer");
  for (const char* gone : {"src", "src2", "dst.bak", "dst/old.pem"}) EXPECT_FALSE(Exists(P(gone)));
  WriteFile(P("outer/cert.pem"), "staged");  // a directory cannot be renamed into itself
  WriteFile(P("outer/target/cert.pem"), "deployed", 0400);
  const timespec old_times[2] = {{1000000000, 0}, {1000000000, 0}};
  utimensat(AT_FDCWD, P("outer/target/cert.pem").c_str(), old_times, 0);
  EXPECT_FALSE(MoveDir(P("outer"), P("outer/target")));
  expect_file(P("outer/target/cert.pem"), "deployed", geteuid(), getegid(), true);
  EXPECT_FALSE(Exists(P("outer/target.bak")));
  EXPECT_EQ(ReadFile(P("outer/cert.pem")), "staged");
  const std::string dst = P("no/parent/dst");  // rename fails, and so does the restore
  EXPECT_FALSE(MoveDir(P("outer"), dst));
  EXPECT_TRUE(root_.LogContains("Failed to move " + dst + ".bak to " + dst + " ["));
  for (const char* content : {"certificate", "renewed"}) {  // the second replaces the first
    WriteFile(P("src/cert.pem"), content, 0644);
    ASSERT_TRUE(CopyCertFile(P("src"), P("dst"), "cert.pem", uid, gid));
    expect_file(P("dst/cert.pem"), content, uid, gid, false);
  }
  EXPECT_FALSE(CopyCertFile(P("src"), P("dst"), "chain.pem", uid, gid));  // no source
}

}  // namespace
