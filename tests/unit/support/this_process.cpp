#include "this_process.h"

#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

namespace {

int entries_of(const char *folder) {
  int count = 0;
  for (const auto &entry : std::filesystem::directory_iterator(folder)) {
    static_cast<void>(entry);
    ++count;
  }
  return count;
}

}  // namespace

std::size_t resident_bytes() {
  std::ifstream statm("/proc/self/statm");
  std::size_t total = 0;
  std::size_t resident = 0;
  statm >> total >> resident;
  return resident * static_cast<std::size_t>(sysconf(_SC_PAGESIZE));
}

std::size_t peak_resident_bytes() {
  std::ifstream status("/proc/self/status");
  for (std::string word; status >> word;) {
    if (word != "VmHWM:") continue;
    std::size_t kilobytes = 0;
    status >> kilobytes;
    return kilobytes * 1024;
  }
  return 0;
}

int threads_in_use() { return entries_of("/proc/self/task"); }

int descriptors_in_use() { return entries_of("/proc/self/fd"); }
