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
#include <vector>

#include "platform_package_manager.h"

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
 * members are written by callbacks on the main thread and polled by the worker.
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
  std::atomic<GMainLoop *> wait_loop{nullptr};
  std::vector<pkg_information> current_pkg_list;
  std::string serial_number;
  std::string model_name;
  std::atomic<std::int32_t> upload_remain{0};
  std::atomic<bool> app_list_uploading{false};
  std::vector<pkg_information> upload_list;
  char *cloud_app_list_text = nullptr; /**< malloc'd */
  std::vector<pkg_information> previous_pkg_list;
  json_object *app_list_root = nullptr; /**< the document; owns those below */
  json_object *model_list = nullptr;
  json_object *model_entry = nullptr;
  json_object *backup_info = nullptr;
  json_object *pkg_list = nullptr;
  json_object *app_data_path = nullptr;
  std::vector<json_object *> json_objects;
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
  bool first_app_taken = false; /**< single-package runs: the first application was taken */

  backup_context() = default;
  backup_context(const backup_context &) = delete;
  backup_context &operator=(const backup_context &) = delete;
  ~backup_context();

  /** Reference counting; created with one reference. */
  void ref() { references.fetch_add(1, std::memory_order_relaxed); }
  void unref() {
    if (references.fetch_sub(1, std::memory_order_acq_rel) == 1) delete this;
  }
  std::atomic<int> references{1};
};

/** Releases one reference. */
struct backup_context_unref {
  void operator()(backup_context *ctx) const { ctx->unref(); }
};
using BackupContextPtr = std::unique_ptr<backup_context, backup_context_unref>;

/* ---- dispatch.cpp ---------------------------------------------------------- */

/** A manual backup was cancelled; cleared by the next manual request. */
extern std::atomic<bool> manual_backup_canceled;
/** The worker runs a request. */
extern std::atomic<bool> g_is_backing_up;

/** Start the worker; once, on the main thread. */
void init_backup_req_dispatch_thread();
/** Queue a request; null is an automatic backup. Any thread. */
void request_backup(void *client);
/** Abort transfers and drop every queued manual request. */
void cancel_backup(void *client);
/** True from request_backup() until the worker has finished everything queued. */
bool backup_request_outstanding();
/** How the engine asks for Wi-Fi; set once at start. */
void set_backup_wifi_probe(int (*probe)());
/** Whether the device is on Wi-Fi, by the probe. */
int backup_wifi_connected();

/* ---- context.cpp ------------------------------------------------------------ */

/** Fill in serial and model. @return 0 or 36 */
int backup_context_init(backup_context *ctx);

/**
 * The right to write, upload and delete a package's staged archive. One run
 * holds it at a time, from the archive's making to the answer of its upload.
 * Waiting for it: other threads block, the main thread runs a nested loop.
 */
void acquire_staged_archive(backup_context *ctx, const std::string &pkg_id);
/** Give it back; nothing happens when @p ctx does not hold it. Any thread. */
void release_staged_archive(backup_context *ctx, const std::string &pkg_id);

/* ---- pipeline.cpp: worker --------------------------------------------------- */

/** One complete run. */
void do_backup(bool is_manual, void *client);
/** Report the outcome and delete staged files. */
void finish_backup(backup_context *ctx);
/** Delete the staged archives and list of a run. */
void delete_backup_items(backup_context *ctx);

/* ---- app_list.cpp ------------------------------------------------------------ */

bool create_app_list_info(backup_context *ctx);
int rebase_app_list_info(backup_context *ctx, const char *model_name, const char *serial);
void get_previous_package_list_info(backup_context *ctx, json_object *pkg_list);
void add_pkg_info_to_app_list(backup_context *ctx, const char *pkg_id, const char *version,
                              int crc);
/** Write the document and release it. @return true when the file was written */
bool save_app_list_to_file(backup_context *ctx);
void release_json_resource_of_app_list(backup_context *ctx);
json_object *generate_new_json_object(backup_context *ctx);
json_object *generate_new_json_array(backup_context *ctx);
json_object *generate_new_json_tokener_parser(backup_context *ctx, const char *text);

/* ---- cloud.cpp ---------------------------------------------------------------- */

int get_app_list_from_cloud(backup_context *ctx);
/** Synchronous; @p text is malloc'd and the caller's. */
int download_app_list_info_from_cloud(char **text);
void upload_app_data(backup_context *ctx, const char *pkg_id, const char *root_path,
                     const char *version);
int upload_app_list(backup_context *ctx);
void delete_other_backup_items_in_cloud(backup_context *ctx);
void delete_other_pkg_version_in_cloud(backup_context *ctx);
void delete_other_version_in_cloud(backup_context *ctx, std::string serial, std::string pkg_id,
                                   std::string version);

/* ---- changes.cpp --------------------------------------------------------------- */

int make_backup_items(backup_context *ctx);
bool foreach_package_info_callback(package_info_h info, void *ctx);
bool app_info_foreach_cb(package_info_app_component_type_e type, const char *app_id, void *ctx);
bool check_backup_enabled(package_info_app_component_type_e type, const char *app_id, void *ctx);
int make_app_data_zip(backup_context *ctx, const char *app_id);
std::uint64_t get_app_backup_size(backup_context *ctx);
int get_previous_crc_value(backup_context *ctx);
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
/** The stored time, milliseconds since the Unix epoch; all ones when it cannot be read. */
std::uint64_t get_last_backup_time();

#endif
