// The paged, sorted folder listing and the additional fields of each listed folder.
#include <fileindex/error.h>
#include <fileindex/folder.h>
#include <fileindex/index_mgr.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "internal/json_io.h"
#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class ListingTest : public SysrootTest {
 protected:
  void SetUp() override {
    SysrootTest::SetUp();
    AddShare("s");
  }

  struct Spec {
    std::string path;
    std::string name;
    bool photo;
  };
  // Writes folder.conf and makes each folder's directory.
  void WriteFolders(const std::vector<Spec>& specs) {
    Json::Value conf(Json::objectValue);
    for (const Spec& spec : specs) {
      Json::Value& record = conf[spec.path];
      record["path"] = spec.path;
      record["name"] = spec.name;
      record["document"] = false;
      record["audio"] = false;
      record["video"] = false;
      record["photo"] = spec.photo;
      ::mkdir(Rooted("/volume1" + spec.path).c_str(), 0755);
    }
    WriteFile(FolderConfPath(), conf.toStyledString());
  }
  // The five folders whose names are b, A, c, D and e, stored in another order.
  void WriteFive() {
    WriteFolders({{"/s/1", "e", true},
                  {"/s/2", "c", false},
                  {"/s/3", "A", true},
                  {"/s/4", "D", false},
                  {"/s/5", "b", false}});
  }

  Json::Value List(unsigned long offset, unsigned long limit, const std::string& sortBy = "name",
                   const std::string& direction = "ASC",
                   const Json::Value& additional = Json::Value(Json::arrayValue)) {
    Json::Value result("sentinel");
    EXPECT_TRUE(IndexMgr::List(result, offset, limit, sortBy, direction, additional));
    return result;
  }
  static std::vector<std::string> Names(const Json::Value& result) {
    std::vector<std::string> names;
    for (const Json::Value& folder : result["folder"]) names.push_back(folder["name"].asString());
    return names;
  }
  using Strings = std::vector<std::string>;
};

std::string JsonText(const Json::Value& value) { return TAVO::FILEINDEX::internal::JsonToString(value); }

}  // namespace

TEST_F(ListingTest, SortsAndPagesAscendingAndDescending) {
  // Both numbers are unsigned integers.
  Json::Value empty = List(7, 3);
  EXPECT_EQ(JsonText(empty), R"({"folder":[],"offset":7,"total":0})");
  EXPECT_TRUE(empty["total"].isUInt64() && empty["total"].type() == Json::uintValue);
  EXPECT_EQ(empty["offset"].type(), Json::uintValue);

  WriteFive();
  Json::Value all = List(0, 10);
  EXPECT_EQ(all["total"].asUInt64(), 5u);
  EXPECT_EQ(all["offset"].asUInt64(), 0u);
  EXPECT_EQ(Names(all), (Strings{"A", "b", "c", "D", "e"}));
  // Each entry is the folder's record plus its additional fields.
  EXPECT_EQ(all["folder"][0], ParseJson(R"({"path":"/s/3","name":"A","document":false,"audio":false,
                                              "video":false,"photo":true,"additional":{}})"));
  EXPECT_EQ(Names(List(1, 2)), (Strings{"b", "c"}));
  EXPECT_EQ(Names(List(3, 10)), (Strings{"D", "e"}));

  // Descending takes the first n of the ascending order, reversed; the offset only
  // shrinks n.
  EXPECT_EQ(Names(List(0, 2, "name", "DESC")), (Strings{"b", "A"}));
  Json::Value desc = List(3, 10, "name", "DESC");
  EXPECT_EQ(Names(desc), (Strings{"b", "A"}));
  EXPECT_EQ(desc["offset"].asUInt64(), 3u);
  // Only the exact word is descending.
  EXPECT_EQ(Names(List(0, 2, "name", "desc")), (Strings{"A", "b"}));
  EXPECT_EQ(Names(List(0, 2, "name", "")), (Strings{"A", "b"}));

  // Empty pages: limit 0, offset at the total, offset beyond it in either direction.
  for (const Json::Value& page : {List(0, 0), List(5, 10), List(6, 10), List(6, 10, "name", "DESC"),
                                  List(~0UL, ~0UL), List(~0UL, ~0UL, "name", "DESC")}) {
    EXPECT_EQ(page["total"].asUInt64(), 5u);
    EXPECT_EQ(page["folder"], Json::Value(Json::arrayValue));
  }
  EXPECT_EQ(Names(List(4, ~0UL)), (Strings{"e"}));
}

