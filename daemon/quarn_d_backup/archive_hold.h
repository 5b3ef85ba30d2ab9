/**
 * @file archive_hold.h
 * @brief Which archives of this device in the cloud a restore is still to have.
 *
 * Restore mode waits for packages that are not installed, which is just what a
 * backup unlists and removes. The restore engine tells here what it waits for
 * and what it is fetching; a run asks before it packs, lists and removes. Any
 * thread, unless told otherwise.
 */
#ifndef QUARN_D_BACKUP_ARCHIVE_HOLD_H
#define QUARN_D_BACKUP_ARCHIVE_HOLD_H

#include <set>
#include <string>
#include <vector>

/** How much of a package's backup is to stay. */
enum class archive_claim {
  none,
  versions, /**< restore mode waits for it to be installed again: no version is removed */
  whole     /**< a restore is to have it: it is not replaced either */
};

/** Keeps one package's archives while it lives: its restore is under way. */
class archive_hold {
 public:
  archive_hold() = default;
  archive_hold(std::string serial, std::string package);
  archive_hold(archive_hold &&other) noexcept;
  archive_hold &operator=(archive_hold &&other) noexcept;
  archive_hold(const archive_hold &) = delete;
  archive_hold &operator=(const archive_hold &) = delete;
  ~archive_hold();

 private:
  void release();

  std::string serial_;
  std::string package_; /**< empty: nothing is held */
};

/**
 * Restore mode waits for @p packages of the device @p serial, in place of what
 * it waited for before. What is @p installed by then is backed up meanwhile as
 * ever; the others are not replaced before their restore has ended.
 */
void await_archives(const std::string &serial, const std::vector<std::string> &packages,
                    const std::set<std::string> &installed);
/** It waits for nothing any more. */
void await_no_archives();
/** The package's installation was seen: it is waited for no longer. */
void stop_awaiting_archive(const std::string &package);
/** The package was removed: if it is waited for, its next installation is the one. */
void note_awaited_package_removed(const std::string &package);

/** What is claimed of a package of the device @p serial. */
[[nodiscard]] archive_claim claim_on_archive(const std::string &serial, const std::string &package);
/** Every package of that device that something is claimed of. */
[[nodiscard]] std::vector<std::string> claimed_packages(const std::string &serial);

/** Ids of the packages that are installed, preloaded ones too. @return false when not all are known
 */
[[nodiscard]] bool list_installed_packages(std::set<std::string> *installed);

/**
 * The packages whose backups a manual run would leave in the cloud: those that
 * are installed and not preloaded, and those that a restore is to have.
 * @return false when they are not known
 */
[[nodiscard]] bool packages_kept_by_backup(std::set<std::string> *kept);

#endif
