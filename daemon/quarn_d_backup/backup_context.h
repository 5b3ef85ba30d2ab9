/**
 * @file backup_context.h
 * @brief The state of a run: for the sources of the backup engine, and its tests.
 */
#ifndef QUARN_D_BACKUP_CONTEXT_H
#define QUARN_D_BACKUP_CONTEXT_H

#include <glib.h>
#include <json-c/json.h>

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>
#include <vector>

#include "json_ptr.h"
#include "quarn_d_backup/backup_context_ptr.h"
#include "quarn_d_utils/handles.h"

struct client_cb_data;

/** One package entry of a run. */
struct pkg_information {
  std::string serial;
  std::string pkg_id;
  std::string version;
  std::string root_path;
  std::int32_t crc = 0;
};

/**
 * The state of one run. Shared: the run and each outstanding transport request
 * hold a reference, so an abandoned run lives until its last callback. Atomic
 * members are written by callbacks on the main thread and polled by the worker;
 * the others belong to the thread that runs the backup.
 */
struct backup_context {
  std::atomic<std::int32_t> result{0};
  std::atomic<bool> app_list_checked{false};
  std::atomic<bool> app_list_downloading{false};
  std::atomic<bool> abandoned{false};
  /** Of a manual run until its final status is sent, which deletes it; else null. */
  std::unique_ptr<client_cb_data> client;
  std::atomic<bool> finished{false};
  bool is_manual = false;
  bool for_pellix = false;
  bool single_package = false;
  /**
   * Where a single-package requester waits. The callback that brings
   * upload_remain to 0 takes the loop out, quits it and drops one reference:
   * the waiting side keeps another.
   */
  std::atomic<GMainLoop *> wait_loop{nullptr};
  std::vector<pkg_information> current_pkg_list;
  std::string serial_number;
  std::string model_name;
  std::atomic<std::int32_t> upload_remain{0};
  std::atomic<bool> app_list_uploading{false};
  std::vector<pkg_information> upload_list;
  CString cloud_app_list_text; /**< written by the download's callback, then the run's */
  std::vector<pkg_information> previous_pkg_list;
  JsonPtr app_list_root;             /**< the document; owns those below */
  json_object *model_list = nullptr; /**< borrowed, as the rest of them */
  json_object *model_entry = nullptr;
  json_object *backup_info = nullptr;
  json_object *pkg_list = nullptr;
  json_object *app_data_path = nullptr;
  std::vector<json_object *> json_objects; /**< all made for the document, borrowed */
  std::atomic<std::int32_t> cleanup_result{0};
  std::atomic<std::int32_t> serial_clean_pending{0};
  std::atomic<std::int32_t> pkg_delete_pending{0};
  std::atomic<std::int32_t> version_list_pending{0};
  std::atomic<std::int32_t> version_delete_pending{0};
  bool zip_made = false;
  std::string cur_pkg_id;
  std::string cur_version;
  std::string cur_pkg_type;
  std::string cur_root_path;
  bool cur_backup_enabled = true;
  std::int32_t cur_crc = 0;

  bool cancel_noted = false; /**< the log tells of the cancel */
  /** The cloud's list is of a form that is not understood: it is left as it is. */
  bool keep_cloud_list = false;
  /** Every installed package was seen; what was not seen is not cleaned up. */
  bool package_walk_complete = true;
  /** Packages that are installed but could not be examined: their archives stay. */
  std::vector<std::string> unexamined_pkg_ids;
  /** crc of previous_pkg_list by id and version, as far as it was indexed. */
  std::unordered_map<std::string, std::int32_t> previous_crc_index;
  std::size_t previous_crc_indexed = 0;
  /** Entries of upload_list whose upload was requested; the rest is the run's to delete. */
  std::size_t uploads_requested = 0;

  /** What the run finds out on its way; run_notes.h. */
  const std::shared_ptr<struct run_notes> notes;

  const std::uint32_t run_id; /**< tells runs apart in progress reports */
  std::int32_t packages_examined = 0;
  std::atomic<std::int32_t> uploads_answered{0};
  std::atomic<std::int32_t> uploads_total{0};
  std::atomic<std::uint64_t> bytes_uploaded{0};
  std::atomic<std::uint64_t> bytes_to_upload{0};

  backup_context();
  backup_context(const backup_context &) = delete;
  backup_context &operator=(const backup_context &) = delete;

  /** Reference counting; created with one reference. */
  void ref() { references.fetch_add(1, std::memory_order_relaxed); }
  void unref() {
    if (references.fetch_sub(1, std::memory_order_acq_rel) == 1) delete this;
  }

 private:
  ~backup_context();
  std::atomic<int> references{1};
};

/** A further reference, for a record that outlives its call. */
[[nodiscard]] BackupContextPtr share_backup_context(backup_context *ctx);
/** Fill in serial and model. @return QUARN_OK or QUARN_REFUSED, which is the run's result then */
[[nodiscard]] int backup_context_init(backup_context *ctx);
/** The first failure stays: a cancelled run's late answers do not change its result. Any thread. */
void set_result_once(backup_context *ctx, std::int32_t code);

#endif
