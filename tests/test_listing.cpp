// The paged, sorted folder listing and the additional fields of each listed folder.
#include <fileindex/error.h>
#include <fileindex/folder.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <sys/stat.h>

#include <algorithm>
#include <random>
#include <string>
#include <vector>

#include "internal/json_io.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using Strings = std::vector<std::string>;

namespace {
class ListingTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    AddShare("s");
  }
  // Writes folder.conf from (path, name, photo) triples and makes each directory.
  void WriteFolders(const std::vector<std::tuple<std::string, std::string, bool>>& rows) {
    Json::Value conf(Json::objectValue);
    for (const auto& [path, name, photo] : rows) {
      conf[path] = ParseJson(R"({"document":false,"audio":false,"video":false})");
      conf[path]["path"] = path, conf[path]["name"] = name, conf[path]["photo"] = photo;
      ::mkdir(Rooted("/volume1" + path).c_str(), 0755);
    }
    WriteFile(FolderConfPath(), conf.toStyledString());
  }
  void WriteFive() {
    WriteFolders({{"/s/1", "e", true},
                  {"/s/2", "c", false},
                  {"/s/3", "A", true},
                  {"/s/4", "D", false},
                  {"/s/5", "b", false}});
  }
  Json::Value List(unsigned long offset, unsigned long limit, const std::string& sortBy = "name",
                   const std::string& dir = "ASC", const Json::Value& add = Json::Value(Json::arrayValue)) {
    Json::Value result("sentinel");
    EXPECT_TRUE(IndexMgr::List(result, offset, limit, sortBy, dir, add));
    return result;
  }
  static Strings Col(const Json::Value& result, const char* key = "name") {
    Strings out;
    for (const Json::Value& folder : result["folder"]) out.push_back(folder[key].asString());
    return out;
  }
};
}  // namespace

// Case-insensitive name order, paging, unsigned counters, out-of-range pages; "photo" puts folders
// without the flag first; other keys sort by path, ignoring case.
TEST_F(ListingTest, SortsAndPages) {
  EXPECT_EQ(internal::JsonToString(List(7, 3)), R"({"folder":[],"offset":7,"total":0})");
  WriteFive();
  Json::Value all = List(0, 10);
  EXPECT_EQ(Col(all), (Strings{"A", "b", "c", "D", "e"}));
  EXPECT_EQ(all["folder"][0], ParseJson(R"({"path":"/s/3","name":"A","document":false,"audio":false,
                                              "video":false,"photo":true,"additional":{}})"));
  EXPECT_EQ(Col(List(1, 2)), (Strings{"b", "c"}));
  // Descending takes the first n of the ascending order, reversed; the offset only shrinks n.
  EXPECT_EQ(Col(List(0, 2, "name", "DESC")), (Strings{"b", "A"}));
  EXPECT_EQ(Col(List(3, 10, "name", "DESC")), (Strings{"b", "A"}));
  EXPECT_EQ(Col(List(0, 2, "name", "desc")), (Strings{"A", "b"}));  // only the exact word
  for (const Json::Value& page :
       {List(0, 0), List(5, 10), List(~0UL, ~0UL), List(~0UL, ~0UL, "name", "DESC")}) {
    EXPECT_EQ(page["total"].asUInt64(), 5u);
    EXPECT_EQ(page["folder"], Json::Value(Json::arrayValue));
  }
  EXPECT_EQ(Col(List(4, ~0UL)), (Strings{"e"}));  // offset + limit must not overflow
  Strings byPhoto = Col(List(0, 10, "photo"));
  ASSERT_EQ(byPhoto.size(), 5u);
  std::sort(byPhoto.begin(), byPhoto.begin() + 3);  // order within each group is free
  std::sort(byPhoto.begin() + 3, byPhoto.end());
  EXPECT_EQ(byPhoto, (Strings{"D", "b", "c", "A", "e"}));
  WriteFolders({{"/s/b", "1", false}, {"/s/C", "2", false}, {"/s/a", "3", false}, {"/s/D", "4", false}});
  for (const std::string key : {"bogus", "Name", ""})
    EXPECT_EQ(Col(List(0, 10, key), "path"), (Strings{"/s/a", "/s/b", "/s/C", "/s/D"})) << key;
}

