#include "quarn_d_backup/single_folders.h"

#include <set>

#include "files/package_files.h"
#include "thread_annotations.h"

namespace {

struct single_folders {
  Mutex mutex;
  std::set<std::string> folders QUARN_GUARDED_BY(mutex);
  bool too_many QUARN_GUARDED_BY(mutex) = false;  // some were not kept
};

single_folders &all() {
  // never destroyed: the worker and late callbacks may outlive main()
  static auto *one = new single_folders;
  return *one;
}

}  // namespace

void note_single_upload(const std::string &serial, const std::string &pkg_id,
                        const std::string &version) {
  single_folders &noted = all();
  const MutexLock lock(noted.mutex);
  for (std::string folder :
       {cloud_package_folder(serial, pkg_id), cloud_version_folder(serial, pkg_id, version)}) {
    if (noted.folders.size() < kMostSingleFolders) {
      noted.folders.insert(std::move(folder));
    } else if (noted.folders.count(folder) == 0) {
      noted.too_many = true;
    }
  }
}

bool uploaded_by_single_request(const std::string &folder) {
  single_folders &noted = all();
  const MutexLock lock(noted.mutex);
  return noted.too_many || noted.folders.count(folder) != 0;
}

void forget_single_uploads() {
  single_folders &noted = all();
  const MutexLock lock(noted.mutex);
  noted.folders.clear();
  noted.too_many = false;
}
