#include "temp_dir.h"

#include <sys/stat.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>

namespace fs = std::filesystem;

std::string quick_directory() {
  constexpr char kMemory[] = "/dev/shm";
  constexpr std::uintmax_t kEnough = 256U << 20;
  std::error_code none;
  const fs::space_info space = fs::space(kMemory, none);
  return !none && space.available >= kEnough ? kMemory : fs::temp_directory_path().string();
}

TempDir::TempDir() : TempDir(fs::temp_directory_path().string()) {}

TempDir::TempDir(const std::string &above) : path_(above + "/quarn-unit-XXXXXX") {
  // Without it a test would write to the root of the machine.
  if (mkdtemp(path_.data()) == nullptr) {
    std::perror(path_.c_str());
    std::abort();
  }
  static_cast<void>(chmod(path_.c_str(), 0755));
}

TempDir::~TempDir() {
  std::error_code ignored;
  fs::remove_all(path_, ignored);
}

std::string TempDir::file(const std::string &name, const std::string &content) const {
  write_text(*this / name, content);
  return *this / name;
}

std::string TempDir::dir(const std::string &name) const {
  fs::create_directories(*this / name);
  return *this / name;
}

std::string TempDir::link(const std::string &name, const std::string &target) const {
  fs::create_symlink(target, *this / name);
  return *this / name;
}
