#include "backend_webdav.h"

#include <algorithm>
#include <functional>
#include <mutex>
#include <set>

#include "http_store.h"
#include "remote_path.h"

namespace transport {
namespace {

constexpr int kCreated = 201;
constexpr int kMultiStatus = 207;
constexpr int kLocked = 423;
constexpr int kServerError = 500;
constexpr int64_t kMillisecondsPerSecond = 1000;
constexpr std::size_t kMaxKnownFolders = 4096;
constexpr long kTidyUpSeconds = 5;

constexpr char kPropfind[] =
    "<?xml version=\"1.0\" encoding=\"utf-8\"?>"
    "<d:propfind xmlns:d=\"DAV:\"><d:prop><d:resourcetype/><d:getcontentlength/></d:prop>"
    "</d:propfind>";
constexpr char kLockInfo[] =
    "<?xml version=\"1.0\" encoding=\"utf-8\"?>"
    "<d:lockinfo xmlns:d=\"DAV:\"><d:lockscope><d:exclusive/></d:lockscope>"
    "<d:locktype><d:write/></d:locktype></d:lockinfo>";
constexpr char kXmlType[] = "Content-Type: application/xml; charset=utf-8";

// Bytes that lie at the server under a temporary name; whatever is not moved is deleted.
struct Uploaded {
  explicit Uploaded(std::function<void(const Uploaded &)> give_up) : give_up_(std::move(give_up)) {}
  Uploaded(const Uploaded &) = delete;
  Uploaded &operator=(const Uploaded &) = delete;
  ~Uploaded() { give_up(); }

  void give_up() {
    if (!temporary.empty() || !made_folder.empty()) give_up_(*this);
    settle();
  }
  void settle() {
    temporary.clear();
    made_folder.clear();
    complete = false;
    move_asked = false;
  }

  std::string temporary;
  std::string made_folder;  // to go again when nothing comes to lie in it
  bool complete = false;
  bool move_asked = false;

 private:
  std::function<void(const Uploaded &)> give_up_;
};

class WebdavBackend : public Backend {
 public:
  WebdavBackend(const StoreUrl &url, const Config &config)
      : url_(url), user_(config.user), password_(config.password), ca_file_(config.ca_file) {}

  Outcome download(Attempt &attempt, const std::string &path, LocalTarget &target,
                   Version *version) override {
    if (!target.begin()) return local_failure("cannot make a local file");
    const Received received =
        receive(attempt.ticket, request_for("GET", path), G_CHECKSUM_SHA256, &target);
    if (is_absent(received.answer) || means_folder(received.answer, path)) {
      if (version != nullptr) version->reset();
      return no_such_object();
    }
    if (!received.answer.good()) return outcome(received.answer, "download");
    const Outcome result = publish(attempt.ticket, received, target);
    if (result.ok() && version != nullptr) *version = received.checksum;
    return result;
  }

  Outcome upload(Attempt &attempt, const Upload &upload, ObjectInfo *info) override {
    if (!attempt.memory.has_value()) {
      attempt.memory = std::make_shared<Uploaded>([this](const Uploaded &left) { tidy_up(left); });
    }
    const auto uploaded = std::any_cast<std::shared_ptr<Uploaded>>(attempt.memory);
    if (!uploaded->complete) {
      uploaded->give_up();
      uploaded->temporary = parent_of(upload.path) + "/" + make_temporary_name();
      const Outcome sent = send(attempt.ticket, upload, uploaded.get());
      if (!sent.ok()) return sent;
      uploaded->complete = true;
    }
    const Outcome result = upload.basis == nullptr
                               ? move(attempt.ticket, upload, uploaded.get(), "")
                               : move_locked(attempt.ticket, upload, uploaded.get());
    if (!result.ok()) return result;
    uploaded->settle();
    info->path = upload.path;
    info->is_file = true;
    info->size = upload.source.size();
    info->timestamp_ms = upload.timestamp_ms;
    return result;
  }

