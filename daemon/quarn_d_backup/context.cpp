#include <fcntl.h>
#include <sys/stat.h>
#include <sys/types.h>
#include <unistd.h>

#include <algorithm>
#include <condition_variable>
#include <mutex>

#include "quarn_common.h"
#include "quarn_d_backup/run_private.h"
#include "quarn_d_utils/own_file.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_log.h"

namespace {

constexpr char kStagedArchiveDir[] = "/shared/data/";
constexpr char kStagedArchiveSuffix[] = "_upload.zip";
// Begins as the snapshot's name does, with which every walk leaves it out.
constexpr char kAsideDir[] = "/shared/data/quarn_tmp_rst_dir.";
constexpr char kStagingDirectory[] = "/tmp/quarn";
constexpr mode_t kPrivateDirectory = 0700;

std::atomic<std::uint32_t> last_run_id{0};

/** The main thread, waiting in a nested loop. */
struct loop_waiter {
  GMainLoop *loop;
  bool woken;
};

/** Who holds which staged file. */
struct lease_table {
  std::mutex mutex;
  std::condition_variable released;
  std::unordered_map<std::string, backup_context *> holders;
  std::vector<loop_waiter *> waiters;
};

lease_table &leases() {
  // never destroyed: the worker and late callbacks may outlive main()
  static auto *table = new lease_table;
  return *table;
}

bool on_main_thread() { return getpid() == gettid(); }

// A loop that is quit before it runs would run for ever. This comes from the
// main context, so whatever waits there is running by then.
gboolean wake_loop_waiters(gpointer) {
  lease_table &table = leases();
  const std::lock_guard<std::mutex> lock(table.mutex);
  for (loop_waiter *waiter : table.waiters) {
    waiter->woken = true;
    g_main_loop_quit(waiter->loop);
  }
  return G_SOURCE_REMOVE;
}

void wake_waiters(lease_table &table) {
  table.released.notify_all();
  if (!table.waiters.empty()) {
    g_idle_add_full(G_PRIORITY_DEFAULT, wake_loop_waiters, nullptr, nullptr);
  }
}

void release_all_staged_archives(backup_context *ctx) {
  lease_table &table = leases();
  const std::lock_guard<std::mutex> lock(table.mutex);
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

}  // namespace

backup_context::backup_context() : run_id(++last_run_id) {}

backup_context::~backup_context() {
  release_all_staged_archives(this);
  GMainLoop *loop = wait_loop.exchange(nullptr);
  if (loop != nullptr) g_main_loop_unref(loop);
}

BackupContextPtr share_backup_context(backup_context *ctx) {
  ctx->ref();
  return BackupContextPtr(ctx);
}

int backup_context_init(backup_context *ctx) {
  CString model;
  CString serial;
  get_device_info(out(model), out(serial));
  // the serial becomes a folder's name
  if (!model || !serial || !is_safe_path_component(serial.get())) {
    LOGE("cannot get device info");
    ctx->result = QUARN_REFUSED;
    return QUARN_REFUSED;
  }
  ctx->serial_number = serial.get();
  ctx->model_name = model.get();
  return QUARN_OK;
}

bool acquire_staged_archive(backup_context *ctx, const std::string &pkg_id) {
  lease_table &table = leases();
  std::unique_lock<std::mutex> lock(table.mutex);
  for (;;) {
    const auto holder = table.holders.emplace(pkg_id, ctx).first;
    if (holder->second == ctx) return true;
    if (!on_main_thread()) {
      table.released.wait(lock);
      continue;
    }
    const GMainLoopPtr loop(g_main_loop_new(nullptr, FALSE));
    loop_waiter waiter{loop.get(), false};
    table.waiters.push_back(&waiter);
    lock.unlock();
    run_nested_loop(loop.get());
    lock.lock();
    table.waiters.erase(std::find(table.waiters.begin(), table.waiters.end(), &waiter));
    if (!waiter.woken) {
      LOGE("gave up waiting for the archive of (%s)", pkg_id.c_str());
      return false;
    }
  }
}

void release_staged_archive(backup_context *ctx, const std::string &pkg_id) {
  lease_table &table = leases();
  const std::lock_guard<std::mutex> lock(table.mutex);
  const auto holder = table.holders.find(pkg_id);
  if (holder == table.holders.end() || holder->second != ctx) return;
  table.holders.erase(holder);
  wake_waiters(table);
}

bool holds_staged_archive(backup_context *ctx, const std::string &pkg_id) {
  lease_table &table = leases();
  const std::lock_guard<std::mutex> lock(table.mutex);
  const auto holder = table.holders.find(pkg_id);
  return holder != table.holders.end() && holder->second == ctx;
}

std::string staged_archive_path(const std::string &root_path, const std::string &pkg_id) {
  const std::string path = root_path + kStagedArchiveDir + pkg_id + kStagedArchiveSuffix;
  std::string aside = root_path + kAsideDir + pkg_id + kStagedArchiveSuffix;
  struct stat status = {};
  if (safe_lstat(aside.c_str(), &status) == 0 && is_own_file(status)) return aside;
  const bool taken = safe_lstat(path.c_str(), &status) == 0 && !is_own_file(status);
  return taken ? aside : path;
}

void delete_staged_file(const std::string &path) {
  static std::mutex deletion_mutex;
  const std::lock_guard<std::mutex> lock(deletion_mutex);
  struct stat status = {};
  if (safe_lstat(path.c_str(), &status) != 0 || !is_own_file(status)) return;
  if (file_exist(path.c_str())) delete_file(path.c_str());
}

std::uint64_t staged_file_size(const std::string &path) {
  struct stat status = {};
  return safe_lstat(path.c_str(), &status) == 0 ? static_cast<std::uint64_t>(status.st_size) : 0;
}

bool prepare_staging_directory() {
  struct stat status = {};
  const bool made = safe_mkdir_with_parents(kStagingDirectory, kPrivateDirectory) == 0;
  const UniqueFd dir = made ? safe_open(kStagingDirectory, O_RDONLY | O_DIRECTORY) : UniqueFd();
  if (!dir || fstat(dir.get(), &status) != 0 || status.st_uid != geteuid()) {
    LOGE("cannot use staging directory %s", kStagingDirectory);
    return false;
  }
  if ((status.st_mode & (S_IRWXG | S_IRWXO)) != 0 && fchmod(dir.get(), kPrivateDirectory) != 0) {
    LOGE("cannot use staging directory %s", kStagingDirectory);
    return false;
  }
  return true;
}
