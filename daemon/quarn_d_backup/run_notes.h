/**
 * @file run_notes.h
 * @brief What a run finds out on its way: about the list it writes, and why it fails.
 */
#ifndef QUARN_D_BACKUP_RUN_NOTES_H
#define QUARN_D_BACKUP_RUN_NOTES_H

#include <atomic>
#include <cstdint>
#include <memory>
#include <set>
#include <string>

#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_utils/request_cause.h"

/** Members that callbacks write are atomic; the others belong to the thread that runs the backup.
 */
struct run_notes {
  /** What the run failed of; the first that is noted stays. */
  std::atomic<request_cause> cause{request_cause::none};
  /** The list that this run made stands in the cloud. */
  std::atomic<bool> list_written{false};
  /** The list is staged, whole. */
  bool list_staged = false;
  bool list_too_large = false;
  std::uint64_t list_size = 0; /**< bytes of the list that was made */
  /** The cloud's list has an entry of this device. */
  bool serial_listed = false;
  /** The cloud's list could be read, or there is none. */
  bool list_understood = true;
  /** A backup that this device did not make, as far as it knows: all of it stays. */
  bool keep_all_listed = false;
  /** The upload of a run of one package, while the transport has it. Main thread. */
  void *single_upload = nullptr;
  unsigned int deletions = 0;    /**< of cloud folders, so far. Main thread. */
  std::size_t packages_seen = 0; /**< by the walk, preloaded ones too */
  /** Ids and versions in the list that was made. */
  std::set<std::string> listed;
};

/** The notes of a run; made with its context. */
run_notes &notes_of(const backup_context *ctx);
/** Note what the run fails of, if nothing was noted before. */
void note_cause(backup_context *ctx, request_cause cause);

/* ---- progress.cpp ---- */

/** Tell the sink of something about the list that is to be seen to. */
void report_notice(const backup_context *ctx, const char *notice, std::uint64_t size,
                   std::uint64_t limit);

/* ---- app_list.cpp ---- */

/** The same id and version as one text, which no other pair has. */
std::string listed_key(const std::string &pkg_id, const std::string &version);
/**
 * Stage the list @p text once more, with the packages that a restore is to have
 * and that it does not name.
 * @return false when there is no such list
 */
bool add_claimed_packages_to_list(backup_context *ctx, CString text);
/** True when one of the cloud's packages is claimed and not in the list that was made. */
bool claimed_package_is_missing(backup_context *ctx);

/* ---- changes.cpp ---- */

/** True unless the package manager says that there is no such package, or a preloaded one. */
bool may_be_installed(const std::string &pkg_id);

#endif
