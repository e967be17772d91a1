// Whether paths and shares are indexed, the folder list and one folder under the lock; the fast
// folder.conf reader against the strict parse.
#include <fcntl.h>
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/index_mgr.h>
#include <sys/file.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "internal/folder_conf_view.h"
#include "internal/json_io.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using Strings = std::vector<std::string>;
using QueriesTest = SysrootTest;

// Whole components, byte for byte; a folder without a share name is logged and skipped. The same
// through the fast reader and through the strict parse, which alone reads names escaped as "\/".
TEST_F(QueriesTest, PathTestsMatchWholeComponentsByteForByte) {
  AddShare("video");
  for (const std::string slash : {"/", "\\/"}) {
    SCOPED_TRACE(slash);
    WriteFile(FolderConfPath(), "{\"" + slash + "video" + slash + "movies\": {\"name\": \"n\"}}");
    for (const char* path : {"/video/movies/a/b", "/video/movies/"}) EXPECT_EQ(FILEIDXIsPathIndexed(path), 1);
    for (const char* path : {"/video//movies", "/video/movies2", "/Video/movies"})
      EXPECT_EQ(FILEIDXIsPathIndexed(path), 0) << path;
    EXPECT_TRUE(IndexMgr::IsPathContainIndexed("/video"));
    EXPECT_FALSE(IndexMgr::IsPathContainIndexed("/vid"));
    EXPECT_EQ(FILEIDXIsFullPathIndexed(Rooted("/volume1/video/movies").c_str()), 1);
    EXPECT_EQ(FILEIDXIsFullPathIndexed(Rooted("/volume1/video/movies2").c_str()), 0);
    WriteFile(FolderConfPath(), "{\"\": {}, \"" + slash + "video" + slash + "movies\": {}}");
    logcap::Clear();
    EXPECT_EQ(FILEIDXIsShareIndexed("video"), 1);
    EXPECT_EQ(FILEIDXIsShareIndexed("Video"), 0);
    EXPECT_EQ(logcap::Count(" GetShareNameByPath failed, path="), 2);
    EXPECT_EQ(logcap::Count(" Failed to get share name from path: "), 2);
  }
}

// No file means no folders; a broken file fails every query rather than answering "not indexed";
// Get fails with a lock error while another holder has the lock, and lets go of it on its way out.
TEST_F(QueriesTest, BrokenConfigFailsEveryQueryAndGetReleasesTheLock) {
  std::vector<Folder> folders(2);
  EXPECT_TRUE(IndexMgr::List(folders));
  EXPECT_TRUE(folders.empty());
  AddShare("video");
  WriteFile(FolderConfPath(), "{\"/video/movies\": {}");
  Json::Value result;
  EXPECT_FALSE(IndexMgr::List(folders) || IndexMgr::IsPathContainIndexed("/video") ||
               FILEIDXIsShareIndexed("video") != 0 || IndexMgr::Get(result, "/video/movies"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOAD_CONFIG);
  WriteFile(FolderConfPath(), R"({"/video/movies": {"name": "n"}})");
  EXPECT_FALSE(IndexMgr::Get(result, "/video/other"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_NO_SUCH_FOLDER);
  // Another open file, so the library's own flock conflicts; taken only if every call above let go.
  int fd = ::open(Rooted("/tmp/fileidx_cfg_folder.lock").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  ASSERT_EQ(::flock(fd, LOCK_EX | LOCK_NB), 0);
  EXPECT_FALSE(IndexMgr::Get(result, "/video/movies"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  ::close(fd);
  ASSERT_TRUE(IndexMgr::Get(result, "/video/movies"));
  EXPECT_EQ(result["path"], "/video/movies");
}

// A record as a folder is loaded from it: its path, "name" when a string, each flag held as a boolean.
Strings Described(const std::vector<internal::FolderConfRecord>& records) {
  Strings out;
  for (const auto& r : records) {
    out.push_back(std::string(r.path.data, r.path.size) + "|" +
                  (r.name ? std::string(r.name, r.nameSize) : "-"));
    for (signed char flag : r.flags) out.back() += flag < 0 ? "-" : std::to_string(flag);
  }
  return out;
}
Strings Described(const Json::Value& doc) {
  Strings out;
  for (auto it = doc.begin(); it != doc.end(); ++it) {
    const Json::Value& r = *it;
    out.push_back(it.name() + "|" + (r.isObject() && r["name"].isString() ? r["name"].asString() : "-"));
    for (const char* flag : {"document", "audio", "video", "photo"})
      out.back() += !r.isObject() || !r[flag].isBool() ? "-" : r[flag].asBool() ? "1" : "0";
  }
  return out;
}

// Wherever the fast reader decides a text (seeds and their one-byte edits), the strict parse reads an
// object with exactly these records, in this order, holding these values.
TEST(FolderConfViewTest, AgreesWithTheStrictParseWhereverItDecides) {
  const Strings seeds{
      R"({"/a":{"audio":1,"name":null,"photo":true},"/b":"x","/c":{"document":false,"name":"plain",)"
      R"("video":"true","x":{"name":"in","audio":true}}})",
      R"({"/d":{"audio":true,"audio":false},"/e":{"name":"a","name":"b"},"/f":{"name":"c","photo":false}})",
      "{\n  \"\" : { \"n\" : [ 1, -2, 0, null, { } ] },\r\n\t\"/v\" : {\"path\":\"/v\",\"x\":-0} }\n",
      R"({"/a":{},"/a/":{},"/b":[],"/b\u0000":{},"/\u00e9":{}, "/b":{}})",
      R"({"/x":{"d":123456789012345678,"e":1.5,"f":1e3,"g":01,"h":"\ud800\u0041","i":"\ud800"}})",
      "{\"/z\":{\"a\":{\"b\":{\"c\":[[[true]]]}}},\"/\xc3\xa9\xff\":{\"name\":\"\xe2\x82\xac\"}}"};
  const Strings kInserted{
      "\"", "{", "}", "[",  "]",    ",",   ":",     "\\",  " ",         "0",
      "-",  "e", "/", "\n", "\x01", "\\u", "//x\n", "1.5", "\"/\":{},", std::string(1, '\0')};
  Strings texts{"{" + std::string(70, '[') + std::string(70, ']') + "}",
                "{\"/d\":" + std::string(70, '[') + std::string(70, ']') + "}"};
  for (const std::string& s : seeds)
    for (size_t i = 0; i <= s.size(); ++i) {
      if (i < s.size()) texts.push_back(s.substr(0, i) + s.substr(i + 1));
      for (const std::string& add : kInserted) texts.push_back(s.substr(0, i) + add + s.substr(i));
    }
  int decided = 0;
  for (const std::string& text : texts) {
    std::vector<internal::FolderConfRecord> records;
    if (!internal::ViewFolderConf(text.data(), text.size(), records)) continue;
    ++decided;
    Json::Value parsed;
    ASSERT_TRUE(internal::JsonFromString(parsed, text) && parsed.isObject()) << text;
    EXPECT_EQ(Described(records), Described(parsed)) << text;
  }
  EXPECT_GT(decided, 300);
  std::vector<internal::FolderConfRecord> records;
  for (const std::string& text :
       {seeds[0], seeds[2], seeds[5], std::string("{}")})  // forms the library writes
    EXPECT_TRUE(internal::ViewFolderConf(text.data(), text.size(), records)) << text;
}
