/**
 * @file backup_progress.h
 * @brief What backup runs tell of their steps.
 */
#ifndef QUARN_D_BACKUP_PROGRESS_H
#define QUARN_D_BACKUP_PROGRESS_H

#include <cstdint>

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

#endif
