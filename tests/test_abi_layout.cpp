// Class layouts and virtual-function slots are part of the binary interface: programs
// linked against the library depend on them.
#include <fileindex/config.h>
#include <fileindex/folder.h>
#include <fileindex/folders.h>
#include <fileindex/status.h>

#include <cstddef>
#include <cstring>
#include <map>

#include "support/sysroot_test.h"

using namespace TAVO::FILEINDEX;

namespace {

// Mirrors of the documented layouts.
struct ConfigMirror {
  void* vptr;
  Json::Value document;
  int lockDescriptor;
};
struct FolderMirror {
  std::string fullPath;
  std::string path;
  std::string name;
  bool document;
  bool audio;
  bool video;
  bool photo;
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

// Itanium C++ ABI: a pointer to a virtual member function holds 1 + the byte offset of
// its slot in the vtable. Slots 0 and 1 are the complete and deleting destructors.
template <typename PMF>
std::ptrdiff_t VirtualSlot(PMF pmf) {
  std::ptrdiff_t raw[2];
  static_assert(sizeof(pmf) == sizeof(raw), "Itanium member-function pointer");
  std::memcpy(raw, &pmf, sizeof(raw));
  EXPECT_EQ(raw[0] % static_cast<std::ptrdiff_t>(sizeof(void*)), 1) << "not a virtual function";
  return (raw[0] - 1) / static_cast<std::ptrdiff_t>(sizeof(void*));
}

class LayoutTest : public SysrootTest {};

class ProbeConfig : public Config {
 public:
  bool Load() override { return LoadJson(); }
  bool Save() override { return SaveJson(); }
  std::string GetLockPath() const override { return "lock"; }
  std::string GetPath() const override { return "path"; }
  const void* DocumentAddress() const { return &m_jsDocument; }
  const void* LockAddress() const { return &m_fdLock; }
};

}  // namespace

TEST_F(LayoutTest, VirtualFunctionsKeepTheirSlots) {
  EXPECT_EQ(VirtualSlot(&Config::Load), 2);
  EXPECT_EQ(VirtualSlot(&Config::Save), 3);
  EXPECT_EQ(VirtualSlot(&Config::GetLockPath), 4);
  EXPECT_EQ(VirtualSlot(&Config::GetPath), 5);
  for (auto slot : {VirtualSlot(&Folders::Load), VirtualSlot(&Status::Load)}) EXPECT_EQ(slot, 2);
  for (auto slot : {VirtualSlot(&Folders::Save), VirtualSlot(&Status::Save)}) EXPECT_EQ(slot, 3);
  for (auto slot : {VirtualSlot(&Folders::GetLockPath), VirtualSlot(&Status::GetLockPath)}) EXPECT_EQ(slot, 4);
  for (auto slot : {VirtualSlot(&Folders::GetPath), VirtualSlot(&Status::GetPath)}) EXPECT_EQ(slot, 5);
}

TEST_F(LayoutTest, CallsThroughTheBaseReachTheSubclassesInSlotOrder) {
  AddShare("photo");
  WriteFile(FolderConfPath(), R"({"/photo/a":{"name":"a","document":true}})");
  Config* configs[] = {new Folders(), new Status()};
  EXPECT_EQ(configs[0]->GetPath(), FolderConfPath());
  EXPECT_EQ(configs[0]->GetLockPath(), Rooted("/tmp/fileidx_cfg_folder.lock"));
  EXPECT_EQ(configs[1]->GetPath(), StatusConfPath());
  EXPECT_EQ(configs[1]->GetLockPath(), Rooted("/tmp/fileidx_cfg_status.lock"));
  for (Config* config : configs) {
    EXPECT_TRUE(config->Load());
    EXPECT_TRUE(config->Save());
    delete config;  // the deleting destructor, through the base
  }
  EXPECT_EQ(ReadJson(FolderConfPath())["/photo/a"]["document"], true);
  EXPECT_TRUE(Exists(StatusConfPath()));
}

TEST_F(LayoutTest, MembersSitInTheirDocumentedOrder) {
  ProbeConfig config;
  ConfigMirror mirror;
  auto offset = [](const void* member, const void* object) {
    return static_cast<const char*>(member) - static_cast<const char*>(object);
  };
  EXPECT_EQ(offset(config.DocumentAddress(), &config), offset(&mirror.document, &mirror));
  EXPECT_EQ(offset(config.LockAddress(), &config), offset(&mirror.lockDescriptor, &mirror));
  EXPECT_EQ(*static_cast<const int*>(config.LockAddress()), -1);

  // Reading a Folder through its mirror shows each member where the layout puts it;
  // the flags are set to a pattern that tells them apart.
  AddShare("photo");
  Folder folder;
  Json::Value record;
  record["name"] = "holiday";
  record["document"] = true;
  record["audio"] = false;
  record["video"] = true;
  record["photo"] = false;
  ASSERT_TRUE(folder.Load("/photo/2019", record));
  FolderMirror seen;
  std::memcpy(static_cast<void*>(&seen.document), reinterpret_cast<const char*>(&folder) + offsetof(FolderMirror, document), 4);
  const std::string* strings = reinterpret_cast<const std::string*>(&folder);
  EXPECT_EQ(strings[0], Rooted("/volume1/photo/2019"));
  EXPECT_EQ(strings[1], "/photo/2019");
  EXPECT_EQ(strings[2], "holiday");
  EXPECT_TRUE(seen.document);
  EXPECT_FALSE(seen.audio);
  EXPECT_TRUE(seen.video);
  EXPECT_FALSE(seen.photo);
}
