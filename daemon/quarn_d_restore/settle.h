/**
 * @file settle.h
 * @brief What becomes of unpacked files whose attributes could not be had.
 *
 * Main thread; the caller holds the PackageDataLock. Failures are logged.
 */
#ifndef QUARN_D_RESTORE_SETTLE_H
#define QUARN_D_RESTORE_SETTLE_H

#include "quarn_d_restore/restore_files.h"

/**
 * Make what was unpacked and has no attributes yet an ordinary file of the application: mode 0600,
 * with the label of its data directory. For a restore that is not rolled back.
 */
void settle_unpacked_files(const char *pkgid, const char *root);

/**
 * Notes on the disk, while it lives, that an archive is unpacked which nothing would undo: should
 * this process end meanwhile, the next one settles what it has left.
 */
class UnpackingNote {
 public:
  /** @param files borrowed, and outlives this */
  explicit UnpackingNote(const restore_files &files);
  ~UnpackingNote();
  UnpackingNote(const UnpackingNote &) = delete;
  UnpackingNote &operator=(const UnpackingNote &) = delete;

 private:
  const restore_files &files_;
};

/** Settle what an unpacking has left that an earlier process did not come to the end of. */
void settle_interrupted_unpacking(const char *pkgid, const char *root);

#endif
