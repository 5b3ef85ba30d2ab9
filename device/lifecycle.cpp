// The verbs that start, stop and enter a device.
#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <set>

#include "daemon_run.h"
#include "device.h"
#include "device_view.h"
#include "leftovers.h"
#include "state/state_file.h"
#include "supervisor.h"

namespace {

namespace fs = std::filesystem;

constexpr int kStartMilliseconds = 20000;

class StartLock {
 public:
  explicit StartLock(const std::string &device)
      : lock_(open((device + "/run/.start").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600)) {
    if (lock_.fd < 0 || TEMP_FAILURE_RETRY(flock(lock_.fd, LOCK_EX)) != 0) {
      throw Failure("cannot lock the device: " + reason());
    }
  }

  int fd() const { return lock_.fd; }

 private:
  Fd lock_;
};

std::string read_all(int fd) {
  std::string text;
  char buffer[512];
  pollfd ready{fd, POLLIN, 0};
  while (poll(&ready, 1, kStartMilliseconds) > 0) {
    const ssize_t length = TEMP_FAILURE_RETRY(read(fd, buffer, sizeof buffer));
    if (length <= 0) break;
    text.append(buffer, static_cast<std::size_t>(length));
  }
  return text;
}

}  // namespace

void write_file(const std::string &path, const std::string &text) {
  std::ofstream file(path, std::ios::trunc);
  file << text;
  file.close();
  if (!file) throw Failure("cannot write " + path + ": " + reason());
}

int verb_start(const Arguments &arguments) {
  if (arguments.size() != 1) wrong_use();
  const std::string device = open_device(arguments[0]);
  if ((device + "/run/bus").size() >= sizeof(sockaddr_un{}.sun_path)) {
    throw Failure("the path of the device is too long for its bus socket");
  }
  const StartLock lock(device);
  if (is_started(device)) return DEVICE_OK;
  if ((device + "/").compare(0, sizeof kAppsPath, std::string(kAppsPath) + "/") == 0) {
    throw Failure(std::string("a device cannot lie below ") + kAppsPath + ", which it covers");
  }
  close_folders(device);
  end_leftovers(device, "");
  forget_tmp_entries(device);
  embedded::sweep_state(device);
  forget_restarts(device);
  const Fd told(fork_supervisor(device, lock.fd()));
  const std::string answer = read_all(told.fd);
  if (answer.empty() || answer[0] != kReady) {
    end_leftovers(device, "");
    throw Failure(answer.empty() ? "the device did not start; see " + device + "/log/device.log"
                                 : answer);
  }
  if (answer.size() > 1) std::fprintf(stderr, "quarn-device: %s\n", answer.c_str() + 1);
  return DEVICE_OK;
}

int verb_stop(const Arguments &arguments) {
  if (arguments.size() != 1) wrong_use();
  const std::string device = open_device(arguments[0]);
  const StartLock lock(device);
  Supervisor supervisor;
  std::string space;
  // Held open, the namespace's number is not given to another one meanwhile.
  Fd held;
  if (find_supervisor(device, &supervisor)) {
    const std::string process = std::to_string(supervisor.pid);
    held.fd = open(("/proc/" + process + "/ns/mnt").c_str(), O_RDONLY | O_CLOEXEC);
    if (supervisor.own_namespace && held.fd >= 0) space = namespace_of(process);
    kill(supervisor.pid, SIGTERM);
    if (!wait_for_end(supervisor.pid, kStopSeconds)) {
      kill(supervisor.pid, SIGKILL);
      wait_for_end(supervisor.pid, kStopSeconds);
    }
  }
  end_leftovers(device, space);
  unmap_apps_path(device);
  forget_tmp_entries(device);
  unlink((device + "/" + kSupervisorFile).c_str());
  unlink((device + "/run/bus").c_str());
  return DEVICE_OK;
}

namespace {

/** What of the host's /tmp a command is called with, or works in, in the device's as well. */
void show_wanted_entries(const std::string &device, int host_tmp, const std::string &here,
                         const std::string &programs, const Arguments &arguments) {
  std::set<std::string> wanted{tmp_entry(here + "/"), tmp_entry(programs)};
  for (std::size_t i = 2; i < arguments.size(); ++i) {
    const std::string &argument = arguments[i];
    const auto value = argument[0] == '-' ? argument.find('=') : std::string::npos;
    const std::string entry =
        tmp_entry(value == std::string::npos ? argument : argument.substr(value + 1));
    if (entry != kDaemonTmpEntry) wanted.insert(entry);
  }
  for (const std::string &name : wanted) show_tmp_entry(device, host_tmp, name);
}

/** Go on in the name space of the device's supervisor, in the same directory where it has that. */
void enter_device(const std::string &device, const Supervisor &supervisor, const std::string &here,
                  const std::string &programs, const Arguments &arguments) {
  const std::string process = "/proc/" + std::to_string(supervisor.pid);
  const Fd space(open((process + "/ns/mnt").c_str(), O_RDONLY | O_CLOEXEC));
  // A process with threads may only move with a view of the file system of its own.
  if (space.fd < 0 || unshare(CLONE_FS) != 0 || setns(space.fd, CLONE_NEWNS) != 0) {
    throw Failure("cannot enter the device: " + reason());
  }
  const Fd mounts_lock(open((device + "/run/.mounts").c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0600));
  if (mounts_lock.fd >= 0) flock(mounts_lock.fd, LOCK_EX);
  const Fd host_tmp(open((process + "/fd/" + std::to_string(kHostTmpFd)).c_str(),
                         O_PATH | O_DIRECTORY | O_CLOEXEC));
  show_wanted_entries(device, host_tmp.fd, here, programs, arguments);
  if (chdir(here.c_str()) != 0 && chdir("/") != 0) {
    throw Failure("cannot change the directory: " + reason());
  }
}

}  // namespace

int verb_exec(const Arguments &arguments) {
  if (arguments.size() < 3 || arguments[1] != "--") wrong_use();
  const std::string device = open_device(arguments[0]);
  Supervisor supervisor;
  if (!find_supervisor(device, &supervisor)) throw Failure("the device is not started");
  const std::string programs = program_directory();
  std::error_code error;
  const std::string here = fs::current_path(error).string();
  if (supervisor.own_namespace) enter_device(device, supervisor, here, programs, arguments);
  set_environment(device);
  const char *path = std::getenv("PATH");
  setenv("PATH",
         (programs + ":" + (path == nullptr ? "/usr/sbin:/usr/bin:/sbin:/bin" : path)).c_str(), 1);
  std::vector<char *> command;
  for (std::size_t i = 2; i < arguments.size(); ++i) {
    command.push_back(const_cast<char *>(arguments[i].c_str()));
  }
  command.push_back(nullptr);
  execvp(command[0], command.data());
  constexpr int kNotFound = 127;
  constexpr int kNotRun = 126;
  throw Failure("cannot run " + arguments[2] + ": " + reason(),
                errno == ENOENT ? kNotFound : kNotRun);
}
