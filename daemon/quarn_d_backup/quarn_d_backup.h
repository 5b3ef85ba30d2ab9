/**
 * @file quarn_d_backup.h
 * @brief The backup engine: requests, runs, the application list, the cloud.
 */
#ifndef QUARN_D_BACKUP_H
#define QUARN_D_BACKUP_H

#include <glib.h>
#include <json-c/json.h>

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "platform_package_manager.h"
#include "quarn_d_utils/handles.h"

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
  void *client = nullptr; /**< client_cb_data of a manual run, null for an automatic one */
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

  bool cancel_noted = false;    /**< the log tells of the cancel */
  bool first_app_taken = false; /**< single-package runs: the first application was taken */
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

/** Releases one reference. */
struct backup_context_unref {
  void operator()(backup_context *ctx) const { ctx->unref(); }
};
using BackupContextPtr = std::unique_ptr<backup_context, backup_context_unref>;

/* ---- progress.cpp ---------------------------------------------------------- */

/** What a run is doing. */
enum class backup_stage { checking, archiving, uploading, listing, cleaning, finished };

/** What became of a package; none while it is not settled. */
enum class backup_outcome {
  none,
  uploaded,
  unchanged,       /**< the cloud has this archive already */
  external,        /**< its data lies on external storage */
  too_large,       /**< size is over limit, the cap */
  no_space,        /**< size is over limit, the free space */
  disabled,        /**< an application of it opted out */
  removed,         /**< it was removed while the run went */
  too_deep,        /**< its folders are nested deeper than what is packed */
  unreadable,      /**< its data could not be read or packed whole */
  restoring,       /**< a restore is to have its archive in the cloud */
  unusable_rules,  /**< what its rules file says cannot be known */
  too_many_files,  /**< files, directories and links: size is over limit, the bound */
  names_too_long,  /**< all names together, bytes: size is over limit, the bound */
  table_too_large, /**< the archive's file-info table, bytes: size is over limit, the bound */
  upload_failed
};

/** One step of a run; valid during the call only. */
struct backup_progress {
  std::uint32_t run = 0;
  backup_stage stage = backup_stage::checking;
  const char *package = ""; /**< package id, empty for the run as a whole */
  backup_outcome outcome = backup_outcome::none;
  std::int32_t index = 0; /**< packages done in this stage, this one included */
  std::int32_t count = 0; /**< packages in this stage, 0 while unknown */
  std::uint64_t bytes_done = 0;
  std::uint64_t bytes_total = 0;
  std::uint64_t size = 0;    /**< bytes: of data for too_large and no_space, else of the archive */
  std::uint64_t limit = 0;   /**< what it exceeded */
  std::int32_t result = 0;   /**< result of the run, for finished */
  const char *cause = "";    /**< a word for what it failed of, for finished; may be empty */
  bool list_written = false; /**< the run's list stands in the cloud, for finished */
  const char *notice = "";   /**< a word for something that is to be seen to; empty as a rule */
};
using backup_progress_sink = void (*)(const backup_progress &progress);

/**
 * Follow what runs do. The sink is called on the worker, or on the main thread
 * from the transport's callbacks, and must not block; null ends it.
 */
void set_backup_progress_sink(backup_progress_sink sink);

/* ---- dispatch.cpp ----------------------------------------------------------- */

using backup_end_observer = void (*)();
/** Follow the ends of requests: called on the worker when nothing of one is left; null ends it. */
void set_backup_end_observer(backup_end_observer observer);

/**
 * A manual backup was cancelled; cleared by the next manual request. A run that
 * stood when the cancel came stays cancelled.
 */
extern std::atomic<bool> manual_backup_canceled;
/** The worker runs a request. */
extern std::atomic<bool> g_is_backing_up;

/** Start the worker; once, on the main thread. */
void init_backup_req_dispatch_thread();
/** Queue a request; null is an automatic backup, of which one at a time is enough. Any thread. */
void request_backup(void *client);
/**
 * Abort transfers and drop every queued manual request. Each dropped client is
 * sent the final status cancelled, by the worker. Any thread.
 */
void cancel_backup(void *client);
/** True from request_backup() until the worker has finished everything queued. */
bool backup_request_outstanding();

/* ---- context.cpp ------------------------------------------------------------ */

/** Fill in serial and model. @return 0 or 36 */
int backup_context_init(backup_context *ctx);

/**
 * The right to write, upload and delete a package's staged archive. One run
 * holds it at a time, from the archive's making to the answer of its upload;
 * a run that has it already is given it again. Waiting for it: other threads
 * block, the main thread runs a nested loop.
 * @return false when the wait was ended: by the end of the process, the
 *         withdrawal of the request, or for a run by its cancel or the loss of
 *         Wi-Fi, which has abandoned it then
 */
bool acquire_staged_archive(backup_context *ctx, const std::string &pkg_id);
/** Give it back; nothing happens when @p ctx does not hold it. Any thread. */
void release_staged_archive(backup_context *ctx, const std::string &pkg_id);