  Outcome list(Attempt &attempt, const std::string &folder, int start, int count,
               ListPage *page) override {
    std::vector<DavEntry> entries;
    bool has_temporary = false;
    const Outcome found = children_of(attempt.ticket, folder, "", &entries, &has_temporary);
    if (found.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) return success();
    if (!found.ok()) return found;
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
    std::vector<DavEntry> entries;
    bool has_temporary = false;
    Outcome result = children_of(attempt.ticket, folder, "", &entries, &has_temporary);
    if (result.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT && attempt.number > 1) {
      // An earlier attempt that failed had its effect all the same.
      prune(attempt.ticket, parent_of(folder));
      return success();
    }
    if (!result.ok()) return result;
    forget(folder);
    const HttpAnswer answer = http_perform(attempt.ticket, request_for("DELETE", folder + "/"));
    if (answer.complete() && answer.status == kMultiStatus)
      return failure(BACKUP_TRANS_ERROR_SERVER, "delete: the server kept a part of the folder");
    if (!is_absent(answer) && !answer.good()) return outcome(answer, "delete");
    prune(attempt.ticket, parent_of(folder));
    return success();
  }

 private:
  HttpRequest request_for(const char *method, const std::string &path) const {
    HttpRequest request;
    request.method = method;
    request.url = url_.base + encode_path(path);
    request.user = user_;
    request.password = password_;
    request.ca_file = ca_file_;
    return request;
  }

  // Somebody else's lock goes away by itself.
  static Outcome outcome(const HttpAnswer &answer, const char *what) {
    Outcome result = outcome_of(answer, what);
    if (answer.complete() && answer.status == kLocked) result.transient = true;
    return result;
  }

  // Servers send whoever asks for a folder as if it were an object to its name with a slash.
  bool means_folder(const HttpAnswer &answer, const std::string &path) const {
    if (!answer.complete() || answer.status / 100 != 3) return false;
    const std::string expected = url_.base + encode_path(path) + "/";
    const std::string location = answer.header("location");
    return location == expected || url_.origin + location == expected;
  }

  // Puts the bytes under a temporary name and makes sure that they all arrived.
  Outcome send(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
    const std::string &temporary = uploaded->temporary;
    const std::string folder = parent_of(temporary);
    Outcome result = ensure_folder(ticket, folder, uploaded);
    if (!result.ok()) return result;
    HttpAnswer answer = put(ticket, upload, temporary);
    const bool folder_gone =
        answer.complete() && (answer.status == kHttpNotFound || answer.status == kHttpConflict ||
                              answer.status == kServerError);
    if (folder_gone && !folder.empty()) {
      // Another device may have deleted what was known; what is there does not mind.
      forget("");
      result = ensure_folder(ticket, folder, uploaded);
      if (!result.ok()) return result;
      answer = put(ticket, upload, temporary);
    }
    if (!answer.good()) {
      result = outcome(answer, "upload");
      if (result.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) result.code = BACKUP_TRANS_ERROR_SERVER;
      return result;
    }
    if (!upload.source.unchanged())
      return failure(BACKUP_TRANS_ERROR_LOCAL_FILE, "the local file changed while it was sent");
    answer = http_perform(ticket, request_for("HEAD", temporary));
    if (!answer.good()) {
      result = outcome(answer, "upload");
      return result.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT ? again("upload: it did not last")
                                                              : result;
    }
    return has_size(answer, upload.source.size()) ? success()
                                                  : again("upload: it arrived incomplete");
  }

  HttpAnswer put(Ticket &ticket, const Upload &upload, const std::string &path) const {
    HttpRequest request = request_for("PUT", path);
    request.has_body = true;
    request.body_fd = upload.source.fd();
    request.body_size = upload.source.size();
    request.headers = {
        "Content-Type: " + upload.content_type,
        "X-OC-Mtime: " + std::to_string(upload.timestamp_ms / kMillisecondsPerSecond)};
    return http_perform(ticket, request);
  }

  Outcome move(Ticket &ticket, const Upload &upload, Uploaded *uploaded, const std::string &token) {
    if (uploaded->move_asked) {
      // The earlier answer was lost or an error, which does not tell whether it was done.
      const HttpAnswer left = http_perform(ticket, request_for("HEAD", uploaded->temporary));
      if (is_absent(left)) {
        const HttpAnswer moved = http_perform(ticket, request_for("HEAD", upload.path));
        if (moved.good() && has_size(moved, upload.source.size())) return success();
        uploaded->settle();
        return again("upload: it did not last");
      }
      if (!left.good()) return outcome(left, "upload");
    }
    HttpRequest request = request_for("MOVE", uploaded->temporary);
    request.headers = {"Destination: " + url_.base + encode_path(upload.path), "Overwrite: T"};
    if (!token.empty()) request.headers.push_back(condition(parent_of(upload.path), token));
    uploaded->move_asked = true;
    const HttpAnswer answer = http_perform(ticket, request);
    if (answer.good() && answer.status != kMultiStatus) return success();
    if (answer.complete() && (answer.status == kHttpNotFound || answer.status == kHttpConflict ||
                              answer.status == kHttpGone)) {
      // The folder was deleted, and what had been sent with it.
      forget("");
      uploaded->settle();
      return again("upload: the folder was deleted meanwhile");
    }
    return outcome(answer, "upload");
  }

