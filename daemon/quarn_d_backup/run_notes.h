/**
 * @file run_notes.h
 * @brief What a run finds out on its way: about the list it writes, and why it fails.
 */
#ifndef QUARN_D_BACKUP_RUN_NOTES_H
#define QUARN_D_BACKUP_RUN_NOTES_H

#include <atomic>
#include <cstdint>
#include <set>
#include <string>

#include "quarn_d_utils/request_cause.h"

struct backup_context;

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
  unsigned int deletions = 0;       /**< of cloud folders, so far. Main thread. */
  std::size_t packages_seen = 0;    /**< by the walk, preloaded ones too */
  std::size_t versions_to_list = 0; /**< of upload_list; set before the first is listed */
  std::atomic<std::size_t> versions_listed{0}; /**< of these, begun */
  /** Ids and versions in the list that was made. */
  std::set<std::string> listed;
};

/** The notes of a run; made with its context. */
[[nodiscard]] run_notes &notes_of(const backup_context *ctx);
/** Note what the run fails of, if nothing was noted before. */
void note_cause(backup_context *ctx, request_cause cause);

#endif
