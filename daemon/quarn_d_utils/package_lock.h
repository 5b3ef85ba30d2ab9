/**
 * @file package_lock.h
 * @brief Who works with the data of which package, so that no archive mixes two states.
 *
 * One package is packed at a time, for the memory that this takes, and one is
 * changed (unpacked, put back, swept) at a time: both at once, where they are
 * different ones. Packing may last as long as an export does; the main thread
 * does not wait for that. Any thread; never held while waiting for an event.
 */
#ifndef QUARN_D_UTILS_PACKAGE_LOCK_H
#define QUARN_D_UTILS_PACKAGE_LOCK_H

#include <string>

enum class PackageUse {
  kPack,
  kChange,
  kChangeUnlessPacked /**< as a change, but at once without the lock while that package is packed */
};

/** Holds a package's data while it lives. */
class PackageDataLock {
 public:
  PackageDataLock(const std::string &pkg_id, PackageUse use);
  ~PackageDataLock();
  PackageDataLock(const PackageDataLock &) = delete;
  PackageDataLock &operator=(const PackageDataLock &) = delete;
  /** False only for a package that is packed, where that was not to be waited for. */
  explicit operator bool() const { return held_; }

 private:
  bool packs_;
  bool held_;
};

/** Whether the package is packed at the moment. */
[[nodiscard]] bool package_is_packed(const std::string &pkg_id);
/** Whether any is: the next one waits until that has ended. */
[[nodiscard]] bool any_package_is_packed();
/** Called on whatever thread each time the packing of a package has ended. Set once. */
void set_packing_ended_hook(void (*hook)());

#endif