  // The comparison and the move happen while nobody else may change the folder.
  Outcome move_locked(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
    const std::string folder = parent_of(upload.path);
    std::string token;
    Outcome result = lock(ticket, folder, &token);
    if (!result.ok()) return result;
    // A move whose answer was lost has changed the object itself.
    if (!uploaded->move_asked) result = compare_basis(ticket, upload);
    if (result.ok()) result = move(ticket, upload, uploaded, token);
    unlock(folder, token);
    return result;
  }

  Outcome compare_basis(Ticket &ticket, const Upload &upload) {
    const Received received =
        receive(ticket, request_for("GET", upload.path), G_CHECKSUM_SHA256, nullptr);
    Version present;
    if (received.answer.good()) {
      present = received.checksum;
    } else if (!is_absent(received.answer)) {
      return outcome(received.answer, "upload");
    }
    if (present == *upload.basis) return success();
    return failure(BACKUP_TRANS_ERROR_CONFLICT, "the object changed since it was read");
  }

  // No token where the server does not lock: nothing better is to be had there.
  Outcome lock(Ticket &ticket, const std::string &folder, std::string *token) {
    HttpRequest request = request_for("LOCK", folder + "/");
    request.has_body = true;
    request.body = kLockInfo;
    request.headers = {kXmlType, "Depth: infinity", "Timeout: Second-60"};
    const HttpAnswer answer = http_perform(ticket, request);
    if (answer.complete() &&
        (answer.status == kHttpMethodNotAllowed || answer.status == kHttpNotImplemented))
      return success();
    if (!answer.good()) return outcome(answer, "lock");
    *token = answer.header("lock-token");
    return success();
  }

  void unlock(const std::string &folder, const std::string &token) {
    if (token.empty()) return;
    HttpRequest request = request_for("UNLOCK", folder + "/");
    request.headers = {"Lock-Token: " + token};
    // Also after a cancellation; else others would wait until the lock ends by itself.
    Ticket own;
    request.seconds = kTidyUpSeconds;
    http_perform(own, request);
  }

  std::string condition(const std::string &folder, const std::string &token) const {
    return "If: <" + url_.base + encode_path(folder) + "/> (" + token + ")";
  }

  Outcome ensure_folder(Ticket &ticket, const std::string &folder, Uploaded *uploaded) {
    if (is_known(folder)) return success();
    HttpAnswer answer = http_perform(ticket, request_for("MKCOL", folder + "/"));
    if (answer.complete() && (answer.status == kHttpConflict || answer.status == kHttpNotFound) &&
        !folder.empty()) {
      const Outcome parent = ensure_folder(ticket, parent_of(folder), uploaded);
      if (!parent.ok()) return parent;
      answer = http_perform(ticket, request_for("MKCOL", folder + "/"));
    }
    // An answer that did not come does not tell that it was not made.
    if (!answer.complete() || answer.status == kCreated) uploaded->made_folder = folder;
    if (!answer.good() && !(answer.complete() && answer.status == kHttpMethodNotAllowed) &&
        !(answer.complete() && is_folder(ticket, folder))) {
      Outcome result = outcome(answer, "make a folder");
      if (result.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) result.code = BACKUP_TRANS_ERROR_SERVER;
      // Somebody removed a parent in between.
      if (answer.complete() && answer.status == kHttpConflict) {
        forget("");
        result.transient = true;
      }
      return result;
    }
    const std::lock_guard<std::mutex> guard(mutex_);
    if (known_.size() >= kMaxKnownFolders) known_.clear();
    known_.insert(folder);
    return success();
  }

  // Who makes a folder at the same time as another may be answered with any error.
  bool is_folder(Ticket &ticket, const std::string &folder) {
    std::vector<DavEntry> entries;
    bool has_temporary = false;
    return children_of(ticket, folder, "", &entries, &has_temporary).ok();
  }

