#include "test_files.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <sstream>

std::string read_text(const std::string &path) {
  const std::ifstream file(path, std::ios::binary);
  std::ostringstream text;
  text << file.rdbuf();  // what can be read: a file of a thread in /proc goes with it
  return text.str();
}

void write_text(const std::string &path, const std::string &content) {
  std::error_code ignored;
  std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ignored);
  std::ofstream file(path, std::ios::trunc | std::ios::binary);
  file << content;
  EXPECT_TRUE(file.flush().good()) << path;
}

bool exists(const std::string &path) {
  struct stat status = {};
  return lstat(path.c_str(), &status) == 0;
}
