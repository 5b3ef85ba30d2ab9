#include "quarn_d_backup/archive_hold.h"

#include <algorithm>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "platform_package_manager.h"
#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"
#include "thread_annotations.h"

namespace {

struct claims {
  Mutex mutex;
  std::string awaited_serial QUARN_GUARDED_BY(mutex);
  /** What restore mode waits for, and whether it was installed already. */
  std::map<std::string, bool> awaited QUARN_GUARDED_BY(mutex);
  /** Serial and package of restores under way, with their number. */
  std::map<std::pair<std::string, std::string>, int> held QUARN_GUARDED_BY(mutex);
};

claims &all_claims() {
  // never destroyed: the worker may outlive main()
  static auto *all = new claims;
  return *all;
}

archive_claim claim_of(claims &all, const std::string &serial, const std::string &package)
    QUARN_REQUIRES(all.mutex) {
  if (all.held.count({serial, package}) != 0) return archive_claim::whole;
  if (serial != all.awaited_serial) return archive_claim::none;
  const auto found = all.awaited.find(package);
  if (found == all.awaited.end()) return archive_claim::none;
  return found->second ? archive_claim::versions : archive_claim::whole;
}

/** A walk over the packages, with what it could not tell. */
struct package_walk {
  std::set<std::string> *ids;
  bool with_preloaded;
  bool complete = true;
};

bool note_package(package_info_h info, void *user_data) {
  auto *walk = static_cast<package_walk *>(user_data);
  CString id;
  bool preload = false;
  const int named = package_info_get_package(info, out(id));
  if (named != PACKAGE_MANAGER_ERROR_NONE || !id) {
    walk->complete = false;
    return true;
  }
  if (!walk->with_preloaded) {
    // one that cannot be told is not examined by a run either, and stays
    const int ret = package_info_is_preload_package(info, &preload);
    if (ret == PACKAGE_MANAGER_ERROR_NONE && preload) return true;
  }
  walk->ids->insert(id.get());
  return true;
}

bool walk_packages(std::set<std::string> *ids, bool with_preloaded) {
  package_walk walk{ids, with_preloaded};
  const int ret = package_manager_foreach_package_info(note_package, &walk);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_foreach_package_info() failed %d", ret);
    return false;
  }
  return walk.complete;
}

}  // namespace

archive_hold::archive_hold(std::string serial, std::string package)
    : serial_(std::move(serial)), package_(std::move(package)) {
  if (package_.empty()) return;
  claims &all = all_claims();
  const MutexLock lock(all.mutex);
  ++all.held[{serial_, package_}];
}

archive_hold::archive_hold(archive_hold &&other) noexcept
    : serial_(std::move(other.serial_)), package_(std::exchange(other.package_, {})) {}

archive_hold &archive_hold::operator=(archive_hold &&other) noexcept {
  if (this == &other) return *this;
  release();
  serial_ = std::move(other.serial_);
  package_ = std::exchange(other.package_, {});
  return *this;
}

archive_hold::~archive_hold() { release(); }

void archive_hold::release() {
  if (package_.empty()) return;
  claims &all = all_claims();
  const MutexLock lock(all.mutex);
  const auto held = all.held.find({serial_, package_});
  if (--held->second == 0) all.held.erase(held);
  package_.clear();
}

void await_archives(const std::string &serial, const std::vector<std::string> &packages,
                    const std::set<std::string> &installed) {
  claims &all = all_claims();
  const MutexLock lock(all.mutex);
  all.awaited_serial = serial;
  all.awaited.clear();
  for (const std::string &package : packages) {
    all.awaited.emplace(package, installed.count(package) != 0);
  }
}

void await_no_archives() { await_archives("", {}, {}); }

void stop_awaiting_archive(const std::string &package) {
  claims &all = all_claims();
  const MutexLock lock(all.mutex);
  all.awaited.erase(package);
}

void note_awaited_package_removed(const std::string &package) {
  claims &all = all_claims();
  const MutexLock lock(all.mutex);
  const auto found = all.awaited.find(package);
  if (found != all.awaited.end()) found->second = false;
}

archive_claim claim_on_archive(const std::string &serial, const std::string &package) {
  const archive_claim owed = owed_claim(serial, package);
  claims &all = all_claims();
  const MutexLock lock(all.mutex);
  return std::max(owed, claim_of(all, serial, package));
}

std::vector<std::string> claimed_packages(const std::string &serial) {
  const std::vector<std::string> owed = owed_packages(serial);
  std::set<std::string> packages(owed.begin(), owed.end());
  claims &all = all_claims();
  const MutexLock lock(all.mutex);
  if (serial == all.awaited_serial) {
    for (const auto &awaited : all.awaited) packages.insert(awaited.first);
  }
  for (const auto &held : all.held) {
    if (held.first.first == serial) packages.insert(held.first.second);
  }
  return {packages.begin(), packages.end()};
}

bool list_installed_packages(std::set<std::string> *installed) {
  return walk_packages(installed, true);
}

bool packages_kept_by_backup(std::set<std::string> *kept) {
  CString model;
  CString serial;
  get_device_info(out(model), out(serial));
  if (!serial || !walk_packages(kept, false)) return false;
  forget_owed_of_removed_packages();
  for (const std::string &package : claimed_packages(serial.get())) kept->insert(package);
  return true;
}
