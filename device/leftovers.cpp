#include "leftovers.h"

#include <dirent.h>
#include <poll.h>
#include <signal.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <set>

#include "device.h"
#include "state/state_file.h"
#include "supervisor.h"

namespace {

namespace fs = std::filesystem;

constexpr int kMillisInSecond = 1000;

/**
 * Processes in the device's mount namespace, or whose environment says that they run inside the
 * device, but for our own ancestors.
 */
std::set<pid_t> processes_inside(const std::string &device, const std::string &space) {
  std::set<pid_t> ancestors;
  for (pid_t pid = getpid(); pid > 1;) {
    ancestors.insert(pid);
    std::ifstream file("/proc/" + std::to_string(pid) + "/status");
    std::string line;
    pid = 0;
    while (std::getline(file, line)) {
      if (line.compare(0, 5, "PPid:") == 0) pid = std::atoi(line.c_str() + 5);
    }
  }
  const std::string wanted = std::string(embedded::kDeviceVariable) + "=" + device;
  std::set<pid_t> found;
  DIR *proc = opendir("/proc");
  if (proc == nullptr) return found;
  while (const dirent *entry = readdir(proc)) {
    const pid_t pid = std::atoi(entry->d_name);
    if (pid <= 0 || ancestors.count(pid) != 0) continue;
    if (!space.empty() && namespace_of(entry->d_name) == space) {
      if (!birth_of(pid).empty()) found.insert(pid);
      continue;
    }
    std::ifstream file(std::string("/proc/") + entry->d_name + "/environ", std::ios::binary);
    std::string variable;
    while (std::getline(file, variable, '\0')) {
      if (variable != wanted) continue;
      if (!birth_of(pid).empty()) found.insert(pid);
      break;
    }
  }
  closedir(proc);
  return found;
}

}  // namespace

std::string namespace_of(const std::string &pid) {
  std::error_code error;
  return fs::read_symlink("/proc/" + pid + "/ns/mnt", error).string();
}

bool wait_for_end(pid_t pid, int seconds) {
  const Fd process(static_cast<int>(syscall(SYS_pidfd_open, pid, 0)));
  if (process.fd < 0) return true;
  pollfd ended{process.fd, POLLIN, 0};
  return poll(&ended, 1, seconds * kMillisInSecond) != 0;
}

void end_leftovers(const std::string &device, const std::string &space) {
  for (const int signal_number : {SIGTERM, SIGKILL}) {
    const std::set<pid_t> left = processes_inside(device, space);
    for (const pid_t pid : left) kill(pid, signal_number);
    for (const pid_t pid : left) wait_for_end(pid, signal_number == SIGTERM ? 2 : kStopSeconds);
  }
}
