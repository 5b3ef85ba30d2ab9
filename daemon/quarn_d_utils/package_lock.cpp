#include "quarn_d_utils/package_lock.h"

#include <condition_variable>
#include <optional>

#include "thread_annotations.h"

namespace {

/** Which package is packed and which is changed. */
struct Uses {
  Mutex mutex;
  std::condition_variable ended;
  std::optional<std::string> packed QUARN_GUARDED_BY(mutex);
  std::optional<std::string> changed QUARN_GUARDED_BY(mutex);
  void (*packing_ended)() QUARN_GUARDED_BY(mutex) = nullptr;
};

Uses &uses() {
  static auto *all = new Uses;
  return *all;
}

}  // namespace

PackageDataLock::PackageDataLock(const std::string &pkg_id, PackageUse use)
    : packs_(use == PackageUse::kPack), held_(true) {
  Uses &all = uses();
  MutexLock lock(all.mutex);
  std::optional<std::string> &mine = packs_ ? all.packed : all.changed;
  const std::optional<std::string> &other = packs_ ? all.changed : all.packed;
  while (mine || other == pkg_id) {
    if (use == PackageUse::kChangeUnlessPacked && other == pkg_id) {
      held_ = false;
      return;
    }
    all.ended.wait(lock.waiting());
  }
  mine = pkg_id;
}

PackageDataLock::~PackageDataLock() {
  if (!held_) return;
  Uses &all = uses();
  void (*hook)() = nullptr;
  {
    const MutexLock lock(all.mutex);
    (packs_ ? all.packed : all.changed).reset();
    all.ended.notify_all();
    if (packs_) hook = all.packing_ended;
  }
  if (hook != nullptr) hook();
}

bool any_package_is_packed() {
  Uses &all = uses();
  const MutexLock lock(all.mutex);
  return all.packed.has_value();
}

void set_packing_ended_hook(void (*hook)()) {
  Uses &all = uses();
  const MutexLock lock(all.mutex);
  all.packing_ended = hook;
}

bool package_is_packed(const std::string &pkg_id) {
  Uses &all = uses();
  const MutexLock lock(all.mutex);
  return all.packed == pkg_id;
}