// "is_valid" and "status" cost one file-system check each, for listed folders only; bad names and
// parameters are logged and flagged but the record is kept; an unreadable configuration fails.
TEST_F(ListingTest, AdditionalFieldsAndFailures) {
  WriteFive();
  const Json::Value names = ParseJson(R"(["is_valid","status"])");
  fake::Get().calls.clear();
  Json::Value page = List(1, 2, "name", "ASC", names);
  ASSERT_EQ(page["folder"].size(), 2u);
  for (const Json::Value& folder : page["folder"])
    EXPECT_EQ(folder["additional"], ParseJson(R"({"is_valid":true,"status":"finished"})"));
  EXPECT_EQ(fake::CallsStartingWith("TAVOGetFSType(").size(), 4u);
  Folder folder;
  folder.Load("/s/1", ParseJson(R"({"name":"a"})"));
  Json::Value listed = folder.asJson(ParseJson(R"(["status","bogus"])"));
  EXPECT_EQ(listed["additional"], ParseJson(R"({"status":"finished","bogus":null})"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_EQ(logcap::Count("Unknown additional: bogus"), 1);
  EXPECT_EQ(logcap::Count("Failed to get additional: bogus"), 1);
  logcap::Clear();
  listed = folder.asJson(Json::Value(5));
  EXPECT_EQ(listed["additional"], Json::Value(Json::objectValue));
  listed.removeMember("additional");
  EXPECT_EQ(listed, folder.asJson());
  EXPECT_EQ(logcap::Count("Bad param: 5"), 1);
  EXPECT_EQ(logcap::Count("GetAdditional failed"), 1);
  Json::Value out("x");  // a bad element stops the loop and keeps what was added before it
  EXPECT_FALSE(folder.GetAdditional(out, ParseJson(R"(["is_valid",{"a":1},"status"])")));
  EXPECT_EQ(out, ParseJson(R"({"is_valid":true})"));
  WriteFile(FolderConfPath(), "[]");
  Json::Value result("untouched");
  EXPECT_FALSE(IndexMgr::List(result, 0, 10, "name", "ASC", Json::Value(Json::arrayValue)));
  EXPECT_EQ(result, Json::Value("untouched"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_MALFORMED_CONFIG);
}

// A page reading each queue and status.conf once gives every folder the answer and the log lines
// (malformed lines once per folder that reads them, in order) of reading them folder by folder.
TEST_F(ListingTest, SharedReadsMatchFolderByFolderReads) {
  AddShare("t");
  std::vector<std::tuple<std::string, std::string, bool>> rows;
  for (int i = 0; i < 8; ++i) {
    rows.emplace_back("/s/d" + std::to_string(i), "n" + std::to_string(i * 5 % 8), i % 2 == 0);
    rows.emplace_back("/t/d" + std::to_string(i), "m" + std::to_string(i), false);
  }
  WriteFolders(rows);
  const Json::Value names = ParseJson(R"(["status","is_valid"])");
  const std::string queueS = Queue("s"), queueT = Queue("t");
  ::mkdir(EaDir("s").c_str(), 0755), ::mkdir(EaDir("t").c_str(), 0755);
  std::mt19937 rng(5);
  auto queue = [&](const std::string& share, int lines) {
    std::string text;
    for (int i = 0; i < lines; ++i) {
      const std::string path =
          Full("/" + share + "/d" + std::to_string(rng() % 12) + (rng() % 2 ? "/x" : ""));
      const unsigned kind = rng() % 6;  // 0 and 2 are malformed
      text += kind == 1   ? "{\"event\":256,\"path\":\"/o\",\"path_old\":\"" + path + "\"}\n"
              : kind == 2 ? "{\"event\":\"2\",\"path\":\"" + path + "\"}\n"
                          : "{\"event\":2,\"path\":\"" + path + (kind == 0 ? "\"} x\n" : "\"}\n");
    }
    return text;
  };
  size_t logged = 0, statuses = 0;
  for (int round = 0; round < 12; ++round) {
    ::unlink(queueS.c_str()), ::unlink((queueS + ".tmp").c_str()), ::unlink(queueT.c_str());
    if (round % 3 != 2) WriteFile(queueS, queue("s", 1 + round));
    if (round % 2 == 1) WriteFile(queueS + ".tmp", queue("s", 3));
    if (round % 4 != 3) WriteFile(queueT, queue("t", 2 + round % 5));
    if (round == 5) {  // more malformed text than a page keeps
      std::string big;
      for (int i = 0; i < 60; ++i) big += std::string(20000, '!') + "\n";
      WriteFile(queueT, big + queue("t", 4));
    }
    const char* const conf[] = {R"({"resume_time":0})", R"({"no_space":{"t":true}})", "{oops", "{}"};
    WriteFile(StatusConfPath(), conf[round % 4]);
    logcap::Clear();
    const Json::Value page = List(round % 5, 7 + round % 4, "name", round % 2 ? "DESC" : "ASC", names);
    const Strings pageLog = logcap::Texts();
    // The reference: each listed folder's fields computed on their own, in page order.
    Folders config;
    std::vector<Folder> folders;
    ASSERT_TRUE(config.Load() && config.List(folders));
    logcap::Clear();
    Json::Value alone(Json::arrayValue);
    for (const Json::Value& listed : page["folder"])
      for (const Folder& folder : folders)
        if (folder.GetPath() == listed["path"].asString()) alone.append(folder.asJson(names));
    EXPECT_EQ(page["folder"], alone) << "round " << round;
    EXPECT_EQ(pageLog, logcap::Texts()) << "round " << round;
    logged += pageLog.size();
    for (const Json::Value& listed : page["folder"]) statuses += listed["additional"]["status"] != "finished";
  }
  EXPECT_TRUE(logged > 100 && statuses > 20) << logged << " " << statuses;
}
