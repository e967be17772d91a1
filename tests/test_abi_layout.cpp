// Class layouts and virtual-function slots: programs linked against the library depend on them.
#include <fileindex/config.h>
#include <fileindex/folder.h>
#include <fileindex/folders.h>
#include <fileindex/status.h>

#include <cstddef>
#include <cstring>
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

static_assert(sizeof(Config) == sizeof(ConfigMirror), "Config: vptr, document, lock descriptor");
static_assert(sizeof(Folder) == sizeof(FolderMirror), "Folder: three strings and four flags, no vtable");
static_assert(sizeof(Folders) == sizeof(ConfigMirror) + sizeof(std::map<std::string, Folder>),
              "Folders: Config, then the folder map");
static_assert(sizeof(Status) == sizeof(ConfigMirror), "Status adds no members");

// Itanium ABI: a virtual member-function pointer holds 1 + its slot's byte offset in the vtable.
template <typename PMF>
std::ptrdiff_t VirtualSlot(PMF pmf) {
  std::ptrdiff_t word;  // the pointer's first word
  std::memcpy(&word, &pmf, sizeof(word));
  return (word - 1) / static_cast<std::ptrdiff_t>(sizeof(void*));
}

struct ProbeStatus : Status {  // Config's protected members, seen from a subclass
  std::vector<const void*> Members() const { return {&m_jsDocument, &m_fdLock}; }
};

using LayoutTest = SysrootTest;

}  // namespace

// Slots 0 and 1 are the destructors. A Folder's flags are set to a pattern that tells them apart.
TEST_F(LayoutTest, VirtualSlotsAndMembersKeepTheirOrder) {
  EXPECT_EQ(std::vector<std::ptrdiff_t>({VirtualSlot(&Config::Load), VirtualSlot(&Config::Save),
                                         VirtualSlot(&Config::GetLockPath), VirtualSlot(&Config::GetPath)}),
            std::vector<std::ptrdiff_t>({2, 3, 4, 5}));
  ProbeStatus probe;
  const auto* mirror = reinterpret_cast<const ConfigMirror*>(&probe);
  EXPECT_EQ(probe.Members(), (std::vector<const void*>{&mirror->document, &mirror->lockDescriptor}));
  AddShare("photo");
  Folder folder;
  ASSERT_TRUE(folder.Load("/photo/2019", ParseJson(R"({"name":"holiday","document":true,"video":true})")));
  const std::string* strings = reinterpret_cast<const std::string*>(&folder);
  EXPECT_EQ(std::vector<std::string>(strings, strings + 3),
            (std::vector<std::string>{Rooted("/volume1/photo/2019"), "/photo/2019", "holiday"}));
  const bool* seen = reinterpret_cast<const bool*>(&folder) + offsetof(FolderMirror, document);
  EXPECT_EQ(std::vector<bool>(seen, seen + 4), std::vector<bool>({true, false, true, false}));
}
