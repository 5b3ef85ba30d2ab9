/**
 * @file quarn_d_restore.h
 * @brief The restore engine. Main thread only.
 */
#ifndef QUARN_D_RESTORE_H
#define QUARN_D_RESTORE_H

#include <glib.h>

#include <cstdint>
#include <string>
#include <vector>

#include "quarn_common.h"
#include "quarn_d_backup/archive_hold.h"

/** The state of one package's restore; freed by the engine or by the waiting request. */
struct pkg_restore_context {
  int result = 0;
  std::string serial;
  int reserved = 0;
  bool wait_for_result = false;
  GMainLoop *main_loop = nullptr;
  bool reserved_flag = false;
  bool restore_started = false;
  int pending = 0;
  std::string pkgid;
  std::string version;
  std::string root;
  bool backup_enabled = true;
  void *client = nullptr; /**< client_cb_data of a waiting request */
  bool abandoned = false; /**< the waiting request is gone; the engine deletes the context */
  archive_hold archive;   /**< no backup touches the archive before the restore has ended */
};

/** Restore candidates still expected, in the order given. */
extern std::vector<std::string> pkg_list_to_be_restored;
/** Client of the current restore mode: 0 cloud, 1 phone-transfer companion. */
extern int current_restore_client;
/** Backup set chosen by the user. */
extern std::string serial_num_user_select;
/** Record of the client that switched restore mode on. */
extern void *g_restore_cb_data;

/* ---- pipeline.cpp ---- */

/**
 * Restore one installed package: from the cloud later, by a download, or from
 * the phone-transfer companion at once.
 * @return 0, 42 when the download was refused, from the companion the unpacking's result
 */
int restore_app_data(const char *appid, pkg_restore_context *ctx);
/**
 * Count one download as done. With none left the restore ends: a waiting
 * request's loop is quit, any other context is deleted and its icon shown.
 */
void check_package_restore_complete(pkg_restore_context *ctx);

/* ---- report.cpp ---- */

enum class restore_stage { downloading, snapshot, unpacking, attributes, finished };

/** What became of a package; none while it is not settled. */
enum class restore_outcome {
  none,
  restored,
  rolled_back, /**< the data is as it was before */
  incomplete,  /**< not all of the data is in its place; what is missing is kept and tried again */
  failed,      /**< nothing was changed */
  skipped      /**< not attempted */
};

/** One step of one package's restore; valid during the call only. */
struct restore_progress {
  unsigned run = 0; /**< tells the restores of one process apart: a mode, or one request */
  int index = 0;    /**< packages that have ended in this run */
  int count = 0;    /**< of how many */
  const char *package = "";
  restore_stage stage = restore_stage::downloading;
  restore_outcome outcome = restore_outcome::none; /**< settled with restore_stage::finished */
  int result = QUARN_OK;                           /**< result code, 0 while running */
  std::uint64_t size = 0; /**< bytes of the archive on the device, 0 while there is none */
};
using restore_progress_sink = void (*)(const restore_progress &progress);

/** Follow what restores do. The sink must not block; null ends it. */
void set_restore_progress_sink(restore_progress_sink sink);
/** Tell the sink, if there is one, of a step or of the end of a package's restore. */
void report_restore_step(const std::string &package, restore_stage stage, std::uint64_t size = 0);
void report_restore_end(const std::string &package, restore_outcome outcome, int result,
                        std::uint64_t size = 0);
/** From now on restores belong to a run of @p packages packages: restore mode was switched on. */
void begin_restore_run(std::size_t packages);
/** The next restore of @p package is a run of its own, until it ends. */
void begin_requested_restore(const std::string &package);
/** Keep the record of the client that switched restore mode on, in place of an earlier one. */
void keep_restore_record(void *record);
/**
 * Restore mode is over: the kept client gets "restore_stop", from the main
 * loop, as soon as no restore of an installed package is outstanding.
 */
void end_restore_report();
/** True while a "restore_stop" is about to be sent. */
bool restore_report_pending();
/** A restore of an installed package began (1) or ended (-1). */
void count_outstanding_restore(int change);

/* ---- install_monitor.cpp ---- */

/** Follow package events. @return 1 when the monitor runs, else 0 */
int start_install_monitor();
/** @return 1 */
int stop_install_monitor();
/** Take a package off the candidate list. @return 1 when it was on it, else 0 */
int package_to_be_restored(const char *pkgid);
/** How the engine ends restore mode; set once at start. */
void set_restore_disable(int (*disable)());

/** Who is told that restore mode or its candidates may have changed; set once at start. */
void set_restore_mode_observer(void (*observer)());
/** Tells that observer. Main thread. */
void note_restore_mode_change();

/* ---- app_list.cpp ---- */

/**
 * Answer a client's request for the application list: the cloud's, or for
 * client 1 this device's. @return 0, or 42 when it could not be had
 */
int get_app_list(int client, void *invocation);

#endif
