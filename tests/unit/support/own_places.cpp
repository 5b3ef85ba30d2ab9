#include "own_places.h"

#include <fcntl.h>
#include <sched.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

namespace {

constexpr const char *kPlaces[] = {"/tmp", "/opt", "/dev/shm"};
constexpr char kAlreadyThere[] = "QUARN_TEST_OWN_PLACES";
constexpr char kLock[] = "/tmp/quarn-unit-tests.lock";

bool is_covered(const std::string &path) {
  for (const std::string place : kPlaces) {
    if (path.rfind(place + "/", 0) == 0) return true;
  }
  return false;
}

[[noreturn]] void give_up(const std::string &what) {
  std::perror(what.c_str());
  std::exit(EXIT_FAILURE);
}

/** A folder that is shown again under its name after something covers it. */
struct Kept {
  std::string path;
  int fd;
};

std::vector<Kept> folders_of_build() {
  std::vector<Kept> kept;
  for (const char *path : {QUARN_SOURCE_FOLDER, QUARN_BUILD_FOLDER}) {
    if (!is_covered(path)) continue;
    const int fd = open(path, O_PATH | O_DIRECTORY | O_CLOEXEC);
    if (fd >= 0) kept.push_back({path, fd});
  }
  return kept;
}

void show_again(const Kept &kept) {
  std::filesystem::create_directories(kept.path);
  const std::string source = "/proc/self/fd/" + std::to_string(kept.fd);
  if (mount(source.c_str(), kept.path.c_str(), nullptr, MS_BIND | MS_REC, nullptr) != 0) {
    give_up(kept.path);
  }
  close(kept.fd);
}

/** Kept open: the process's end gives the lock back. */
void wait_until_alone() {
  const int lock = open(kLock, O_RDWR | O_CREAT | O_CLOEXEC, 0666);
  if (lock < 0 || flock(lock, LOCK_EX) != 0) give_up(kLock);
}

}  // namespace

void enter_own_places() {
  if (getenv(kAlreadyThere) != nullptr) return;
  setenv(kAlreadyThere, "1", 1);
  if (unshare(CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
    wait_until_alone();
    return;
  }
  const std::vector<Kept> kept = folders_of_build();
  for (const char *place : kPlaces) {
    std::filesystem::create_directories(place);
    if (mount("tmpfs", place, "tmpfs", 0, "mode=1777") != 0) give_up(place);
  }
  for (const Kept &folder : kept) show_again(folder);
  const char *const temporary = getenv("TMPDIR");
  if (temporary != nullptr && is_covered(temporary)) unsetenv("TMPDIR");
}
