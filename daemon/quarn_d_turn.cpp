#include "quarn_d_turn.h"

#include <fcntl.h>
#include <glib.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <csignal>
#include <cstring>
#include <string>

#include "detached_thread.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"
#include "thread_annotations.h"

namespace {

constexpr mode_t kLockMode = 0600;
constexpr std::size_t kWaiterStackSize = 131072;
constexpr std::size_t kReadSize = 4096;

// Never destroyed: threads wait here when the process ends. `turn` is read without the mutex, and
// comes under it, so that who waits for the change misses none.
Mutex &turn_mutex = *new Mutex;
std::condition_variable &turn_changed = *new std::condition_variable;
std::atomic<bool> turn{true};
const char *lock_path = nullptr;
bool (*prepare_folder)() = nullptr;
// Not closed when it is replaced: another thread may be looking at it.
std::atomic<int> lock_fd{-1};
/** How far the lines in the lock's file have been read. */
std::atomic<off_t> lines_taken{0};
void (*turn_observer)() = nullptr;

/** A record lock: it belongs to the process, goes with it, and tells who holds it. */
struct flock whole_file() {
  struct flock lock {};
  lock.l_type = F_WRLCK;
  lock.l_whence = SEEK_SET;
  return lock;
}

pid_t holder() {
  struct flock lock = whole_file();
  if (fcntl(lock_fd, F_GETLK, &lock) != 0 || lock.l_type == F_UNLCK) return 0;
  return lock.l_pid;
}

gboolean tell_observer(gpointer) {
  if (turn_observer != nullptr) turn_observer();
  return G_SOURCE_REMOVE;
}

void take_turn() {
  {
    const MutexLock lock(turn_mutex);
    turn = true;
  }
  turn_changed.notify_all();
  g_idle_add_full(G_PRIORITY_DEFAULT, tell_observer, nullptr, nullptr);
}

/** What anybody else could open, by this name or another, they could hold the lock of. */
bool is_ours_alone(int fd) {
  struct stat status {};
  return fstat(fd, &status) == 0 && S_ISREG(status.st_mode) && status.st_uid == geteuid() &&
         status.st_nlink <= 1 && (status.st_mode & (S_IRWXG | S_IRWXO)) == 0;
}

/** Remove a thing of any kind; a directory that is not empty stays. */
bool make_way(const char *path) {
  return unlink(path) == 0 || (errno == EISDIR && rmdir(path) == 0) || errno == ENOENT;
}

bool open_lock() {
  constexpr int kAttempts = 5;  // the folder may be removed by the earlier process meanwhile
  for (int attempt = 0; attempt < kAttempts; ++attempt) {
    if (prepare_folder != nullptr && !prepare_folder()) return false;
    const int fd = open(
        lock_path, O_RDWR | O_APPEND | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, kLockMode);
    if (fd >= 0 && is_ours_alone(fd)) {
      lock_fd = fd;
      // Older lines were for others.
      lines_taken = std::max<off_t>(lseek(lock_fd, 0, SEEK_END), 0);
      return true;
    }
    const int error = errno;
    if (fd >= 0) close(fd);
    if (fd < 0 && error == ENOENT) continue;
    // What lies there is not the daemon's, who is alone in its folder.
    if ((fd < 0 && error != ELOOP && error != EISDIR && error != ENXIO) || !make_way(lock_path)) {
      errno = error;
      break;
    }
  }
  LOGE("cannot open %s : %d", lock_path, errno);
  return false;
}

/** False for a lock that the earlier process has removed: others lock another file by now. */
bool is_in_place() {
  struct stat status {};
  return fstat(lock_fd, &status) == 0 && status.st_nlink > 0;
}

enum class Lock { kHeld, kBusy, kFailed };

/** @p how is F_SETLK or F_SETLKW. */
Lock take_lock(int how) {
  do {
    if (!open_lock()) return Lock::kFailed;
    struct flock lock = whole_file();
    int result = 0;
    while ((result = fcntl(lock_fd, how, &lock)) != 0 && errno == EINTR) {
    }
    if (result != 0 && (errno == EACCES || errno == EAGAIN)) return Lock::kBusy;
    if (result != 0) {
      LOGE("cannot lock %s : %d", lock_path, errno);
      return Lock::kFailed;
    }
  } while (!is_in_place());
  return Lock::kHeld;
}

void *wait_for_lock(void *) {
  take_lock(F_SETLKW);
  take_turn();
  return nullptr;
}

bool start_waiter() {
  const int error = start_detached_thread(kWaiterStackSize, wait_for_lock, nullptr);
  if (error != 0) LOGE("pthread_create() failed : %d", error);
  return error == 0;
}

}  // namespace

void begin_quarn_turn(const char *lock_file, bool (*prepare)(), void (*on_turn)()) {
  lock_path = lock_file;
  prepare_folder = prepare;
  turn_observer = on_turn;
  if (take_lock(F_SETLK) != Lock::kBusy) return;
  LOGI("an earlier process still works");
  turn = false;
  if (!start_waiter()) take_turn();
}

void end_quarn_turn() {
  if (!turn || lock_fd < 0) return;
  unlink(lock_path);
  // Stays when anything else lies there.
  const std::string folder(lock_path, std::strrchr(lock_path, '/'));
  rmdir(folder.c_str());
}

bool is_quarn_turn() { return turn; }

bool wait_for_quarn_turn(int ms) {
  MutexLock lock(turn_mutex);
  return turn_changed.wait_for(lock.waiting(), std::chrono::milliseconds(ms),
                               [] { return turn.load(); });
}

bool tell_quarn_predecessor(const std::string &line, int signo) {
  if (turn || lock_fd < 0) return false;
  const std::string text = line + "\n";
  if (write(lock_fd, text.data(), text.size()) != static_cast<ssize_t>(text.size())) {
    LOGE("cannot tell the earlier process : %d", errno);
    return false;
  }
  return signal_quarn_predecessor(signo);
}

std::vector<std::string> take_quarn_turn_lines() {
  std::vector<std::string> lines;
  std::string text;
  char buffer[kReadSize];
  ssize_t count = 0;
  while (lock_fd >= 0 && (count = pread(lock_fd, buffer, sizeof buffer, lines_taken)) > 0) {
    text.append(buffer, static_cast<std::size_t>(count));
    lines_taken += count;
  }
  std::size_t begin = 0;
  for (std::size_t end; (end = text.find('\n', begin)) != std::string::npos; begin = end + 1) {
    lines.push_back(text.substr(begin, end - begin));
  }
  return lines;
}

bool signal_quarn_predecessor(int signo) {
  if (turn || lock_fd < 0) return false;
  const pid_t process = holder();
  if (process <= 0) return false;
  const UniqueFd handle(static_cast<int>(syscall(SYS_pidfd_open, process, 0)));
  // Looked at again: what was opened may be a later process of that number.
  if (!handle || holder() != process) return false;
  return syscall(SYS_pidfd_send_signal, handle.get(), signo, nullptr, 0) == 0;
}
