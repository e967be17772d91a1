// Whether paths and shares are indexed, the folder list and one folder under the lock; the fast
// folder.conf reader against the strict parse.
#include <fcntl.h>
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <sys/file.h>
#include <unistd.h>

#include <random>
#include <string>
#include <vector>

#include "internal/folder_conf_view.h"
#include "internal/json_io.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using Strings = std::vector<std::string>;

namespace {
class QueriesTest : public SysrootTest {
 protected:
  void WriteFolders(const Strings& paths) {
    Json::Value conf(Json::objectValue);
    for (const std::string& path : paths) conf[path]["name"] = "n";
    WriteFile(FolderConfPath(), conf.toStyledString());
  }
};
}  // namespace

// Whole components, byte for byte; a caller's list means no file or share look-up.
TEST_F(QueriesTest, PathTestsMatchWholeComponentsByteForByte) {
  AddShare("video");
  WriteFolders({"/video/movies"});
  for (const char* path : {"/video/movies/a/b", "/video/movies/"})
    EXPECT_EQ(FILEIDXIsPathIndexed(path), 1) << path;
  for (const char* path : {"/video//movies", "/video/movies2", "/Video/movies"})
    EXPECT_EQ(FILEIDXIsPathIndexed(path), 0) << path;
  EXPECT_TRUE(IndexMgr::IsPathContainIndexed("/video"));
  EXPECT_FALSE(IndexMgr::IsPathContainIndexed("/vid"));
  EXPECT_EQ(FILEIDXIsFullPathIndexed(Rooted("/volume1/video/movies2").c_str()), 0);
  std::vector<Folder> folders;
  ASSERT_TRUE(IndexMgr::List(folders));
  ::unlink(FolderConfPath().c_str());
  fake::Get().calls.clear();
  EXPECT_TRUE(IndexMgr::IsFullPathIndexed(Rooted("/volume1/video/movies/x"), folders));
  EXPECT_TRUE(fake::Get().calls.empty());
  WriteFolders({"", "/video/movies"});  // a folder without a share name is logged and skipped
  EXPECT_EQ(FILEIDXIsShareIndexed("video"), 1);
  EXPECT_EQ(FILEIDXIsShareIndexed("Video"), 0);
  EXPECT_EQ(logcap::Count("index_mgr:"), 2);
  EXPECT_EQ(logcap::Count(" Failed to get share name from path: "), 2);
}

// No file means no folders; a broken file fails every query rather than answering "not indexed";
// Get fails with a lock error while another holder has the lock, and releases it on every way out.
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
  WriteFile(FolderConfPath(), "[]");
  EXPECT_FALSE(IndexMgr::Get(result, "/video/movies"));
  WriteFolders({"/video/movies"});
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
  Folders config;
  EXPECT_TRUE(config.Lock(true));
  config.Unlock();
}

// Each record as a folder is loaded from it: its path, then "name" when a string, then each flag
// held as a boolean ("-" when not).
Strings Described(const std::vector<internal::FolderConfRecord>& records) {
  Strings out;
  for (const auto& r : records) {
    out.push_back(std::string(r.path.data, r.path.size) +
                  (r.name ? "|" + std::string(r.name, r.nameSize) : "|-"));
    for (signed char flag : r.flags) out.back() += flag < 0 ? "-" : std::to_string(flag);
  }
  return out;
}
Strings Described(const Json::Value& doc) {
  Strings out;
  for (auto it = doc.begin(); it != doc.end(); ++it) {
    const Json::Value& r = *it;
    out.push_back(it.name() + (r.isObject() && r["name"].isString() ? "|" + r["name"].asString() : "|-"));
    for (const char* flag : {"document", "audio", "video", "photo"})
      out.back() += !r.isObject() || !r[flag].isBool() ? "-" : r[flag].asBool() ? "1" : "0";
  }
  return out;
}

