// Hostile share contents: links (and a FIFO) planted by share users where the library keeps
// its per-share files, links at the lock paths, and the fuzz inputs replayed as regressions.
#include <dirent.h>
#include <fileindex/config.h>
#include <fileindex/error.h>
#include <fileindex/fileindex_c.h>
#include <fileindex/folders.h>
#include <fileindex/index_mgr.h>
#include <fileindex/status_mgr.h>
#include <fileindex/utils.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

#include "../fuzz/harness.h"
#include "support/index_mgr_test.h"

using namespace TAVO::FILEINDEX;

namespace {

class HostileTest : public IndexMgrTest {
 protected:
  void SetUp() override {
    IndexMgrTest::SetUp();
    AddShare("photo");
    AddShare("video");
    ::mkdir(Full("/photo/a").c_str(), 0755);
    outside_ = Rooted("/outside");
    ::mkdir(outside_.c_str(), 0755);
  }

  // Everything below the directory, as "relative path=content" ("/" for directories).
  static std::vector<std::string> Tree(const std::string& dir, const std::string& prefix = "") {
    std::vector<std::string> out;
    DIR* d = ::opendir(dir.c_str());
    if (d == nullptr) return out;
    while (struct dirent* entry = ::readdir(d)) {
      const std::string name = entry->d_name;
      if (name == "." || name == "..") continue;
      const std::string path = dir + "/" + name;
      struct stat st;
      ::lstat(path.c_str(), &st);
      if (S_ISDIR(st.st_mode)) {
        out.push_back(prefix + name + "/");
        for (const std::string& inner : Tree(path, prefix + name + "/")) out.push_back(inner);
      } else {
        out.push_back(prefix + name + "=" + ReadFile(path));
      }
    }
    ::closedir(d);
    std::sort(out.begin(), out.end());
    return out;
  }

  // Index data of a share as the daemon leaves it, in the directory given.
  void MakeIndexDataIn(const std::string& dir) {
    WriteFile(dir + "/TAVO@file_index_queue", "queue\n");
    WriteFile(dir + "/TAVO@file_index_queue.tmp", "tmp\n");
    ::mkdir((dir + "/TAVO@.fileindexdb").c_str(), 0755);
    WriteFile(dir + "/TAVO@.fileindexdb/data", "db");
  }

  static void Link(const std::string& target, const std::string& at) {
    ASSERT_EQ(::symlink(target.c_str(), at.c_str()), 0) << at;
  }

  std::string outside_;
};

TEST_F(HostileTest, LinksAtTheLockPathsAreNotFollowed) {
  Link(outside_ + "/created", LockPath());
  WriteFile(outside_ + "/victim", "keep");
  Link(outside_ + "/victim", Rooted("/tmp/fileidx_cfg_status.lock"));

  Folders folders;
  EXPECT_FALSE(folders.Lock(true));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  folders.Unlock();
  ErrorHandler::SetError(FILEINDEX_ERR_NONE);
  EXPECT_FALSE(IndexMgr::Upsert(Array({Record("/photo/a", "a", true, true, true, true)})));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);
  ErrorHandler::SetError(FILEINDEX_ERR_NONE);
  EXPECT_FALSE(StatusMgr::ShareSetNeedReindex("photo", true));
  EXPECT_EQ(ErrorHandler::GetError(), FILEINDEX_ERR_LOCK);

  // Nothing was created, changed or written through either link.
  EXPECT_EQ(Tree(outside_), (std::vector<std::string>{"victim=keep"}));
  EXPECT_FALSE(Exists(FolderConfPath()));
  EXPECT_FALSE(Exists(StatusConfPath()));
}

TEST_F(HostileTest, QueueLinkOrFifoIsNeverWrittenAndMarksTheShare) {
  WriteFile(outside_ + "/victim", "keep\n");
  ::mkdir(EaDir("photo").c_str(), 0755);
  const std::string full = Full("/photo/a");

  for (const std::string& target : {outside_ + "/victim", outside_ + "/created"}) {
    ::unlink(Queue("photo").c_str());
    Link(target, Queue("photo"));
    EXPECT_FALSE(AddCustomEvent(131072, full, Json::Value())) << target;
    EXPECT_EQ(Tree(outside_), (std::vector<std::string>{"victim=keep\n"})) << target;
  }
  // As for any queue that cannot be written: the whole share is due for reindexing.
  EXPECT_TRUE(StatusMgr::ShareIsNeedReindex("photo"));

  // A FIFO with no reader would block a plain open for writing forever.
  ::unlink(Queue("photo").c_str());
  ASSERT_EQ(::mkfifo(Queue("photo").c_str(), 0666), 0);
  ::alarm(20);
  EXPECT_FALSE(AddCustomEvent(131072, full, Json::Value()));
  ::alarm(0);

  // An upsert still saves folder.conf and reports the event it could not queue.
  ::unlink(Queue("photo").c_str());
  Link(outside_ + "/victim", Queue("photo"));
  StartDaemon();
  EXPECT_FALSE(IndexMgr::Upsert(Array({Record("/photo/a", "a", true, false, false, true)})));
  EXPECT_TRUE(logcap::Contains("AddCustomEvent failed"));
  EXPECT_TRUE(FolderConf().isMember("/photo/a"));
  EXPECT_EQ(Tree(outside_), (std::vector<std::string>{"victim=keep\n"}));
  EXPECT_TRUE(LockIsFree());
}

