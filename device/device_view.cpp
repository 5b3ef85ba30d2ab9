#include "device_view.h"

#include <fcntl.h>
#include <grp.h>
#include <pwd.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "device.h"
#include "state/state_file.h"

namespace {

namespace fs = std::filesystem;

constexpr char kTmpPath[] = "/tmp";
constexpr char kMountsFile[] = "run/tmp-mounts";

void make_apps_path() {
  std::error_code error;
  fs::create_directories(kAppsPath, error);
  if (error && !fs::is_directory(kAppsPath)) {
    throw Failure(std::string("cannot make ") + kAppsPath + ": " + error.message());
  }
}

void bind_over(const std::string &source, const char *target) {
  if (mount(source.c_str(), target, nullptr, MS_BIND, nullptr) != 0) {
    throw Failure("cannot mount " + source + " on " + target + ": " + reason());
  }
}

/** Inside, the text @p added is at the end of the machine's file @p path, which stays as it is. */
void show_with(const std::string &device, const char *path, const std::string &added) {
  std::ifstream present(path);
  std::string text((std::istreambuf_iterator<char>(present)), {});
  if (!text.empty() && text.back() != '\n') text += '\n';
  const std::string file = device + "/run/" + fs::path(path).filename().string();
  write_file(file, text + added);
  bind_over(file, path);
}

/**
 * The bus serves only users and groups that the machine knows: inside, the applications' user and
 * the clients' group are known.
 */
void show_users(const std::string &device) {
  constexpr uid_t kAppUser = 5000;
  constexpr char kClientGroup[] = "quarn";
  constexpr gid_t kClientGroupNumber = 5999;
  if (getpwuid(kAppUser) == nullptr) {
    const std::string id = std::to_string(kAppUser);
    show_with(device, "/etc/passwd",
              "quarn-app:x:" + id + ":" + id + "::/nonexistent:/usr/sbin/nologin\n");
  }
  if (getgrnam(kClientGroup) == nullptr) {
    show_with(device, "/etc/group",
              std::string(kClientGroup) + ":x:" + std::to_string(kClientGroupNumber) + ":\n");
  }
}

}  // namespace

std::string tmp_entry(const std::string &path) {
  const std::string start = std::string(kTmpPath) + "/";
  if (path.compare(0, start.size(), start) != 0) return "";
  const std::string rest = path.substr(start.size());
  return rest.substr(0, rest.find('/'));
}

void show_tmp_entry(const std::string &device, int host_tmp, const std::string &name) {
  if (name.empty() || name == "." || name == "..") return;
  const std::string inside = std::string(kTmpPath) + "/" + name;
  struct stat present {};
  if (lstat(inside.c_str(), &present) == 0) return;
  struct stat original {};
  if (fstatat(host_tmp, name.c_str(), &original, AT_SYMLINK_NOFOLLOW) != 0) return;
  if (S_ISDIR(original.st_mode)) {
    if (mkdir(inside.c_str(), 0700) != 0) return;
  } else if (S_ISREG(original.st_mode)) {
    const Fd made(open(inside.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600));
    if (made.fd < 0) return;
  } else {
    return;
  }
  const std::string source = "/proc/self/fd/" + std::to_string(host_tmp) + "/" + name;
  if (mount(source.c_str(), inside.c_str(), nullptr, MS_BIND | MS_REC, nullptr) != 0) {
    throw Failure("cannot show " + inside + " inside the device: " + reason());
  }
  std::ofstream(device + "/" + kMountsFile, std::ios::app) << name << "\n";
}

void forget_tmp_entries(const std::string &device) {
  std::ifstream file(device + "/" + kMountsFile);
  const fs::path places = device + "/root/tmp";
  std::string name;
  while (std::getline(file, name)) {
    const fs::path place = places / name;
    struct stat status {};
    if (lstat(place.c_str(), &status) != 0) continue;
    if (S_ISDIR(status.st_mode)) {
      rmdir(place.c_str());
    } else if (S_ISREG(status.st_mode) && status.st_size == 0) {
      unlink(place.c_str());
    }
  }
  unlink((device + "/" + kMountsFile).c_str());
}

bool enter_own_namespace(const std::string &device) {
  if (unshare(CLONE_NEWNS) != 0) {
    if (errno == EPERM || errno == ENOSYS) return false;
    throw Failure("cannot make a mount namespace: " + reason());
  }
  if (mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
    if (errno == EPERM || errno == EACCES) return false;
    throw Failure("cannot make the mounts private: " + reason());
  }
  make_apps_path();
  const int host_tmp = open(kTmpPath, O_PATH | O_DIRECTORY | O_CLOEXEC);
  if (host_tmp < 0 || dup3(host_tmp, kHostTmpFd, O_CLOEXEC) < 0) {
    throw Failure(std::string("cannot open ") + kTmpPath + ": " + reason());
  }
  close(host_tmp);
  bind_over(device + "/root/opt/usr/apps", kAppsPath);
  bind_over(device + "/root/tmp", kTmpPath);
  show_tmp_entry(device, kHostTmpFd, tmp_entry(device));
  show_tmp_entry(device, kHostTmpFd, tmp_entry(program_directory()));
  show_users(device);
  return true;
}

void map_apps_path(const std::string &device) {
  const std::string target = device + "/root/opt/usr/apps";
  std::error_code error;
  fs::create_directories(fs::path(kAppsPath).parent_path(), error);
  if (fs::is_symlink(kAppsPath, error)) {
    const std::string present = fs::read_symlink(kAppsPath, error).string();
    if (present == target) return;
    // A link that a device left behind which was not stopped is in nobody's way.
    const std::string below = "/root/opt/usr/apps";
    const bool of_device = present.size() > below.size() &&
                           present.compare(present.size() - below.size(), below.size(), below) == 0;
    if (fs::exists(kAppsPath, error) &&
        (!of_device || is_started(present.substr(0, present.size() - below.size())))) {
      throw Failure(std::string(kAppsPath) + " is mapped to another device: stop that one first");
    }
    fs::remove(kAppsPath, error);
  } else if (fs::exists(kAppsPath, error) && rmdir(kAppsPath) != 0) {
    throw Failure(std::string(kAppsPath) +
                  " is in use on this machine, and mount namespaces are "
                  "not permitted");
  }
  if (symlink(target.c_str(), kAppsPath) != 0) {
    throw Failure(std::string("cannot map ") + kAppsPath + ": " + reason());
  }
}

void unmap_apps_path(const std::string &device) {
  std::error_code error;
  if (fs::is_symlink(kAppsPath, error) &&
      fs::read_symlink(kAppsPath, error) == device + "/root/opt/usr/apps") {
    fs::remove(kAppsPath, error);
  }
}

void set_environment(const std::string &device) {
  setenv(embedded::kDeviceVariable, device.c_str(), 1);
  setenv("QUARN_CLOUD_CONFIG", embedded::state_path(device, "cloud.conf").c_str(), 1);
  setenv("DBUS_SYSTEM_BUS_ADDRESS", bus_address(device).c_str(), 1);
}
