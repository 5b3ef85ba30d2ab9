#include "webdav/dav_folders.h"

#include "core/remote_path.h"

namespace transport {
namespace {

constexpr std::size_t kMaxKnownFolders = 4096;

}  // namespace

Outcome DavFolders::ensure(Ticket &ticket, const std::string &folder, std::string *made) {
  if (is_known(folder)) return success();
  HttpAnswer answer =
      folder.empty() ? client_.make_top(ticket) : client_.send(ticket, "MKCOL", folder + "/");
  if ((has_status(answer, kHttpConflict) || is_absent(answer)) && !folder.empty()) {
    const Outcome parent = ensure(ticket, parent_of(folder), made);
    if (!parent.ok()) return parent;
    answer = client_.send(ticket, "MKCOL", folder + "/");
  }
  if (has_status(answer, kHttpLocked)) locks_.look(ticket, parent_of(folder));
  // An answer that did not come does not tell that it was not made.
  if (!answer.complete() || has_status(answer, kHttpCreated)) *made = folder;
  if (!answer.complete()) return answer.problem;
  if (!answer.good()) {
    const Outcome there = find(ticket, folder, answer);
    if (!there.ok()) return there;
  }
  remember(folder);
  return success();
}

// A folder that could not be made is there already, or somebody else made it at the same time,
// which may be answered with any error.
Outcome DavFolders::find(Ticket &ticket, const std::string &folder, const HttpAnswer &answer) {
  DavListing listing;
  const Outcome found = client_.list(ticket, folder, &listing);
  if (found.ok() || (!found.transient && found.code != BACKUP_TRANS_ERROR_NO_SUCH_OBJECT))
    return found;
  if (has_status(answer, kHttpMethodNotAllowed))
    return failure(BACKUP_TRANS_ERROR_SERVER, "make a folder: there is an object in its place");
  Outcome result = of_upload(dav_outcome(answer, "make a folder"));
  // Nothing lies above the store that could have been made.
  if (folder.empty() && has_status(answer, kHttpConflict)) result.wrong_address = true;
  // Somebody removed a parent in between.
  if (has_status(answer, kHttpConflict) && !folder.empty()) {
    forget("");
    result.transient = true;
  }
  return result;
}

bool DavFolders::is_known(const std::string &folder) {
  const MutexLock guard(mutex_);
  return known_.count(folder) != 0;
}

void DavFolders::remember(const std::string &folder) {
  const MutexLock guard(mutex_);
  if (known_.size() >= kMaxKnownFolders) known_.clear();
  known_.insert(folder);
}

void DavFolders::forget(const std::string &folder) {
  const MutexLock guard(mutex_);
  for (auto it = known_.begin(); it != known_.end();) {
    const bool inside = *it == folder || it->compare(0, folder.size() + 1, folder + "/") == 0;
    it = inside ? known_.erase(it) : std::next(it);
  }
}

void DavFolders::prune(Ticket &ticket, std::string folder) {
  while (!folder.empty() && is_empty(ticket, folder) && prune_one(ticket, folder))
    folder = parent_of(folder);
}

bool DavFolders::is_empty(Ticket &ticket, const std::string &folder) const {
  DavListing listing;
  return client_.list(ticket, folder, &listing).ok() && listing.children.empty() &&
         !listing.has_others;
}

bool DavFolders::prune_one(Ticket &ticket, const std::string &folder) {
  std::string token;
  if (!client_.lock(ticket, folder, &token).ok() || token.empty()) return false;
  bool gone = false;
  if (is_empty(ticket, folder)) {
    forget(folder);
    HttpRequest request = client_.request_for("DELETE", folder + "/");
    request.headers = {client_.lock_condition(folder, token)};
    gone = http_perform(ticket, request).good();
  }
  // Some keep a lock on what was deleted.
  client_.unlock(folder, token);
  return gone;
}

}  // namespace transport