  bool is_known(const std::string &folder) {
    const std::lock_guard<std::mutex> guard(mutex_);
    return known_.count(folder) != 0;
  }

  // What is not known to be there any more: @p folder and everything in it; "" is everything.
  void forget(const std::string &folder) {
    const std::lock_guard<std::mutex> guard(mutex_);
    for (auto it = known_.begin(); it != known_.end();) {
      const bool inside = *it == folder || it->compare(0, folder.size() + 1, folder + "/") == 0;
      it = inside ? known_.erase(it) : std::next(it);
    }
  }

  // Children with their paths in the store; temporary ones are only mentioned.
  Outcome children_of(Ticket &ticket, const std::string &folder, const std::string &token,
                      std::vector<DavEntry> *entries, bool *has_temporary) {
    HttpRequest request = request_for("PROPFIND", folder + "/");
    request.has_body = true;
    request.body = kPropfind;
    request.headers = {kXmlType, "Depth: 1"};
    if (!token.empty()) request.headers.push_back(condition(folder, token));
    const HttpAnswer answer = http_perform(ticket, request);
    if (is_absent(answer) || means_object(answer)) return no_such_object();
    if (!answer.good()) {
      const Outcome problem = outcome(answer, "list");
      // Some find an object's name with a slash too odd to say that there is nothing.
      const bool odd =
          answer.complete() && !problem.transient && answer.status != kHttpUnauthorized;
      if (odd && !folder.empty() && is_object(ticket, folder)) return no_such_object();
      return problem;
    }
    std::vector<DavEntry> all;
    if (answer.status != kMultiStatus || !parse_multistatus(answer.body, url_.host, &all))
      return failure(BACKUP_TRANS_ERROR_SERVER, "list: the server's answer is not a listing");
    const std::string own = url_.path + folder;
    bool is_folder = false;
    for (DavEntry &entry : all) {
      if (entry.path == own || (own.empty() && entry.path == "/")) {
        is_folder = entry.is_collection;
        continue;
      }
      if (entry.path.compare(0, own.size() + 1, own + "/") != 0) continue;
      const std::string name = entry.path.substr(own.size() + 1);
      if (is_temporary_name(name)) {
        *has_temporary = true;
        continue;
      }
      entry.path = folder + "/" + name;
      if (is_object_path(entry.path.c_str()) && name.find('/') == std::string::npos)
        entries->push_back(std::move(entry));
    }
    return is_folder ? success() : no_such_object();
  }

  // Also when it is below one.
  bool is_object(Ticket &ticket, std::string path) {
    for (; !path.empty(); path = parent_of(path)) {
      if (http_perform(ticket, request_for("HEAD", path)).good()) return true;
    }
    return false;
  }

  static bool means_object(const HttpAnswer &answer) {
    return answer.complete() &&
           (answer.status / 100 == 3 || answer.status == kHttpMethodNotAllowed);
  }

  // Folders that hold nothing vanish, from the innermost outwards, while nobody can put
  // something into them.
  void prune(Ticket &ticket, std::string folder) {
    for (; !folder.empty(); folder = parent_of(folder)) {
      std::string token;
      if (!lock(ticket, folder, &token).ok() || token.empty()) return;
      std::vector<DavEntry> entries;
      bool has_temporary = false;
      const Outcome found = children_of(ticket, folder, "", &entries, &has_temporary);
      if (!found.ok() || !entries.empty() || has_temporary) {
        unlock(folder, token);
        return;
      }
      forget(folder);
      HttpRequest request = request_for("DELETE", folder + "/");
      request.headers = {condition(folder, token)};
      if (!http_perform(ticket, request).good()) {
        unlock(folder, token);
        return;
      }
    }
  }

  // Also after a cancellation, therefore with a ticket of its own.
  void tidy_up(const Uploaded &left) {
    Ticket own;
    if (!left.temporary.empty()) {
      HttpRequest request = request_for("DELETE", left.temporary);
      request.seconds = kTidyUpSeconds;
      if (!http_perform(own, request).complete()) return;
    }
    prune(own, left.made_folder);
  }

  const StoreUrl url_;
  const std::string user_;
  const std::string password_;
  const std::string ca_file_;
  std::mutex mutex_;
  std::set<std::string> known_;  // folders that were seen or made
};

}  // namespace

std::shared_ptr<Backend> make_webdav_backend(const StoreUrl &url, const Config &config) {
  return std::make_shared<WebdavBackend>(url, config);
}

}  // namespace transport
