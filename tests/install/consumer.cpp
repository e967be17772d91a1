// A C++ program built against the installed library.
#include <fileindex/fileindex.h>

#include <iostream>

int main() {
  using namespace TAVO::FILEINDEX;
  std::string share;
  bool ok = GetShareNameByPath(share, "/photo/2019") && share == "photo";
  std::vector<Folder> folders;
  ok = ok && IndexMgr::List(folders) && folders.empty();
  ok = ok && !IndexMgr::IsPathIndexed("/photo/2019") && LOG_LEVEL == 3;
  std::cout << (ok ? "1 passed, 0 failed" : "0 passed, 1 failed") << std::endl;
  return ok ? 0 : 1;
}
