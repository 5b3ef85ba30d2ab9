#include "webdav/backend_webdav.h"

#include <algorithm>

#include "core/remote_path.h"
#include "webdav/dav_client.h"
#include "webdav/dav_folders.h"
#include "webdav/dav_locks.h"
#include "webdav/dav_upload.h"

namespace transport {
namespace {

class WebdavBackend : public Backend {
 public:
  WebdavBackend(const StoreUrl &url, const Config &config) : client_(url, config) {}

  Outcome download(Attempt &attempt, const std::string &path, LocalTarget &target,
                   Version *version) override {
    if (!target.begin()) return local_failure("cannot make a local file");
    const Received received =
        receive(attempt.ticket, client_.request_for("GET", path), G_CHECKSUM_SHA256, target);
    bool found = false;
    const Outcome looked = find_object(attempt.ticket, received.answer, path, &found);
    if (!looked.ok()) return looked;
    if (!found) {
      if (version != nullptr) version->reset();
      return no_such_object();
    }
    if (!received.answer.good()) return dav_outcome(received.answer, "download");
    const Outcome result = publish(attempt.ticket, received, target);
    if (result.ok() && version != nullptr) *version = received.checksum;
    return result;
  }

  Outcome upload(Attempt &attempt, const Upload &upload, ObjectInfo *info) override {
    Outcome result = uploads_.attempt(attempt, upload);
    if (!result.ok()) return result;
    *info = info_of(upload);
    return result;
  }

  Outcome list(Attempt &attempt, const std::string &folder, int start, int count,
               ListPage *page) override {
    DavListing listing;
    const Outcome found = client_.list(attempt.ticket, folder, &listing);
    if (found.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) return success();
    if (!found.ok()) return found;
    std::vector<DavEntry> &entries = listing.children;
    std::sort(entries.begin(), entries.end(),
              [](const DavEntry &a, const DavEntry &b) { return a.path < b.path; });
    const std::size_t first = std::min(entries.size(), static_cast<std::size_t>(start));
    const std::size_t last = std::min(entries.size(), first + static_cast<std::size_t>(count));
    for (std::size_t i = first; i < last; ++i) {
      ObjectInfo child;
      child.path = entries[i].path;
      child.is_file = !entries[i].is_collection;
      child.size = entries[i].size;
      page->children.push_back(std::move(child));
    }
    page->more = last < entries.size();
    return success();
  }

  Outcome remove_folder(Attempt &attempt, const std::string &folder) override {
    DavListing listing;
    Outcome result = client_.list(attempt.ticket, folder, &listing);
    if (result.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT && attempt.number > 1) {
      // An earlier attempt that failed had its effect all the same.
      folders_.prune(attempt.ticket, parent_of(folder));
      return success();
    }
    if (!result.ok()) return result;
    folders_.forget(folder);
    const HttpAnswer answer = client_.send(attempt.ticket, "DELETE", folder + "/");
    if (has_status(answer, kHttpLocked)) locks_.look(attempt.ticket, folder);
    if (has_status(answer, kHttpMultiStatus))
      return failure(BACKUP_TRANS_ERROR_SERVER, "delete: the server kept a part of the folder");
    if (!is_absent(answer) && !answer.good()) return dav_outcome(answer, "delete");
    folders_.prune(attempt.ticket, parent_of(folder));
    return success();
  }

 private:
  // Whether the answer to a GET is an object's, or an error that does not tell.
  Outcome find_object(Ticket &ticket, const HttpAnswer &answer, const std::string &path,
                      bool *found) {
    *found = !is_absent(answer) && !client_.means_folder(answer, path);
    bool has_folder = false;
    if (has_status(answer, kHttpMethodNotAllowed)) {
      const Outcome looked = client_.find_folder(ticket, path, &has_folder);
      *found = !has_folder;
      return looked;
    }
    // Some take what comes behind an object's name for an argument of the object.
    const std::string folder = parent_of(path);
    if (!answer.good() || folder.empty() || folders_.is_known(folder)) return success();
    const Outcome looked = client_.find_folder(ticket, folder, &has_folder);
    if (has_folder) folders_.remember(folder);
    *found = has_folder;
    return looked;
  }

  const DavClient client_;
  LockWatch locks_{client_};
  DavFolders folders_{client_, locks_};
  DavUploads uploads_{client_, folders_, locks_};
};

}  // namespace

std::shared_ptr<Backend> make_webdav_backend(const StoreUrl &url, const Config &config,
                                             std::string *problem) {
  // HTTP would take what follows for the password; to S3 services it is a letter like others.
  if (config.user.find(':') != std::string::npos) {
    *problem = "the user's name holds a colon";
    return nullptr;
  }
  return std::make_shared<WebdavBackend>(url, config);
}

}  // namespace transport
