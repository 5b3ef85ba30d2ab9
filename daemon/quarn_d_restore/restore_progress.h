/**
 * @file restore_progress.h
 * @brief What restores do, told step by step. Main thread only.
 */
#ifndef QUARN_D_RESTORE_RESTORE_PROGRESS_H
#define QUARN_D_RESTORE_RESTORE_PROGRESS_H

#include <cstddef>
#include <cstdint>
#include <string>

#include "quarn_common.h"

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
  int result = QUARN_OK;                           /**< result code, #QUARN_OK while running */
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

#endif