// Wherever the fast reader decides a text (seeds and their one-byte edits), the strict parse reads an
// object with exactly these records, in this order, holding these values.
TEST(FolderConfViewTest, AgreesWithTheStrictParseWhereverItDecides) {
  const Strings seeds{
      R"({"/a":{"audio":1,"name":null,"photo":true},"/b":"x","/c":{"document":false,"name":"plain","video":"true","x":{"name":"in","audio":true}}})",
      R"({"/d":{"audio":true,"audio":false},"/e":{"name":"a","name":"b"},"/f":{"name":"c","photo":false}})",
      R"({"/a/b":{"name":"x","document":true,"audio":false},"/a/c":{"name":"q\"\\\/\b\f\n\r\t\u00e9\ud83d\ude00"}})",
      "{\n  \"\" : { \"n\" : [ 1, -2, 0, null, { } ] },\r\n\t\"/v\" : {\"path\":\"/v\",\"x\":-0} }\n",
      R"({"/a":{},"/a/":{},"/b":[],"/b\u0000":{},"/\u00e9":{}, "/b":{}})",
      R"({"/x":{"d":123456789012345678,"e":1.5,"f":1e3,"g":01,"h":"\ud800\u0041","i":"\ud800"}})",
      "{\"/z\":{\"a\":{\"b\":{\"c\":[[[true]]]}}},\"/\xc3\xa9\xff\":{\"name\":\"\xe2\x82\xac\"}}"};
  const Strings kInserted{
      "\"", "{", "}", "[",  "]",    ",",   ":",     "\\",  " ",         "0",
      "-",  "e", "/", "\n", "\x01", "\\u", "//x\n", "1.5", "\"/\":{},", std::string(1, '\0')};
  Strings texts = seeds;
  for (const std::string& s : seeds)
    for (size_t i = 0; i < s.size(); ++i) {
      texts.push_back(s.substr(0, i) + s.substr(i + 1));
      for (const std::string& add : kInserted) texts.push_back(s.substr(0, i) + add + s.substr(i));
    }
  texts.push_back("{" + std::string(70, '[') + std::string(70, ']') + "}");
  texts.push_back("{\"/d\":" + std::string(70, '[') + std::string(70, ']') + "}");
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
  for (const std::string& text :
       {seeds[0], seeds[3], seeds[6], std::string("{}")}) {  // forms the library writes
    std::vector<internal::FolderConfRecord> records;
    EXPECT_TRUE(internal::ViewFolderConf(text.data(), text.size(), records)) << text;
  }
}

// Answers, folders, log lines, error codes and platform calls are the same through the fast reader as
// through the strict parse, which alone reads names escaped as "\/".
TEST_F(QueriesTest, FastReaderMatchesTheFullLoad) {
  AddShare("video");
  AddShare("photo");
  std::mt19937 rng(3);
  const char* const shares[] = {"video", "photo", "gone"};
  const Strings probes{"/video", "/video/d1", "/video/d1/x", "/photo/d10", "/gone/d3/y", "/video/d", "", "/"};
  auto ask = [&](const std::string& text) {
    WriteFile(FolderConfPath(), text);
    Strings seen;
    for (const std::string& probe : probes) {
      ErrorHandler::SetError(FILEINDEX_ERR_NONE);
      logcap::Clear();
      fake::Get().calls.clear();
      seen.push_back(std::to_string(FILEIDXIsPathIndexed(probe.c_str())) +
                     std::to_string(IndexMgr::IsPathContainIndexed(probe)) +
                     std::to_string(FILEIDXIsFullPathIndexed(Rooted("/volume1" + probe).c_str())) +
                     std::to_string(FILEIDXIsShareIndexed(probe.empty() ? "" : probe.substr(1).c_str())) +
                     " " + std::to_string(ErrorHandler::GetError()));
      for (const std::string& line : logcap::Texts()) seen.push_back(line);
      seen.insert(seen.end(), fake::Get().calls.begin(), fake::Get().calls.end());
    }
    std::vector<Folder> folders;
    seen.push_back(std::to_string(IndexMgr::List(folders)));
    for (const Folder& f : folders)
      seen.push_back(f.GetPath() + "|" + f.GetName() + "|" + f.GetFullPath() + "|" +
                     std::to_string(f.IsDocument()) + std::to_string(f.IsAudio()) +
                     std::to_string(f.IsVideo()) + std::to_string(f.IsPhoto()));
    return seen;
  };
  int indexed = 0;
  for (int n : {0, 1, 5, 40}) {
    Json::Value conf(Json::objectValue);
    for (int i = 0; i < n; ++i) {
      const std::string path = std::string("/") + shares[rng() % 3] + "/d" + std::to_string(rng() % 20);
      conf[path]["name"] = std::string("n\xc3\xa9") + std::to_string(i);
      conf[path][rng() % 2 == 0 ? "document" : "photo"] = rng() % 2 == 0;
      if (i % 7 == 3) conf[path]["audio"] = "yes";
      conf[path]["path"] = path;
    }
    if (n == 5) conf[""]["name"] = "no share";
    if (n == 40) conf["/video"]["x"] = Json::Value(Json::arrayValue);
    const std::string text = internal::JsonToString(conf);
    std::string escaped;
    for (char c : text) escaped += c == '/' ? std::string("\\/") : std::string(1, c);
    std::vector<internal::FolderConfRecord> records;
    ASSERT_TRUE(internal::ViewFolderConf(text.data(), text.size(), records)) << text;
    ASSERT_TRUE(conf.empty() || !internal::ViewFolderConf(escaped.data(), escaped.size(), records));
    const Strings fast = ask(text);
    EXPECT_EQ(fast, ask(escaped)) << text;
    for (const std::string& line : fast) indexed += line.compare(0, 2, "11") == 0;
  }
  EXPECT_GT(indexed, 2);
}
