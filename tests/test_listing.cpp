// The paged, sorted folder listing and the additional fields of each listed folder.
#include <fileindex/error.h>
#include <fileindex/folder.h>
#include <fileindex/index_mgr.h>
#include <gmock/gmock.h>
#include <sys/stat.h>

#include <random>
#include <string>
#include <vector>

#include "internal/json_io.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;
using Strings = std::vector<std::string>;
using Rows = std::vector<std::tuple<std::string, std::string, bool>>;  // path, name, photo

namespace {
const Rows kFive{{"/s/1", "e", true},
                 {"/s/2", "c", false},
                 {"/s/3", "A", true},
                 {"/s/4", "D", false},
                 {"/s/5", "b", false}};

class ListingTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    AddShare("s");
  }
  // Writes folder.conf and makes each folder's directory.
  void WriteFolders(const Rows& rows) {
    Json::Value conf(Json::objectValue);
    for (const auto& [path, name, photo] : rows) {
      conf[path] = ParseJson(R"({"document":false,"audio":false,"video":false})");
      conf[path]["name"] = name;
      conf[path]["photo"] = photo;
      ::mkdir(Full(path).c_str(), 0755);
    }
    WriteFile(FolderConfPath(), conf.toStyledString());
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
  WriteFolders(kFive);
  EXPECT_EQ(Col(List(0, 10)), (Strings{"A", "b", "c", "D", "e"}));
  EXPECT_EQ(Col(List(1, 2)), (Strings{"b", "c"}));
  // Descending takes the first n of the ascending order, reversed; the offset only shrinks n.
  EXPECT_EQ(Col(List(3, 10, "name", "DESC")), (Strings{"b", "A"}));
  EXPECT_EQ(Col(List(0, 2, "name", "desc")), (Strings{"A", "b"}));  // only the exact word
  EXPECT_EQ(Col(List(4, ~0UL)), (Strings{"e"}));                    // offset + limit must not overflow
  const Json::Value beyond = List(~0UL, ~0UL, "name", "DESC");
  EXPECT_TRUE(beyond["total"].asUInt64() == 5 && beyond["folder"] == Json::Value(Json::arrayValue)) << beyond;
  const Json::Value byPhoto = List(0, 10, "photo");  // order within each group is free
  for (Json::ArrayIndex i = 0; i < 5; ++i) EXPECT_EQ(byPhoto["folder"][i]["photo"], i >= 3) << byPhoto;
  WriteFolders({{"/s/b", "1", false}, {"/s/C", "2", false}, {"/s/a", "3", false}, {"/s/D", "4", false}});
  EXPECT_EQ(Col(List(0, 10, "bogus"), "path"), (Strings{"/s/a", "/s/b", "/s/C", "/s/D"}));
}

// "is_valid" and "status" cost one file-system check each, for listed folders only; an unknown name
// is listed as null, a name that is not a string ends the fields there; an unreadable file fails.
TEST_F(ListingTest, AdditionalFieldsAndFailures) {
  WriteFolders(kFive);
  fake::Get().calls.clear();
  Json::Value page = List(1, 2, "name", "ASC", ParseJson(R"(["is_valid","status"])"));
  for (const Json::Value& folder : page["folder"])
    EXPECT_EQ(folder["additional"], ParseJson(R"({"is_valid":true,"status":"finished"})"));
  EXPECT_EQ(fake::CallsStartingWith("TAVOGetFSType(").size(), 4u);
  logcap::Clear();
  page = List(0, 1, "name", "ASC", ParseJson(R"(["is_valid","bogus",{"a":1},"status"])"));
  EXPECT_EQ(page["folder"][0]["additional"], ParseJson(R"({"is_valid":true,"bogus":null})"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  using testing::EndsWith;
  EXPECT_THAT(logcap::Texts(),
              testing::ElementsAre(EndsWith(" Unknown additional: bogus"),
                                   EndsWith(" Failed to get additional: bogus"),
                                   EndsWith(R"( Bad param: {"a":1})"), EndsWith(" GetAdditional failed")));
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
  Rows rows;
  for (int i = 0; i < 16; ++i)
    rows.emplace_back((i % 2 ? "/t/d" : "/s/d") + std::to_string(i / 2), "n" + std::to_string(i * 5 % 16),
                      i % 4 == 0);
  WriteFolders(rows);
  ASSERT_EQ(::mkdir(EaDir("s").c_str(), 0755) + ::mkdir(EaDir("t").c_str(), 0755), 0);
  const Json::Value names = ParseJson(R"(["status","is_valid"])");
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
    for (const std::string& file : {Queue("s"), Queue("s") + ".tmp", Queue("t")}) ::unlink(file.c_str());
    if (round % 3 != 2) WriteFile(Queue("s"), queue("s", 1 + round));
    if (round % 2 == 1) WriteFile(Queue("s") + ".tmp", queue("s", 3));
    if (round % 4 != 3) WriteFile(Queue("t"), queue("t", 2 + round % 5));
    std::string big;  // more malformed text than a page keeps
    for (int i = 0; round == 5 && i < 60; ++i) big += std::string(20000, '!') + "\n";
    if (round == 5) WriteFile(Queue("t"), big + queue("t", 4));
    const char* const conf[] = {R"({"resume_time":0})", R"({"no_space":{"t":true}})", "{oops", "{}"};
    WriteFile(StatusConfPath(), conf[round % 4]);
    logcap::Clear();
    const Json::Value page = List(round % 5, 7 + round % 4, "name", round % 2 ? "DESC" : "ASC", names);
    const Strings pageLog = logcap::Texts();
    logcap::Clear();
    Json::Value alone(Json::arrayValue);  // each listed folder's fields computed on their own
    for (const Json::Value& listed : page["folder"]) {
      Folder folder;
      folder.Load(listed["path"].asString(), listed);
      alone.append(folder.asJson(names));
      statuses += listed["additional"]["status"] != "finished";
    }
    EXPECT_EQ(page["folder"], alone) << "round " << round;
    EXPECT_EQ(pageLog, logcap::Texts()) << "round " << round;
    logged += pageLog.size();
  }
  EXPECT_TRUE(logged > 100 && statuses > 20) << logged << " " << statuses;
}
