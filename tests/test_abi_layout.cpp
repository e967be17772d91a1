// Class layouts and virtual-function slots are part of the binary interface: programs
// linked against the library depend on them.
#include <fileindex/config.h>
#include <fileindex/folder.h>
#include <fileindex/folders.h>
#include <fileindex/status.h>

#include <cstddef>
#include <cstring>
#include <map>
#include <memory>
#include <vector>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

struct ConfigMirror {
  void* vptr;
  Json::Value document;
  int lockDescriptor;
};
struct FolderMirror {
  std::string fullPath, path, name;
  bool document, audio, video, photo;
};
struct FoldersMirror {
  ConfigMirror base;
  std::map<std::string, Folder> folders;
};

static_assert(sizeof(Config) == sizeof(ConfigMirror), "Config: vptr, document, lock descriptor");
static_assert(sizeof(Folder) == sizeof(FolderMirror), "Folder: three strings and four flags");
static_assert(sizeof(Folders) == sizeof(FoldersMirror), "Folders: Config, then the folder map");
static_assert(sizeof(Status) == sizeof(ConfigMirror), "Status adds no members");
static_assert(std::is_polymorphic<Config>::value && std::is_abstract<Config>::value, "Config is abstract");
static_assert(!std::is_polymorphic<Folder>::value, "Folder has no vtable");

// Itanium ABI: a virtual member-function pointer holds 1 + its slot's byte offset in the
// vtable; slots 0 and 1 are the destructors.
template <typename PMF>
std::ptrdiff_t VirtualSlot(PMF pmf) {
  std::ptrdiff_t raw[2];
  static_assert(sizeof(pmf) == sizeof(raw), "Itanium member-function pointer");
  std::memcpy(raw, &pmf, sizeof(raw));
  EXPECT_EQ(raw[0] % static_cast<std::ptrdiff_t>(sizeof(void*)), 1) << "not a virtual function";
  return (raw[0] - 1) / static_cast<std::ptrdiff_t>(sizeof(void*));
}

using LayoutTest = SysrootTest;

struct ProbeConfig : Config {
  bool Load() override { return false; }
  bool Save() override { return false; }
  std::string GetLockPath() const override { return ""; }
  std::string GetPath() const override { return ""; }
  const void* DocumentAddress() const { return &m_jsDocument; }
  const void* LockAddress() const { return &m_fdLock; }
};

}  // namespace

// Slots are fixed; virtual calls and the deleting destructor through the base reach the subclasses.
TEST_F(LayoutTest, VirtualFunctionsKeepTheirSlotsAndDispatchThroughTheBase) {
  EXPECT_EQ(std::vector<std::ptrdiff_t>({VirtualSlot(&Config::Load), VirtualSlot(&Config::Save),
                                         VirtualSlot(&Config::GetLockPath), VirtualSlot(&Config::GetPath),
                                         VirtualSlot(&Folders::Load), VirtualSlot(&Status::Save),
                                         VirtualSlot(&Folders::GetLockPath), VirtualSlot(&Status::GetPath)}),
            std::vector<std::ptrdiff_t>({2, 3, 4, 5, 2, 3, 4, 5}));
  std::unique_ptr<Config> folders(new Folders()), status(new Status());
  EXPECT_EQ(folders->GetPath() + "|" + folders->GetLockPath(), FolderConfPath() + "|" + Rooted("/tmp/fileidx_cfg_folder.lock"));
  EXPECT_EQ(status->GetPath() + "|" + status->GetLockPath(), StatusConfPath() + "|" + Rooted("/tmp/fileidx_cfg_status.lock"));
  EXPECT_TRUE(folders->Load() && folders->Save() && status->Load() && status->Save());
  EXPECT_TRUE(Exists(FolderConfPath()) && Exists(StatusConfPath()));
}

TEST_F(LayoutTest, MembersSitInTheirDocumentedOrder) {
  ProbeConfig config;
  ConfigMirror mirror;
  auto offset = [](const void* m, const void* o) { return static_cast<const char*>(m) - static_cast<const char*>(o); };
  EXPECT_EQ(offset(config.DocumentAddress(), &config), offset(&mirror.document, &mirror));
  EXPECT_EQ(offset(config.LockAddress(), &config), offset(&mirror.lockDescriptor, &mirror));
  EXPECT_EQ(*static_cast<const int*>(config.LockAddress()), -1);
  // A Folder read through its mirror; the flags set to a pattern that tells them apart.
  AddShare("photo");
  Folder folder;
  ASSERT_TRUE(folder.Load("/photo/2019", ParseJson(R"({"name":"holiday","document":true,"audio":false,"video":true,"photo":false})")));
  FolderMirror seen;
  std::memcpy(static_cast<void*>(&seen.document), reinterpret_cast<const char*>(&folder) + offsetof(FolderMirror, document), 4);
  const std::string* strings = reinterpret_cast<const std::string*>(&folder);
  EXPECT_EQ(std::vector<std::string>(strings, strings + 3),
            (std::vector<std::string>{Rooted("/volume1/photo/2019"), "/photo/2019", "holiday"}));
  EXPECT_EQ(std::vector<bool>({seen.document, seen.audio, seen.video, seen.photo}),
            std::vector<bool>({true, false, true, false}));
}