TEST_F(HostileTest, EaDirLinkKeepsEveryWriteAndRemovalInsideTheShare) {
  MakeIndexDataIn(outside_);
  const std::vector<std::string> before = Tree(outside_);
  Link(outside_, EaDir("photo"));
  WriteFolders({Record("/photo/a", "a", false, false, false, true)});

  // The locations are still reported as written, with their full lengths.
  char buffer[4096];
  const std::string db = Db("photo");
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, sizeof(buffer)), static_cast<int>(db.size()));
  EXPECT_EQ(std::string(buffer), db);
  EXPECT_TRUE(logcap::Contains("mkdir failed, path=" + db + ", reason=" + std::strerror(ENOTDIR)));
  EXPECT_EQ(FILEIDXQueuePathGet("photo", buffer, sizeof(buffer)), static_cast<int>(Queue("photo").size()));

  EXPECT_FALSE(AddCustomEvent(131072, Full("/photo/a"), Json::Value()));
  EXPECT_TRUE(IndexMgr::CleanShareIndexData("photo"));
  EXPECT_TRUE(fake::Get().execs.empty());
  EXPECT_EQ(logcap::Count("its directory is a symbolic link"), 3);

  // Deleting the share's last folder goes through the same cleanup.
  StartDaemon();
  EXPECT_TRUE(IndexMgr::Delete(Array({Json::Value("/photo/a")})));
  EXPECT_EQ(Tree(outside_), before);
}

TEST_F(HostileTest, LinksInsideEaDirAreRemovedNotFollowed) {
  MakeIndexDataIn(outside_);
  const std::vector<std::string> before = Tree(outside_);
  ::mkdir(EaDir("photo").c_str(), 0755);
  Link(outside_ + "/TAVO@file_index_queue", Queue("photo"));
  Link(outside_ + "/TAVO@file_index_queue.tmp", Queue("photo") + ".tmp");
  Link(outside_ + "/TAVO@.fileindexdb", Db("photo"));

  // A link already at the database path is not created through either.
  char buffer[4096];
  ::unlink(Db("photo").c_str());
  Link(outside_ + "/newdb", Db("photo"));
  EXPECT_EQ(FILEIDXDBPathGet("photo", buffer, sizeof(buffer)), static_cast<int>(Db("photo").size()));
  EXPECT_FALSE(Exists(outside_ + "/newdb"));
  ::unlink(Db("photo").c_str());
  Link(outside_ + "/TAVO@.fileindexdb", Db("photo"));

  // rm -rf (run for real by the fake platform) takes the links and leaves their targets.
  EXPECT_TRUE(IndexMgr::CleanShareIndexData("photo"));
  EXPECT_EQ(fake::Get().execs.size(), 3u);
  EXPECT_FALSE(Exists(Queue("photo")));
  EXPECT_FALSE(Exists(Queue("photo") + ".tmp"));
  EXPECT_FALSE(Exists(Db("photo")));
  EXPECT_EQ(Tree(outside_), before);
}

// The fuzz targets' seed corpora and saved crash inputs, replayed through the same checks.
TEST_F(HostileTest, FuzzInputsKeepTheirProperties) {
  const std::string source = __FILE__;
  const std::string fuzzDir = source.substr(0, source.rfind('/')) + "/../fuzz";
  fuzzh::Env env{root_};
  fuzzh::SetUpRoot(env);
  fuzzh::SinkDaemon daemon;
  ASSERT_TRUE(daemon.Start(env.Socket()));

  using Check = std::string (*)(const fuzzh::Env&, const uint8_t*, size_t);
  const std::vector<std::pair<std::string, Check>> targets = {
      {"fuzz_queue_line",
       [](const fuzzh::Env& e, const uint8_t* data, size_t size) {
         std::string problem = fuzzh::CheckQueueLine(std::string(reinterpret_cast<const char*>(data), size));
         return problem.empty() ? fuzzh::CheckQueueFile(e, data, size) : problem;
       }},
      {"fuzz_folders_load", fuzzh::CheckFolderConf},
      {"fuzz_status", fuzzh::CheckStatusConf},
      {"fuzz_index_mgr", fuzzh::CheckIndexMgr},
  };
  int replayed = 0;
  for (const auto& target : targets) {
    for (const char* kind : {"/corpus/", "/regressions/"}) {
      const std::string dir = fuzzDir + kind + target.first;
      DIR* d = ::opendir(dir.c_str());
      if (d == nullptr) continue;
      while (struct dirent* entry = ::readdir(d)) {
        if (entry->d_name[0] == '.') continue;
        const std::string input = ReadFile(dir + "/" + entry->d_name);
        EXPECT_EQ(target.second(env, reinterpret_cast<const uint8_t*>(input.data()), input.size()), "")
            << dir << "/" << entry->d_name;
        ++replayed;
      }
      ::closedir(d);
    }
  }
  EXPECT_GE(replayed, 20);
}

}  // namespace
