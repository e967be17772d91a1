// Base fixture of every unit test: a fresh temporary system root (configuration, lock and
// socket directories), a reset fake platform, an empty log capture, LOG_LEVEL 3, error code 0.
#ifndef FILEINDEX_TESTS_SYSROOT_TEST_H
#define FILEINDEX_TESTS_SYSROOT_TEST_H

#include <gtest/gtest.h>
#include <json/json.h>

#include <string>
#include <vector>

#include "support/fake_platform.h"
#include "support/log_capture.h"

class SysrootTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  std::string Rooted(const std::string& path) const { return root_ + path; }
  std::string FolderConfPath() const { return Rooted("/usr/tavo/etc/fileindex/folder.conf"); }
  std::string StatusConfPath() const { return Rooted("/usr/tavo/etc/fileindex/status.conf"); }
  std::string SocketPath() const { return Rooted("/var/run/fileindexd.sock"); }
  // Full paths in shares made by AddShare on /volume1.
  std::string Full(const std::string& path) const { return Rooted("/volume1") + path; }
  std::string EaDir(const std::string& share) const { return Rooted("/volume1/") + share + "/@eaDir"; }
  std::string Queue(const std::string& share) const { return EaDir(share) + "/TAVO@file_index_queue"; }

  fake::Share& AddShare(const std::string& name, const std::string& volume = "/volume1") {
    return fake::AddShare(root_, volume, name);
  }

  static void WriteFile(const std::string& path, const std::string& content);
  static std::string ReadFile(const std::string& path);
  static bool Exists(const std::string& path);
  static Json::Value ReadJson(const std::string& path) { return ParseJson(ReadFile(path)); }
  static Json::Value ParseJson(const std::string& text);  // fails the test when it does not parse
  static std::vector<std::string> ReadLines(const std::string& path);  // without the newlines

  std::string root_;
};

#endif