TEST_F(ListingTest, SortKeys) {
  WriteFive();
  // Without the flag first; the order within each group is free.
  const Strings byPhoto = Names(List(0, 10, "photo"));
  ASSERT_EQ(byPhoto.size(), 5u);
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(byPhoto[i] == "b" || byPhoto[i] == "c" || byPhoto[i] == "D") << i;
  for (int i = 3; i < 5; ++i) EXPECT_TRUE(byPhoto[i] == "A" || byPhoto[i] == "e") << i;
  const Strings descPhoto = Names(List(0, 2, "photo", "DESC"));
  ASSERT_EQ(descPhoto.size(), 2u);
  for (const std::string& name : descPhoto) EXPECT_TRUE(name == "b" || name == "c" || name == "D") << name;

  // Unknown keys, a key in another case and the empty key sort by path, ignoring case.
  WriteFolders({{"/s/b", "1", false}, {"/s/C", "2", false}, {"/s/a", "3", false}, {"/s/D", "4", false}});
  for (const std::string key : {"bogus", "Name", "", "path"}) {
    Json::Value result = List(0, 10, key);
    Strings paths;
    for (const Json::Value& folder : result["folder"]) paths.push_back(folder["path"].asString());
    EXPECT_EQ(paths, (Strings{"/s/a", "/s/b", "/s/C", "/s/D"})) << key;
  }
}

TEST_F(ListingTest, AdditionalFieldsAreComputedForThePageOnly) {
  WriteFive();
  Json::Value names(Json::arrayValue);
  names.append("is_valid");
  names.append("status");
  Json::Value page = List(1, 2, "name", "ASC", names);
  ASSERT_EQ(page["folder"].size(), 2u);
  for (const Json::Value& folder : page["folder"]) {
    EXPECT_EQ(folder["additional"], ParseJson(R"({"is_valid":true,"status":"finished"})"));
  }
  // "is_valid" and "status" each check the folder's file system once, for listed folders only.
  fake::Get().calls.clear();
  List(1, 2, "name", "ASC", names);
  EXPECT_EQ(fake::CallsStartingWith("TAVOGetFSType(").size(), 4u);
  fake::Get().calls.clear();
  List(0, 0, "name", "ASC", names);
  EXPECT_TRUE(fake::CallsStartingWith("TAVOGetFSType(").empty());
}

TEST_F(ListingTest, BadAdditionalNamesNeverLoseTheRecord) {
  WriteFolders({{"/s/a", "a", false}});
  Folder folder;
  folder.Load("/s/a", ParseJson(R"({"name":"a"})"));
  const Json::Value record = folder.asJson();

  Json::Value names = ParseJson(R"(["status","bogus"])");
  Json::Value listed = folder.asJson(names);
  EXPECT_EQ(listed["path"], record["path"]);
  EXPECT_EQ(listed["additional"], ParseJson(R"({"status":"finished","bogus":null})"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_EQ(logcap::Count("Unknown additional: bogus"), 1);
  EXPECT_EQ(logcap::Count("Failed to get additional: bogus"), 1);
  EXPECT_FALSE(logcap::Contains("GetAdditional failed"));
  for (const std::string& text : logcap::Texts()) EXPECT_EQ(text.compare(0, 7, "folder:"), 0) << text;

  logcap::Clear();
  listed = folder.asJson(Json::Value(5));
  EXPECT_EQ(listed["additional"], Json::Value(Json::objectValue));
  listed.removeMember("additional");
  EXPECT_EQ(listed, record);
  ASSERT_EQ(logcap::Texts().size(), 2u);
  EXPECT_NE(logcap::Texts()[0].find("Bad param: 5"), std::string::npos);
  EXPECT_NE(logcap::Texts()[1].find("GetAdditional failed"), std::string::npos);

  // A bad element stops the loop and keeps what was added before it.
  logcap::Clear();
  ErrorHandler::g_error_code = FILEINDEX_ERR_NONE;
  Json::Value out("x");
  EXPECT_FALSE(folder.GetAdditional(out, ParseJson(R"(["is_valid",{"a":1},"status"])")));
  EXPECT_EQ(out, ParseJson(R"({"is_valid":true})"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_BAD_PARAM);
  EXPECT_TRUE(logcap::Contains("Bad param: {\"a\":1}"));

  // Names match exactly; an unknown one leaves the output alone.
  out = "kept";
  EXPECT_FALSE(folder.GetAdditional(out, std::string("Status")));
  EXPECT_EQ(out, Json::Value("kept"));

  logcap::Clear();
  listed = folder.asJson(Json::Value(Json::arrayValue));
  EXPECT_EQ(listed["additional"], Json::Value(Json::objectValue));
  EXPECT_TRUE(logcap::Texts().empty());

  // The listing itself still succeeds with every folder present.
  Json::Value page = List(0, 10, "name", "ASC", Json::Value(5));
  ASSERT_EQ(page["folder"].size(), 1u);
  EXPECT_EQ(page["folder"][0]["additional"], Json::Value(Json::objectValue));
}

TEST_F(ListingTest, UnreadableConfigurationFailsTheListing) {
  WriteFile(FolderConfPath(), "[]");
  Json::Value result("untouched");
  EXPECT_FALSE(IndexMgr::List(result, 0, 10, "name", "ASC", Json::Value(Json::arrayValue)));
  EXPECT_EQ(result, Json::Value("untouched"));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_MALFORMED_CONFIG);
}
