// Hostile share contents: links (and a FIFO) planted where the library keeps per-share files or locks.
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <set>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class HostileTest : public IndexMgrTest {
 protected:
  void SetUp() override {
    IndexMgrTest::SetUp();
    AddShare("photo");
    ::mkdir(Full("/photo/a").c_str(), 0755);
    outside_ = Rooted("/outside");
    ::mkdir(outside_.c_str(), 0755);
  }
  // Everything below the directory outside the shares, as "relative path=content".
  std::set<std::string> Outside() const {
    std::set<std::string> out;
    for (const auto& entry : std::filesystem::recursive_directory_iterator(outside_)) {
      const std::string rel = entry.path().string().substr(outside_.size() + 1);
      out.insert(entry.is_directory() ? rel + "/" : rel + "=" + ReadFile(entry.path()));
    }
    return out;
  }
  static void Link(const std::string& target, const std::string& at) {
    ASSERT_EQ(::symlink(target.c_str(), at.c_str()), 0) << at;
  }
  std::string outside_;
};

// A link at a lock path makes the writers fail with code 9; nothing is created through it.
TEST_F(HostileTest, LinksAtTheLockPathsAreNotFollowed) {
  Link(outside_ + "/created", LockPath());
  WriteFile(outside_ + "/victim", "keep");
  Link(outside_ + "/victim", Rooted("/tmp/fileidx_cfg_status.lock"));
  EXPECT_FALSE(IndexMgr::Upsert(Array({Record("/photo/a", "a", true, true, true, true)})));
  EXPECT_TRUE(ErrorHandler::GetError() == FILEINDEX_ERR_LOCK && !Exists(FolderConfPath()));
  ErrorHandler::SetError(FILEINDEX_ERR_NONE);
  EXPECT_FALSE(StatusMgr::ShareSetNeedReindex("photo", true));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  EXPECT_EQ(Outside(), (std::set<std::string>{"victim=keep"}));
}

// A queue that is a link or a FIFO is never written (nor blocks) and marks the share for reindexing.
TEST_F(HostileTest, QueueLinkOrFifoIsNeverWrittenAndMarksTheShare) {
  WriteFile(outside_ + "/victim", "keep\n");
  ::mkdir(EaDir("photo").c_str(), 0755);
  for (const std::string& target : {outside_ + "/victim", outside_ + "/created"}) {
    ::unlink(Queue("photo").c_str());
    Link(target, Queue("photo"));
    EXPECT_FALSE(AddCustomEvent(131072, Full("/photo/a"), Json::Value())) << target;
  }
  EXPECT_EQ(Outside(), (std::set<std::string>{"victim=keep\n"}));
  EXPECT_TRUE(StatusMgr::ShareIsNeedReindex("photo"));
  ::unlink(Queue("photo").c_str());
  ASSERT_EQ(::mkfifo(Queue("photo").c_str(), 0666), 0);
  ::alarm(20);  // a FIFO with no reader would block a plain open for writing forever
  EXPECT_FALSE(AddCustomEvent(131072, Full("/photo/a"), Json::Value()));
  ::alarm(0);
}

// The share cleanup removes links inside @eaDir (rm -rf, run for real) and not their
// targets; an @eaDir that is itself a link is neither written nor cleaned through.
TEST_F(HostileTest, EaDirLinksKeepEveryWriteAndRemovalInsideTheShare) {
  WriteFile(outside_ + "/TAVO@file_index_queue", "queue\n");
  ::mkdir((outside_ + "/db").c_str(), 0755);
  WriteFile(outside_ + "/db/data", "db");
  const std::set<std::string> before = Outside();
  ::mkdir(EaDir("photo").c_str(), 0755);
  Link(outside_ + "/TAVO@file_index_queue", Queue("photo"));
  Link(outside_ + "/db", Db("photo"));
  EXPECT_TRUE(IndexMgr::CleanShareIndexData("photo"));
  EXPECT_FALSE(Exists(Queue("photo")) || Exists(Db("photo")));
  EXPECT_EQ(Outside(), before);
  ::rmdir(EaDir("photo").c_str());
  Link(outside_, EaDir("photo"));
  fake::Get().execs.clear();
  WriteFolders({Record("/photo/a", "a", false, false, false, true)});
  char buffer[4096];
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, sizeof(buffer)), static_cast<int>(Db("photo").size()));
  EXPECT_FALSE(AddCustomEvent(131072, Full("/photo/a"), Json::Value()));
  StartDaemon();
  EXPECT_TRUE(IndexMgr::Delete(Array({Json::Value("/photo/a")})));  // cleans up the share
  EXPECT_TRUE(fake::Get().execs.empty());
  EXPECT_EQ(Outside(), before);
}

}  // namespace
