#include "quarn_d_backup/staged_archive.h"

#include <glib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <unordered_map>
#include <vector>

#include "files/safe_path.h"
#include "glib_handles.h"
#include "quarn_d_backup/pipeline.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"
#include "thread_annotations.h"

namespace {

/** How long a run that waits for a lease does not look at cancel and Wi-Fi. */
constexpr std::chrono::milliseconds kLookInterval{100};

/** A request on the main thread that waits. */
struct loop_waiter {
  GMainLoop *loop;
  bool woken;
};

/** Who holds which staged file. */
struct lease_table {
  Mutex mutex;
  std::condition_variable released;
  std::unordered_map<std::string, backup_context *> holders QUARN_GUARDED_BY(mutex);
  std::vector<loop_waiter *> waiters QUARN_GUARDED_BY(mutex);
};

lease_table &leases() {
  // never destroyed: the worker and late callbacks may outlive main()
  static auto *table = new lease_table;
  return *table;
}

bool on_main_thread() { return getpid() == gettid(); }

void wake_waiters(lease_table &table) QUARN_REQUIRES(table.mutex) {
  table.released.notify_all();
  for (loop_waiter *waiter : table.waiters) {
    waiter->woken = true;
    g_main_loop_quit(waiter->loop);
  }
}

/** @return false when nobody wants the lease any more */
bool wait_in_loop(lease_table &table, MutexLock &lock) QUARN_REQUIRES(table.mutex) {
  const GMainLoopPtr loop(new_wait_loop());
  loop_waiter waiter{loop.get(), false};
  table.waiters.push_back(&waiter);
  lock.waiting().unlock();
  run_nested_loop(loop.get());
  lock.waiting().lock();
  table.waiters.erase(std::find(table.waiters.begin(), table.waiters.end(), &waiter));
  return waiter.woken;
}

/** The same for the worker's run. */
bool wait_in_run(backup_context *ctx, lease_table &table, MutexLock &lock)
    QUARN_REQUIRES(table.mutex) {
  table.released.wait_for(lock.waiting(), kLookInterval);
  lock.waiting().unlock();
  const bool stop = backup_must_stop(ctx);
  lock.waiting().lock();
  return !stop;
}

/** One package is packed at a time, and an export may take as long as it has data. */
bool must_wait_for_packing(const std::string &pkg_id) {
  return pkg_id != kStagedListLease && any_package_is_packed();
}

}  // namespace

void note_packing_ended() {
  lease_table &table = leases();
  const MutexLock lock(table.mutex);
  wake_waiters(table);
}

bool acquire_staged_archive(backup_context *ctx, const std::string &pkg_id) {
  lease_table &table = leases();
  MutexLock lock(table.mutex);
  for (;;) {
    const bool held = table.holders.emplace(pkg_id, ctx).first->second == ctx;
    if (held && !must_wait_for_packing(pkg_id)) return true;
    const bool goes_on =
        on_main_thread() ? wait_in_loop(table, lock) : wait_in_run(ctx, table, lock);
    if (goes_on) continue;
    LOGE("gave up waiting for the archive of (%s)", pkg_id.c_str());
    if (held) {
      table.holders.erase(pkg_id);
      wake_waiters(table);
    }
    return false;
  }
}

void release_staged_archive(backup_context *ctx, const std::string &pkg_id) {
  lease_table &table = leases();
  const MutexLock lock(table.mutex);
  const auto holder = table.holders.find(pkg_id);
  if (holder == table.holders.end() || holder->second != ctx) return;
  table.holders.erase(holder);
  wake_waiters(table);
}

bool holds_staged_archive(backup_context *ctx, const std::string &pkg_id) {
  lease_table &table = leases();
  const MutexLock lock(table.mutex);
  const auto holder = table.holders.find(pkg_id);
  return holder != table.holders.end() && holder->second == ctx;
}

void release_all_staged_archives(backup_context *ctx) {
  lease_table &table = leases();
  const MutexLock lock(table.mutex);
  bool any = false;
  for (auto it = table.holders.begin(); it != table.holders.end();) {
    if (it->second == ctx) {
      it = table.holders.erase(it);
      any = true;
    } else {
      ++it;
    }
  }
  if (any) wake_waiters(table);
}

std::string staged_archive_path(const std::string &root_path, const std::string &pkg_id) {
  const WorkingFiles files(pkg_id, root_path);
  struct stat status = {};
  if (safe_lstat(files.upload_aside().c_str(), &status) == 0 && is_own_file(status)) {
    return files.upload_aside();
  }
  const bool taken = safe_lstat(files.upload().c_str(), &status) == 0 && !is_own_file(status);
  return taken ? files.upload_aside() : files.upload();
}

void delete_staged_file(const std::string &path) {
  static Mutex deletion_mutex;
  const MutexLock lock(deletion_mutex);
  struct stat status = {};
  if (safe_lstat(path.c_str(), &status) != 0 || !is_own_file(status)) return;
  if (file_exist(path.c_str()) && delete_file(path.c_str())) forget_working_file(path);
}

std::uint64_t staged_file_size(const std::string &path) {
  struct stat status = {};
  return safe_lstat(path.c_str(), &status) == 0 ? static_cast<std::uint64_t>(status.st_size) : 0;
}
