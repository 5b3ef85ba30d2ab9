/**
 * @file temp_dir.h
 * @brief A fresh directory for one test, and small helpers to fill and read it.
 */
#ifndef TEMP_DIR_H
#define TEMP_DIR_H

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>

/** Made on construction, removed with everything in it on destruction. */
class TempDir {
 public:
  TempDir() {
    std::string name = std::filesystem::temp_directory_path() / "quarn_test_XXXXXX";
    path_ = mkdtemp(name.data()) == nullptr ? "" : name;
    static_cast<void>(chmod(path_.c_str(), 0755));
  }
  ~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  TempDir(const TempDir &) = delete;
  TempDir &operator=(const TempDir &) = delete;

  const std::string &path() const { return path_; }
  std::string operator/(const std::string &name) const { return path_ + "/" + name; }

  /** Write a file, with its directories. @return its path */
  std::string file(const std::string &name, const std::string &content) const {
    const std::string whole = *this / name;
    std::filesystem::create_directories(std::filesystem::path(whole).parent_path());
    std::ofstream(whole, std::ios::binary) << content;
    return whole;
  }
  std::string dir(const std::string &name) const {
    std::filesystem::create_directories(*this / name);
    return *this / name;
  }
  std::string link(const std::string &name, const std::string &target) const {
    std::filesystem::create_symlink(target, *this / name);
    return *this / name;
  }

 private:
  std::string path_;
};

inline std::string content_of(const std::string &path) {
  std::ifstream in(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
}

inline bool exists(const std::string &path) {
  struct stat status = {};
  return lstat(path.c_str(), &status) == 0;
}

#endif
