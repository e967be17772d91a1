// Small file helpers of the host platform. Every descriptor is opened close-on-exec:
// the library runs programs while it holds its lock files.
#include <dirent.h>
#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <cerrno>
#include <cstdio>
#include <ctime>

#include "host_common.h"

namespace tavo_host {

bool ReadFile(const std::string& path, std::string& out) {
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  std::string text;
  char buffer[8192];
  for (;;) {
    ssize_t n = ::read(fd, buffer, sizeof(buffer));
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) {
      int saved = errno;
      ::close(fd);
      errno = saved;
      return false;
    }
    if (n == 0) break;
    text.append(buffer, static_cast<size_t>(n));
  }
  ::close(fd);
  out.swap(text);
  return true;
}

namespace {

std::string DirName(const std::string& path) {
  std::string::size_type slash = path.rfind('/');
  if (slash == std::string::npos) return ".";
  if (slash == 0) return "/";
  return path.substr(0, slash);
}

bool WriteAll(int fd, const std::string& content) {
  size_t done = 0;
  while (done < content.size()) {
    ssize_t n = ::write(fd, content.data() + done, content.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

// Gives the unnamed (O_TMPFILE) file fd a fresh name beside path. Linking by descriptor
// needs CAP_DAC_READ_SEARCH; /proc serves other callers.
bool LinkUnnamed(int fd, const std::string& path, std::string& name) {
  static const char kLetters[] = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789";
  char procPath[64];
  std::snprintf(procPath, sizeof(procPath), "/proc/self/fd/%d", fd);
  for (int attempt = 0; attempt < 100; ++attempt) {
    unsigned char random[6];
    if (::getrandom(random, sizeof(random), 0) != static_cast<ssize_t>(sizeof(random))) return false;
    name = path + ".";
    for (unsigned char r : random) name += kLetters[r % (sizeof(kLetters) - 1)];
    if (::linkat(fd, "", AT_FDCWD, name.c_str(), AT_EMPTY_PATH) == 0) return true;
    if (errno != EEXIST && ::linkat(AT_FDCWD, procPath, AT_FDCWD, name.c_str(), AT_SYMLINK_FOLLOW) == 0)
      return true;
    if (errno != EEXIST) return false;
  }
  return false;
}

// Removes the temporary files of path ("path.XXXXXX") that a writer killed between naming
// and renaming one left behind. A live writer's name is younger than a second or two (its
// link or its last write changed the inode just before), so only older ones go.
void SweepTemporaries(const std::string& path) {
  const std::string dir = DirName(path);
  const std::string base = path.substr(path.rfind('/') + 1) + ".";
  DIR* d = ::opendir(dir.c_str());
  if (d == nullptr) return;
  const time_t now = ::time(nullptr);
  while (dirent* entry = ::readdir(d)) {
    const std::string name = entry->d_name;
    if (name.size() != base.size() + 6 || name.compare(0, base.size(), base) != 0) continue;
    bool temporary = true;
    for (size_t i = base.size(); i < name.size(); ++i)
      temporary = temporary && std::isalnum(static_cast<unsigned char>(name[i]));
    struct stat st;
    const std::string full = dir + "/" + name;
    if (temporary && ::lstat(full.c_str(), &st) == 0 && S_ISREG(st.st_mode) && now - st.st_ctime >= 2)
      ::unlink(full.c_str());
  }
  ::closedir(d);
}

}  // namespace

// The content is written and synced into an unnamed file of the directory (O_TMPFILE) and
// named only just before the rename, so a process killed while writing leaves nothing
// behind in the watch-list or service-state directories; one killed in the instant between
// naming and renaming leaves a temporary file that the next write of the same file sweeps
// away. Where O_TMPFILE is not available, a named temporary file does the same job.
bool WriteFileAtomic(const std::string& path, const std::string& content, mode_t mode) {
  SweepTemporaries(path);
  std::string tmp;
  int fd = ::open(DirName(path).c_str(), O_TMPFILE | O_WRONLY | O_CLOEXEC, mode);
  if (fd >= 0) {
    bool ok =
        ::fchmod(fd, mode) == 0 && WriteAll(fd, content) && ::fsync(fd) == 0 && LinkUnnamed(fd, path, tmp);
    int saved = errno;
    if (::close(fd) != 0 && ok) {
      saved = errno;
      ok = false;
    }
    if (!ok) {
      if (!tmp.empty()) ::unlink(tmp.c_str());
      errno = saved;
      return false;
    }
  } else {
    tmp = path + ".XXXXXX";
    fd = ::mkostemp(&tmp[0], O_CLOEXEC);
    if (fd < 0) return false;
    bool ok = ::fchmod(fd, mode) == 0 && WriteAll(fd, content) && ::fsync(fd) == 0;
    int saved = errno;
    ok = ::close(fd) == 0 && ok;
    if (!ok) {
      ::unlink(tmp.c_str());
      errno = saved;
      return false;
    }
  }
  if (::rename(tmp.c_str(), path.c_str()) != 0) {
    int saved = errno;
    ::unlink(tmp.c_str());
    errno = saved;
    return false;
  }
  int dir = ::open(DirName(path).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dir >= 0) {
    ::fsync(dir);
    ::close(dir);
  }
  return true;
}

bool MakeDirs(const std::string& path, mode_t mode) {
  if (path.empty()) return false;
  struct stat st;
  if (::stat(path.c_str(), &st) == 0) {
    if (S_ISDIR(st.st_mode)) return true;
    errno = ENOTDIR;
    return false;
  }
  std::string parent = DirName(path);
  if (parent != path && !MakeDirs(parent, mode)) return false;
  return ::mkdir(path.c_str(), mode) == 0 || errno == EEXIST;
}

bool IsExecutableFile(const std::string& path) {
  struct stat st;
  return ::stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode) && ::access(path.c_str(), X_OK) == 0;
}

}  // namespace tavo_host
