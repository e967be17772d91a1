// Hostile share contents: links (and a FIFO) planted where the library keeps per-share files or locks.
#include <fileindex/error.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;
namespace fs = std::filesystem;

namespace {

class HostileTest : public IndexMgrTest {
 protected:
  void SetUp() override {
    IndexMgrTest::SetUp();
    AddShare("photo");
    fs::create_directories(EaDir("photo"));
    victim_ = Rooted("/outside/TAVO@file_index_queue");  // what an @eaDir linked here would find
    fs::create_directories(Rooted("/outside/TAVO@.fileindexdb"));
    WriteFile(Rooted("/outside/TAVO@.fileindexdb/data"), "db");
    WriteFile(victim_, "keep\n");
  }
  // Nothing outside the shares was created, changed or removed.
  void ExpectOutsideUntouched() const {
    EXPECT_EQ(ReadFile(victim_) + ReadFile(Rooted("/outside/TAVO@.fileindexdb/data")), "keep\ndb");
    EXPECT_EQ(std::distance(fs::recursive_directory_iterator(Rooted("/outside")), {}), 3);
  }
  std::string victim_;
};

// A link at a lock path (every configuration file locks alike) makes the writer fail with code 9;
// nothing is created through it.
TEST_F(HostileTest, LinkAtTheLockPathIsNotFollowed) {
  fs::create_symlink(Rooted("/outside/created"), LockPath());
  EXPECT_FALSE(IndexMgr::Upsert(Array({Record("/photo/a", "a", true, true, true, true)})));
  EXPECT_TRUE(ErrorHandler::GetError() == FILEINDEX_ERR_LOCK && !Exists(FolderConfPath()));
  ExpectOutsideUntouched();
}

// A queue link or FIFO is never written (nor blocks) and marks the share. The cleanup (rm -rf, run for
// real) removes links in @eaDir, not their targets; an @eaDir link is neither written nor cleaned through.
TEST_F(HostileTest, EaDirLinksAndFifosKeepEveryWriteAndRemovalInsideTheShare) {
  fs::create_symlink(victim_, Queue("photo"));
  fs::create_symlink(Rooted("/outside/TAVO@.fileindexdb"), Db("photo"));
  EXPECT_FALSE(AddCustomEvent(131072, Full("/photo/a"), Json::Value()));
  EXPECT_TRUE(StatusMgr::ShareIsNeedReindex("photo"));
  EXPECT_TRUE(IndexMgr::CleanShareIndexData("photo"));
  ASSERT_EQ(::mkfifo(Queue("photo").c_str(), 0666), 0);
  ::alarm(20);  // a FIFO with no reader would block a plain open for writing forever
  EXPECT_FALSE(AddCustomEvent(131072, Full("/photo/a"), Json::Value()));
  ::alarm(0);
  fs::remove_all(EaDir("photo"));
  fs::create_symlink(Rooted("/outside"), EaDir("photo"));
  EXPECT_FALSE(AddCustomEvent(131072, Full("/photo/a"), Json::Value()));
  EXPECT_TRUE(IndexMgr::CleanShareIndexData("photo"));
  ExpectOutsideUntouched();
}

}  // namespace
