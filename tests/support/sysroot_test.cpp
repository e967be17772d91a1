#include "support/sysroot_test.h"

#include <fileindex/error.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

void SysrootTest::SetUp() {
  char tmpl[] = "/tmp/fileindex-test-XXXXXX";
  ASSERT_NE(::mkdtemp(tmpl), nullptr);
  root_ = tmpl;
  ::setenv("FILEINDEX_SYSROOT", root_.c_str(), 1);
  for (const char* dir : {"/usr/tavo/etc/fileindex", "/tmp", "/var/run"})
    std::filesystem::create_directories(root_ + dir);
  fake::Reset();
  logcap::Clear();
  TAVO::FILEINDEX::LOG_LEVEL = 3;
  TAVO::FILEINDEX::ErrorHandler::g_error_code = TAVO::FILEINDEX::FILEINDEX_ERR_NONE;
}

void SysrootTest::TearDown() {
  if (root_.compare(0, 20, "/tmp/fileindex-test-") == 0 &&
      std::system(("rm -rf '" + root_ + "'").c_str()) != 0)
    ADD_FAILURE() << "cannot remove " << root_;
  ::unsetenv("FILEINDEX_SYSROOT");
}

void SysrootTest::WriteFile(const std::string& path, const std::string& content) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out << content;
  ASSERT_TRUE(static_cast<bool>(out)) << path;
}

std::string SysrootTest::ReadFile(const std::string& path) {
  std::stringstream text;
  text << std::ifstream(path, std::ios::binary).rdbuf();
  return text.str();
}

bool SysrootTest::Exists(const std::string& path) {
  struct stat st;
  return ::lstat(path.c_str(), &st) == 0;
}

Json::Value SysrootTest::ParseJson(const std::string& text) {
  std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
  Json::Value value;
  std::string errors;
  EXPECT_TRUE(reader->parse(text.data(), text.data() + text.size(), &value, &errors))
      << text << ": " << errors;
  return value;
}

std::vector<std::string> SysrootTest::ReadLines(const std::string& path) {
  std::vector<std::string> lines;
  std::ifstream in(path);
  for (std::string line; std::getline(in, line);) lines.push_back(line);
  return lines;
}
