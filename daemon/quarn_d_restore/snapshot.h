/**
 * @file snapshot.h
 * @brief What a snapshot is good for at the moment, and what became of a rollback.
 *
 * A snapshot is incomplete until its table has its name, then complete: the
 * data may be half replaced. It is released by the table's removal, or told
 * when the application has gone on with its data: then it is only kept. Main
 * thread or the backup worker; the caller holds the package's lock.
 */
#ifndef QUARN_D_RESTORE_SNAPSHOT_H
#define QUARN_D_RESTORE_SNAPSHOT_H

#include <sys/stat.h>

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "files/held_folder.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_utils/handles.h"

struct file_info_table_h;

enum class snapshot_state {
  none,
  foreign,    /**< something of that name that is not the daemon's */
  incomplete, /**< the data was not touched, or is whole again */
  complete,   /**< what counts until the restore has ended */
  told        /**< kept for whoever wants it; the present data counts */
};
[[nodiscard]] snapshot_state state_of_snapshot(const restore_files &files);

/**
 * Copy the package's data aside. Its root is held by the caller; @p held is the
 * snapshot, in which everything that follows finds it, whatever the application
 * does with the name.
 * @return #QUARN_OK, #QUARN_REFUSED, or what writing the table gave
 */
[[nodiscard]] int take_snapshot(const char *pkgid, const char *root,
                                std::optional<HeldFolder> *held);

enum class rollback_result {
  none,  /**< there was no snapshot to roll back to */
  whole, /**< the data is as it was before the restore */
  kept   /**< not all of it is: the rest is in the snapshot, and will be tried again */
};
/**
 * Put the snapshot back: by moving, so that no step needs space. It may be
 * repeated after an interruption at any point.
 */
[[nodiscard]] rollback_result put_snapshot_back(const char *pkgid, const char *root);

/** Remember what has been unpacked. @return false when it could not be written */
[[nodiscard]] bool note_unpacked_files(const char *pkgid, const char *root);
/**
 * True when a file has changed that neither the restore nor the rollback wrote;
 * @p path is one. Files are told apart by inode, size and time of change, and
 * times are only ever compared for being the same.
 */
[[nodiscard]] bool application_has_written(const restore_files &files, std::string *path);

/** Keep a complete snapshot without its being rolled back to ever again. @return false: it failed
 */
[[nodiscard]] bool keep_told_snapshot(const restore_files &files);
/** Remove a told snapshot that made way for a further restore, which has succeeded. */
void forget_told_snapshot(const restore_files &files);
/** Remove what is ours in the snapshot's place. @return true when nothing lies there any more */
[[nodiscard]] bool remove_snapshot(const restore_files &files);

/**
 * Take the application's own file out of the way of the table that an archive
 * holds. @return false when it could not be moved
 */
[[nodiscard]] bool set_own_table_aside(const restore_files &files);
/** Put it back, in place of a table. May be repeated; nothing when there is none. */
void put_own_table_back(const restore_files &files);

/** The application's own file of the table's name is not in the way while this lives. */
class OwnTableAside {
 public:
  /** @param files borrowed, and outlives this */
  explicit OwnTableAside(const restore_files &files)
      : files_(files), done_(set_own_table_aside(files)) {}
  ~OwnTableAside() { put_own_table_back(files_); }
  OwnTableAside(const OwnTableAside &) = delete;
  OwnTableAside &operator=(const OwnTableAside &) = delete;
  explicit operator bool() const { return done_; }

 private:
  const restore_files &files_;
  const bool done_;
};

/** The fingerprint of a file's present content, as the stamps have it. */
[[nodiscard]] std::uint64_t file_stamp(const struct stat &status);

/** Writes stamps as a file that has its name only when it is whole. */
class StampWriter {
 public:
  explicit StampWriter(std::string path);
  void add(const struct stat &status);
  /** @return true when all of them are on the disk under their name */
  [[nodiscard]] bool finish();

 private:
  void flush();

  std::string path_;
  UniqueFd file_;
  std::vector<std::uint64_t> waiting_;
  bool failed_;
};

/**
 * Remove the snapshot, its table first: from then on the present data counts.
 * @return false when that data cannot be brought onto the disk; the snapshot is kept then
 */
[[nodiscard]] bool discard_snapshot(const char *pkgid, const char *root);

/* ---- single steps, which the engine itself does not call ---- */

/** take_snapshot() of a package whose root nobody holds. */
int temp_backup_initial_app_data(const char *pkgid, const char *root);
/**
 * Copy what lies below @p dir into the snapshot @p temp_dir.
 * No part of the daemon calls it.
 * @return 1, 0 when anything failed
 */
int parse_dir_for_copy(const char *dir, const char *temp_dir, const char *pkgid, const char *root,
                       file_info_table_h *table);
/** put_snapshot_back(). No part of the daemon calls it. @return #QUARN_OK */
int rollback_to_initial_app_data(const char *pkgid, const char *root);
/**
 * Move what lies below @p dir, in the snapshot, back.
 * No part of the daemon calls it.
 * @return 1, 0 when anything failed
 */
int parse_dir_for_rollback(const char *dir, const char *pkgid, const char *root);

#endif
