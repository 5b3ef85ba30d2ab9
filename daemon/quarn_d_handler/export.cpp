#include <glib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <memory>
#include <string>
#include <system_error>
#include <thread>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "glib_handles.h"
#include "platform_smack.h"
#include "quarn_common.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_handler/export_turn.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/directory.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/own_place.h"
#include "quarn_d_utils/package.h"
#include "quarn_d_utils/path_rules.h"
#include "quarn_d_utils/power.h"
#include "quarn_d_utils/zip_archive.h"
#include "quarn_log.h"

namespace {

constexpr char kStagingTemplate[] = "/tmp/quarn/export_XXXXXX";
constexpr char kStagedName[] = "/export.zip";
constexpr mode_t kExportMode = 0600;

/** A folder that nobody else can put anything into; removed with what is left in it. */
class StagingDir {
 public:
  StagingDir() : path_(kStagingTemplate) {
    if (!prepare_staging_directory() || mkdtemp(path_.data()) == nullptr) path_.clear();
  }
  ~StagingDir() {
    if (!path_.empty()) clear_directory(path_.c_str(), true);
  }
  StagingDir(const StagingDir &) = delete;
  StagingDir &operator=(const StagingDir &) = delete;
  const std::string &path() const { return path_; }

 private:
  std::string path_;
};

/** Who the archive is for. */
struct export_client {
  uid_t uid;
  std::string label;
};

/** Set the client's label where it has one: those who share its user are not to read the data. */
bool label_for(const export_client &client, int file) {
  if (client.label.empty()) return true;
  if (smack_setlabel(own_fd_path(file).c_str(), client.label.c_str(), SMACK_LABEL_ACCESS) == 0) {
    return true;
  }
  LOGE("smack_setlabel failed for the export of (%s)", client.label.c_str());
  return false;
}

/**
 * Give the archive to the client under its public name, whatever lies there.
 * @param file the archive, as it was made
 */
bool hand_over(int file, const std::string &archive, const std::string &target,
               const export_client &client) {
  return label_for(client, file) && fchmod(file, kExportMode) == 0 &&
         fchown(file, client.uid, static_cast<gid_t>(-1)) == 0 &&
         move_to_own_place(archive, target);
}

/** What the thread that packs and the request that waits for it share. */
struct ExportJob {
  GMainLoopPtr loop;
  ExportTurn *turn = nullptr; /**< of the request; null when that has gone on */
  std::atomic<bool> unwanted{false};
  bool packed = false; /**< of the main thread */
  int result = QUARN_OK;
  UniqueFd archive;
};
using ExportJobPtr = std::shared_ptr<ExportJob>;

gboolean wake(gpointer data) {
  const auto &job = *static_cast<ExportJobPtr *>(data);
  job->packed = true;
  // Not when the request goes on: without a stack of its own it may have to wait for the next one.
  if (job->turn != nullptr) job->turn->end();
  g_main_loop_quit(job->loop.get());
  return G_SOURCE_REMOVE;
}

void drop_reference(gpointer data) { delete static_cast<ExportJobPtr *>(data); }

/**
 * Pack beside the main loop: an export may have any size, and others are served meanwhile.
 * @param[out] made the archive, none where none was begun
 * @return what packing gave, 17 when the export is not wanted any more, or 42 without a thread
 */
int pack(const std::string &pkg_id, const std::string &root, const std::string &archive,
         ExportTurn *turn, UniqueFd *made) {
  const auto job = std::make_shared<ExportJob>();
  job->loop.reset(new_wait_loop());
  job->turn = turn;
  std::thread worker;
  try {
    worker = std::thread([job, pkg_id, root, archive] {
      job->archive = make_archive(pkg_id.c_str(), root.c_str(), archive.c_str(), &job->result,
                                  kNoBounds, nullptr, &job->unwanted);
      g_idle_add_full(G_PRIORITY_DEFAULT, wake, new ExportJobPtr(job), drop_reference);
    });
  } catch (const std::system_error &error) {
    LOGE("no thread to pack (%s) in : %s", pkg_id.c_str(), error.what());
    return QUARN_FAILED;
  }
  run_nested_loop(job->loop.get());
  job->unwanted = true;
  worker.join();
  job->turn = nullptr;
  if (!job->packed) return QUARN_CANCELLED;
  *made = std::move(job->archive);
  return job->result;
}

/** Everything between an earlier export's removal and the answer. */
int export_package(const std::string &pkg_id, const std::string &root, const std::string &target,
                   const export_client &client) {
  ExportTurn turn(std::to_string(client.uid) + " " + pkg_id);
  if (!turn.wait()) return QUARN_CANCELLED;
  const StagingDir staging;
  if (staging.path().empty()) return QUARN_UNREADABLE;
  const std::string archive = staging.path() + kStagedName;
  UniqueFd made;
  const int result = pack(pkg_id, root, archive, &turn, &made);
  // one that lacks a file is told to be such, and is the client's as well
  const bool whole = result == QUARN_OK || result == QUARN_REFUSED;
  if (made && whole && !hand_over(made.get(), archive, target, client)) {
    LOGE("fail to hand over %s : %d", target.c_str(), errno);
    return QUARN_UNREADABLE;
  }
  return result;
}

}  // namespace

int quarnd_make_app_data(const char *pkg_id, unsigned int client_uid,
                         const std::string &client_label) {
  if (pkg_id == nullptr || !is_safe_path_component(pkg_id)) {
    LOGE("cannot get root path info of (%s)...", pkg_id == nullptr ? "" : pkg_id);
    return QUARN_REFUSED;
  }
  const std::string target = exported_archive(pkg_id);
  if (file_exist(target.c_str())) delete_file(target.c_str());
  std::string root;
  if (get_string_app_root_path(pkg_id, root) != QUARN_OK) {
    LOGE("cannot get root path info of (%s)...", pkg_id);
    return QUARN_REFUSED;
  }
  reset_backup_path_info();
  request_power_lock(true);  // the daemon is not idle before that has ended
  const int zip_result = export_package(pkg_id, root, target, {client_uid, client_label});
  request_power_lock(false);
  LOGI("quarnd_make_app_data zip_result = %d", zip_result);
  return zip_result;
}