/** Make the directory of staged lists, whatever lies there; false when it cannot be had. */
bool prepare_staging_directory();
/** Remove what an ended process has left there, all but @p keep. Before anything is staged. */
void sweep_staging_directory(const char *keep);

/* ---- pipeline.cpp: worker --------------------------------------------------- */

/** One complete run. */
void do_backup(bool is_manual, void *client);
/** Report the outcome and delete staged files. */
void finish_backup(backup_context *ctx);
/** Delete the staged archives and list that are the run's. */
void delete_backup_items(backup_context *ctx);

/* ---- app_list.cpp ------------------------------------------------------------ */

/** Start the run's document from the cloud's list. @return false when it could not be made */
bool create_app_list_info(backup_context *ctx);
/**
 * Make the document from cloud_app_list_text. Other devices' entries are kept
 * as they were written, whatever they hold. Without a document afterwards the
 * text was unusable; keep_cloud_list tells that it must not be replaced.
 * @return 0
 */
int rebase_app_list_info(backup_context *ctx, const char *model_name, const char *serial);
/** Take over the entries of this device's last list, texts; those not understood are left out. */
void get_previous_package_list_info(backup_context *ctx,
                                    const std::vector<std::string_view> &packages);
/** Add one package to the document, when there is one. */
void add_pkg_info_to_app_list(backup_context *ctx, const char *pkg_id, const char *version,
                              int crc);
/** Write the document and release it. @return true when the file was written */
bool save_app_list_to_file(backup_context *ctx);
/** Release the document and the cloud's text. */
void release_json_resource_of_app_list(backup_context *ctx);
/** The maker is the caller until the object is added to the document. */
json_object *generate_new_json_object(backup_context *ctx);
json_object *generate_new_json_array(backup_context *ctx);
/** Parse a whole text; null when it is not one JSON value or is nested too deeply. */
json_object *generate_new_json_tokener_parser(backup_context *ctx, const char *text);

/* ---- cloud.cpp ---------------------------------------------------------------- */

/** Request the list's download. @return 0 when app_list_downloading will be cleared, else 13 */
int get_app_list_from_cloud(backup_context *ctx);
/**
 * Download the list and wait for it. Any thread, also beside a run.
 * @param[out] text malloc'd and the caller's; null unless 0 is returned
 * @return 0, 12 when there is none, another transport error, or 13 when it could not be read
 */
int download_app_list_info_from_cloud(char **text);
/** Upload a staged archive; refused, result is 12 and the archive is gone. */
void upload_app_data(backup_context *ctx, const char *pkg_id, const char *root_path,
                     const char *version);
/** Upload the staged list. @return 1 */
int upload_app_list(backup_context *ctx);
/** Delete the folders of packages that the list does not name. */
void delete_other_backup_items_in_cloud(backup_context *ctx);
/** Delete the other versions of every package that was uploaded. */
void delete_other_pkg_version_in_cloud(backup_context *ctx);
void delete_other_version_in_cloud(backup_context *ctx, const std::string &serial,
                                   const std::string &pkg_id, const std::string &version);

/* ---- changes.cpp --------------------------------------------------------------- */

/** Examine every package, archive what changed, write the list. @return 0 or 42 */
int make_backup_items(backup_context *ctx);
/** One package of that walk. @return true */
bool foreach_package_info_callback(package_info_h info, void *ctx);
/** Archive the package on its first application. @return true */
bool app_info_foreach_cb(package_info_app_component_type_e type, const char *app_id, void *ctx);
/** Clear cur_backup_enabled when the application opted out. @return true */
bool check_backup_enabled(package_info_app_component_type_e type, const char *app_id, void *ctx);
/**
 * Archive the current package. The staged archive is the run's from here to
 * the answer of its upload; when the result is not 0 it is gone already.
 * @return 0, 32 unchanged, 34 skipped, 31 or 36
 */
int make_app_data_zip(backup_context *ctx, const char *app_id);
/** Bytes of the current package's data by the calling thread's rules. */
std::uint64_t get_app_backup_size(backup_context *ctx);
/** crc of the current package and version in the last list, 0 when unknown. */
int get_previous_crc_value(backup_context *ctx);
/** Queue the current package's archive for upload. */
void add_to_app_data_upload_list(backup_context *ctx);

/* ---- pellix.cpp: main thread ----------------------------------------------------- */

/** Build the companion's list and archives. @return malloc'd text, null on failure */
char *get_app_list_for_pellix();
bool pellix_app_info_foreach_cb(package_info_app_component_type_e type, const char *app_id,
                                void *ctx);

/* ---- last_time.cpp: any thread ---------------------------------------------------- */

/** Store 0: never backed up. */
void init_last_backup_time();
/** Store the present time. */
void set_last_backup_time();
/** The stored time, milliseconds since the Unix epoch, without a log line; false: unreadable. */
bool read_last_backup_time(std::uint64_t *time);
/** The stored time, milliseconds since the Unix epoch; all ones when it cannot be read. */
std::uint64_t get_last_backup_time();

#endif
