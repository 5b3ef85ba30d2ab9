#include "webdav/backend_webdav.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <deque>
#include <functional>
#include <mutex>
#include <set>

#include "core/remote_path.h"
#include "webdav/dav_client.h"
#include "webdav/dav_place.h"

namespace transport {
namespace {

using Found = DavPlace::Found;
using Next = DavPlace::Next;

constexpr int64_t kMillisecondsPerSecond = 1000;
constexpr std::size_t kMaxKnownFolders = 4096;
// So often does a server that takes empty objects refuse one until it counts as full.
constexpr int kRefusalsOfAFullStore = 3;
// So often does a condition fail that should hold until it counts as a conflict.
constexpr int kFailuresOfAConflict = 3;
// So many temporary objects that could not be deleted are remembered.
constexpr std::size_t kMaxLeftovers = 64;
// What an upload in place replaces is kept up to this size, to be put back.
constexpr uint64_t kMaxKeptBytes = 1024 * 1024;
// An upload cannot end with what is said of objects that are asked for.
Outcome of_upload(Outcome outcome) {
  if (outcome.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) outcome.code = BACKUP_TRANS_ERROR_SERVER;
  return outcome;
}

// What an upload has done so far; what is not moved to its place, or not whole there, is deleted.
struct Uploaded {
  explicit Uploaded(std::function<void(const Uploaded &)> give_up) : give_up_(std::move(give_up)) {}
  Uploaded(const Uploaded &) = delete;
  Uploaded &operator=(const Uploaded &) = delete;
  ~Uploaded() { give_up(); }

  void give_up() {
    if (!temporary.empty() || !made_folder.empty() || place) give_up_(*this);
    settle();
  }
  void settle() {
    temporary.clear();
    made_folder.clear();
    place.reset();
    answered = false;
    complete = false;
    move_asked = false;
  }

  std::string temporary;    // that may lie there
  std::string made_folder;  // to go again when nothing comes to lie in it
  bool answered = false;    // the server has come to an end with it
  bool complete = false;
  bool move_asked = false;
  bool is_immovable = false;
  bool was_lost = false;         // its folder was deleted before it was moved
  int refusals = 0;              // of content where there was room for a name
  int failed_preconditions = 0;  // that should have held

  std::optional<DavPlace> place;  // where a part of the content may lie

 private:
  std::function<void(const Uploaded &)> give_up_;
};

// What has to be so for a move to be done.
struct Conditions {
  std::string header;
  bool overwrite = true;
};

// Where an upload's bytes go, and what has to be so.
struct Destination {
  std::string path;
  std::string lock;       // the header that proves it; may be empty
  std::string condition;  // on what lies there; may be empty
};

// The lock on a folder; without a token where the server has none.
struct HeldLock {
  std::string token;
  RetryClock::Point until;  // it lasts, unless somebody takes it away
};

// What the server has shown of its moves.
enum class Moving { unknown, done, refused };

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
    if (!attempt.memory.has_value()) {
      attempt.memory = std::make_shared<Uploaded>([this](const Uploaded &left) { tidy_up(left); });
    }
    const auto uploaded = std::any_cast<std::shared_ptr<Uploaded>>(attempt.memory);
    const bool may_move = moving_ != Moving::refused;
    if (!uploaded->complete) sweep(attempt.ticket);
    Outcome result;
    if (may_move) result = put_and_move(attempt.ticket, upload, uploaded.get());
    if (!may_move || uploaded->is_immovable)
      result = put_in_place(attempt.ticket, upload, uploaded.get());
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
      prune(attempt.ticket, parent_of(folder));
      return success();
    }
    if (!result.ok()) return result;
    forget(folder);
    const HttpAnswer answer = client_.send(attempt.ticket, "DELETE", folder + "/");
    if (has_status(answer, kHttpLocked)) look_at_lock(attempt.ticket, folder);
    if (has_status(answer, kHttpMultiStatus))
      return failure(BACKUP_TRANS_ERROR_SERVER, "delete: the server kept a part of the folder");
    if (!is_absent(answer) && !answer.good()) return dav_outcome(answer, "delete");
    prune(attempt.ticket, parent_of(folder));
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
    if (!answer.good() || folder.empty() || is_known(folder)) return success();
    const Outcome looked = client_.find_folder(ticket, folder, &has_folder);
    if (has_folder) remember(folder);
    *found = has_folder;
    return looked;
  }

  Outcome put_and_move(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
    if (!uploaded->complete) {
      uploaded->give_up();
      const std::string temporary = parent_of(upload.path) + "/" + make_temporary_name();
      const Outcome sent = send(ticket, upload, uploaded, {temporary, "", ""});
      if (!sent.ok()) return sent;
      uploaded->complete = true;
    }
    return upload.basis == nullptr ? move_plainly(ticket, upload, uploaded)
                                   : move_locked(ticket, upload, uploaded);
  }

  // Puts the bytes where they are wanted and makes sure that they all arrived.
  Outcome send(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
               const Destination &destination) {
    const std::string folder = parent_of(destination.path);
    Outcome result = ensure_folder(ticket, folder, uploaded);
    if (!result.ok()) return result;
    HttpAnswer answer = put(ticket, upload, uploaded, destination);
    const bool folder_gone = has_status(answer, kHttpNotFound) ||
                             has_status(answer, kHttpConflict) ||
                             has_status(answer, kHttpServerError);
    bool is_there = folder.empty();
    if (folder_gone && !is_there) {
      result = client_.find_folder(ticket, folder, &is_there);
      if (!result.ok()) return result;
    }
    if (folder_gone && !is_there) {
      // Another device has deleted what was known.
      forget("");
      result = ensure_folder(ticket, folder, uploaded);
      if (!result.ok()) return result;
      answer = put(ticket, upload, uploaded, destination);
    }
    if (!answer.good()) return refused(ticket, upload, uploaded, destination, answer);
    if (!upload.source.unchanged()) {
      if (uploaded->place) uploaded->place->spoil();
      return failure(BACKUP_TRANS_ERROR_LOCAL_FILE, "the local file changed while it was sent");
    }
    answer = client_.send(ticket, "HEAD", destination.path);
    if (!answer.good()) {
      result = dav_outcome(answer, "upload");
      return result.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT ? again("upload: it did not last")
                                                              : result;
    }
    const bool arrived = uploaded->place ? uploaded->place->arrived(ticket, answer)
                                         : has_size(answer, upload.source.size());
    return arrived ? success() : again("upload: it arrived incomplete");
  }

  HttpAnswer put(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                 const Destination &destination) {
    HttpRequest request = client_.request_for("PUT", destination.path);
    request.has_body = true;
    request.body_fd = upload.source.fd();
    request.body_size = upload.source.size();
    request.headers = {
        "Content-Type: " + upload.content_type,
        "X-OC-Mtime: " + std::to_string(upload.timestamp_ms / kMillisecondsPerSecond)};
    for (const std::string &header : {destination.lock, destination.condition}) {
      if (!header.empty()) request.headers.push_back(header);
    }
    if (destination.path != upload.path) uploaded->temporary = destination.path;
    uploaded->answered = false;
    HttpAnswer answer = http_perform(ticket, request);
    uploaded->answered = answer.complete();
    if (uploaded->place) uploaded->place->sent(answer.complete());
    if (has_status(answer, kHttpLocked)) look_at_lock(ticket, parent_of(destination.path));
    return answer;
  }

  // Few servers say that their disk is full. One that takes an object without content and
  // refuses the content again and again has no room for it.
  Outcome refused(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                  const Destination &destination, const HttpAnswer &answer) const {
    const Outcome result = outcome_under(destination.lock, answer);
    const bool unclear =
        has_status(answer, kHttpServerError) || has_status(answer, kHttpMethodNotAllowed);
    if (!unclear || upload.source.size() == 0) return result;
    if (uploaded->temporary.empty())
      uploaded->temporary = parent_of(destination.path) + "/" + make_temporary_name();
    HttpRequest request = client_.request_for("PUT", uploaded->temporary);
    request.has_body = true;
    if (!destination.lock.empty()) request.headers = {destination.lock};
    if (!http_perform(ticket, request).good()) return result;
    if (++uploaded->refusals < kRefusalsOfAFullStore) return again(result.message);
    return failure(BACKUP_TRANS_ERROR_QUOTA, result.message + ", as if its disk was full");
  }

  Outcome move(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
               const Conditions &conditions) {
    HttpRequest request = client_.request_for("MOVE", uploaded->temporary);
    request.headers = {"Destination: " + client_.url_of(upload.path),
                       conditions.overwrite ? "Overwrite: T" : "Overwrite: F"};
    if (!conditions.header.empty()) request.headers.push_back(conditions.header);
    uploaded->move_asked = true;
    const HttpAnswer answer = http_perform(ticket, request);
    if (has_status(answer, kHttpMultiStatus))
      return failure(BACKUP_TRANS_ERROR_SERVER, "upload: the server did not move it");
    if (answer.good()) {
      moving_ = Moving::done;
      return success();
    }
    Outcome result = outcome_under(conditions.header, answer);
    // What has moved something before can do it.
    if (is_unsupported(answer) && moving_ != Moving::done) {
      const Outcome looked = look_for_folder(ticket, upload.path);
      if (!looked.ok()) return looked;
      moving_ = Moving::refused;
      uploaded->is_immovable = true;
      return result;
    }
    if (is_absent(answer) || has_status(answer, kHttpConflict)) {
      const Outcome looked = look_for_folder(ticket, upload.path);
      if (!looked.ok()) return looked;
      return start_over(std::move(result), uploaded);
    }
    return result;
  }

  // The folder was deleted, and what had been sent with it; not again and again.
  Outcome start_over(Outcome result, Uploaded *uploaded) {
    forget("");
    result.transient = !uploaded->was_lost;
    uploaded->was_lost = true;
    if (uploaded->complete) uploaded->give_up();
    return of_upload(result);
  }

  // To most servers a folder in the object's place is a thing that may be replaced with everything
  // in it, and some put the object into it.
  Outcome move_plainly(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
    bool done = false;
    Outcome result = look_at_move(ticket, upload, uploaded, &done);
    if (!result.ok() || done) return result;
    Conditions conditions;
    conditions.overwrite = false;
    result = move(ticket, upload, uploaded, conditions);
    if (result.code == BACKUP_TRANS_ERROR_CONFLICT) {
      uploaded->move_asked = false;
      result = look_for_folder(ticket, upload.path);
      if (!result.ok()) return result;
      conditions.overwrite = true;
      return move(ticket, upload, uploaded, conditions);
    }
    // What lies alone in a new folder came to lie where it should.
    const std::string &made = uploaded->made_folder;
    if (!result.ok() || (!made.empty() && made == parent_of(upload.path))) return result;
    const HttpAnswer moved = client_.send(ticket, "HEAD", upload.path);
    if (moved.good() && has_size(moved, upload.source.size())) return result;
    if (!moved.complete()) return moved.problem;
    bool is_folder = false;
    result = client_.find_folder(ticket, upload.path, &is_folder);
    if (!result.ok()) return result;
    if (!is_folder) return of_upload(dav_outcome(moved, "upload"));
    client_.delete_pieces(ticket, upload.path, upload.path + "/" + name_of(uploaded->temporary));
    return folder_in_its_place();
  }

  // To be sure that there is none in the object's place.
  Outcome look_for_folder(Ticket &ticket, const std::string &path) const {
    bool found = false;
    const Outcome looked = client_.find_folder(ticket, path, &found);
    return found ? folder_in_its_place() : looked;
  }

  static Outcome folder_in_its_place() {
    return failure(BACKUP_TRANS_ERROR_SERVER, "upload: there is a folder in its place");
  }

  // What became of an earlier attempt's move, whose answer was lost or an error, which does not
  // tell whether it was done. One that was not is asked for again like the first one: meanwhile
  // another device may have been there.
  Outcome look_at_move(Ticket &ticket, const Upload &upload, Uploaded *uploaded, bool *done) const {
    if (!uploaded->move_asked) return success();
    const HttpAnswer left = client_.send(ticket, "HEAD", uploaded->temporary);
    if (is_absent(left)) {
      *done = true;
      return find_moved(ticket, upload, uploaded);
    }
    if (!left.good()) return dav_outcome(left, "upload");
    uploaded->move_asked = false;
    return success();
  }

  Outcome find_moved(Ticket &ticket, const Upload &upload, Uploaded *uploaded) const {
    if (upload.basis != nullptr) {
      // Another device may have replaced it since, which nobody can tell from its never having
      // been there.
      Version present;
      const Outcome found = read_version(ticket, upload.path, &present, nullptr);
      if (!found.ok()) return found;
      return present == version_of(upload.source)
                 ? success()
                 : failure(BACKUP_TRANS_ERROR_CONFLICT, "the object changed since it was read");
    }
    const HttpAnswer moved = client_.send(ticket, "HEAD", upload.path);
    if (moved.good() && has_size(moved, upload.source.size())) return success();
    if (!moved.good() && !is_absent(moved)) return dav_outcome(moved, "upload");
    uploaded->settle();
    return again("upload: it did not last");
  }

  // The comparison and the move happen while nobody else may change the folder.
  Outcome move_locked(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
    return while_locked(ticket, parent_of(upload.path), uploaded, [&](const HeldLock &lock) {
      return move_if_unchanged(ticket, upload, uploaded, lock);
    });
  }

  Outcome while_locked(Ticket &ticket, const std::string &folder, Uploaded *uploaded,
                       const std::function<Outcome(const HeldLock &lock)> &step) {
    HeldLock lock;
    lock.until = http_now() + kLockDuration;
    Outcome result = client_.lock(ticket, folder, &lock.token);
    if (result.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) return start_over(result, uploaded);
    if (!result.ok()) {
      forget("");
      if (result.transient) look_at_lock(ticket, folder);
      return result;
    }
    result = step(lock);
    client_.unlock(folder, lock.token);
    return result;
  }

  // Not every server looks at the proof of a lock that has ended.
  static Outcome check_lock(const HeldLock &lock) {
    const bool ended = !lock.token.empty() && http_now() >= lock.until;
    return ended ? again("upload: the lock has ended") : success();
  }

  // A condition that does not hold. Where it is the proof of a lock on the folder, some say that
  // this is what the rest depended on.
  static Outcome outcome_under(const std::string &condition, const HttpAnswer &answer) {
    Outcome result = of_upload(dav_outcome(answer, "upload"));
    if (has_status(answer, kHttpFailedDependency) && !condition.empty())
      result.code = BACKUP_TRANS_ERROR_CONFLICT;
    return result;
  }

  Outcome move_if_unchanged(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                            const HeldLock &lock) {
    const std::string &token = lock.token;
    bool done = false;
    Outcome result = look_at_move(ticket, upload, uploaded, &done);
    if (!result.ok() || done) return result;
    std::string tag;
    result = compare_basis(ticket, upload, &tag);
    if (!result.ok()) return result;
    Conditions conditions;
    conditions.overwrite = upload.basis->has_value();
    // Where there is no lock, the server may be able to compare at the last moment.
    if (!token.empty())
      conditions.header = client_.lock_condition(parent_of(upload.path), token);
    else if (!tag.empty() && uploaded->failed_preconditions == 0)
      conditions.header = client_.tag_condition(upload.path, tag);
    result = check_lock(lock);
    if (!result.ok()) return result;
    result = move(ticket, upload, uploaded, conditions);
    if (result.code != BACKUP_TRANS_ERROR_CONFLICT || !uploaded->complete) return result;
    uploaded->move_asked = false;
    return explain_refusal(ticket, upload, uploaded, result);
  }

  // Nothing was done. Either the object is another one now, or the condition was not as it should
  // be: a lock that ended, a tag that means nothing.
  Outcome explain_refusal(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                          const Outcome &result) const {
    const Outcome compared = compare_basis(ticket, upload, nullptr);
    if (!compared.ok()) return compared;
    if (++uploaded->failed_preconditions >= kFailuresOfAConflict) return result;
    return again(result.message);
  }

  // A server that cannot move gets the bytes where they belong. One that is cut off may keep a part
  // of them there, which is looked for, and does not stay.
  Outcome put_in_place(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
    drop_temporary(uploaded);
    if (upload.basis == nullptr) return replace_plainly(ticket, upload, uploaded);
    const std::string folder = parent_of(upload.path);
    const Outcome result = ensure_folder(ticket, folder, uploaded);
    if (!result.ok()) return result;
    return while_locked(ticket, folder, uploaded, [&](const HeldLock &lock) {
      return replace_if_unchanged(ticket, upload, uploaded, lock);
    });
  }

  void drop_temporary(Uploaded *uploaded) {
    Ticket own;
    if (!uploaded->temporary.empty()) delete_temporary(own, *uploaded);
    uploaded->temporary.clear();
    uploaded->complete = false;
    uploaded->move_asked = false;
  }

  Outcome replace_plainly(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
    Found found = Found::nothing;
    const Outcome looked = look_at_earlier(ticket, upload, *uploaded, &found);
    if (!looked.ok() || found == Found::whole) return looked;
    // A part of it does not become what was there before.
    if (found != Found::part) {
      const Outcome noted = note_place(ticket, upload, uploaded);
      if (!noted.ok()) return noted;
    }
    return send(ticket, upload, uploaded, {upload.path, "", ""});
  }

  Outcome replace_if_unchanged(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                               const HeldLock &lock) {
    const std::string &token = lock.token;
    Destination destination{upload.path, "", ""};
    if (!token.empty()) destination.lock = client_.lock_condition(parent_of(upload.path), token);
    Found found = Found::nothing;
    Outcome result = look_at_earlier(ticket, upload, *uploaded, &found);
    if (!result.ok() || found == Found::whole) return result;
    if (found == Found::part)
      result = uploaded->place->mend(destination.lock, Next::another_attempt);
    if (result.ok()) result = note_place(ticket, upload, uploaded);
    if (!result.ok()) return result;
    std::string tag;
    std::optional<std::string> content;
    result = compare_basis(ticket, upload, &tag, &content);
    if (!result.ok()) return result;
    uploaded->place->keep(std::move(content));
    // A condition on what the request is for is known to more servers than the lock's header.
    if (!upload.basis->has_value())
      destination.condition = "If-None-Match: *";
    else if (token.empty() && !tag.empty() && uploaded->failed_preconditions == 0)
      destination.condition = "If-Match: " + tag;
    result = check_lock(lock);
    if (!result.ok()) return result;
    result = send(ticket, upload, uploaded, destination);
    if (result.ok()) return result;
    if (result.code == BACKUP_TRANS_ERROR_CONFLICT)
      return explain_refusal(ticket, upload, uploaded, result);
    // Nobody shall see a part of it once the lock is gone. What cannot be mended now is looked at by
    // the next attempt; this one ends with what was in its way.
    static_cast<void>(uploaded->place->mend(destination.lock, Next::another_attempt));
    return result;
  }

  // What an earlier attempt that seemed to fail has brought about.
  static Outcome look_at_earlier(Ticket &ticket, const Upload &upload, const Uploaded &uploaded,
                                 Found *found) {
    if (!uploaded.place) return success();
    const Outcome looked = uploaded.place->look(ticket, found);
    if (!looked.ok() || *found != Found::whole || upload.source.unchanged())
      return of_upload(looked);
    return failure(BACKUP_TRANS_ERROR_LOCAL_FILE, "the local file changed while it was sent");
  }

  // From here on a part of the content may come to lie in the object's place.
  Outcome note_place(Ticket &ticket, const Upload &upload, Uploaded *uploaded) const {
    const Outcome looked = look_for_folder(ticket, upload.path);
    if (!looked.ok()) return looked;
    DavPlace place(client_, upload.path, upload.source);
    const Outcome noted = place.note(ticket);
    if (noted.ok()) uploaded->place.emplace(std::move(place));
    return noted;
  }

  // The version of what is there now, its tag where that can be relied on, and its content where
  // that is small.
  Outcome read_version(Ticket &ticket, const std::string &path, Version *version, std::string *tag,
                       std::optional<std::string> *content = nullptr) const {
    std::string kept;
    Checksum checksum(G_CHECKSUM_SHA256);
    HttpRequest request = client_.request_for("GET", path);
    request.sink = [&](const char *data, std::size_t size) {
      checksum.add(data, size);
      if (content != nullptr && kept.size() <= kMaxKeptBytes) kept.append(data, size);
      return true;
    };
    const HttpAnswer answer = http_perform(ticket, request);
    version->reset();
    if (content != nullptr) content->reset();
    if (!answer.good()) return is_absent(answer) ? success() : dav_outcome(answer, "upload");
    *version = checksum.hex();
    if (tag != nullptr) *tag = strong_tag(answer);
    if (content != nullptr && kept.size() <= kMaxKeptBytes) *content = std::move(kept);
    return success();
  }

  static Version version_of(const LocalSource &source) {
    Checksum checksum(G_CHECKSUM_SHA256);
    std::array<char, 64 * 1024> buffer{};
    for (off_t at = 0;;) {
      const ssize_t got = pread(source.fd(), buffer.data(), buffer.size(), at);
      if (got < 0 && errno == EINTR) continue;
      if (got <= 0) return checksum.hex();
      checksum.add(buffer.data(), static_cast<std::size_t>(got));
      at += got;
    }
  }

  Outcome compare_basis(Ticket &ticket, const Upload &upload, std::string *tag,
                        std::optional<std::string> *content = nullptr) const {
    Version present;
    const Outcome found = read_version(ticket, upload.path, &present, tag, content);
    if (!found.ok() || present == *upload.basis) return found;
    return failure(BACKUP_TRANS_ERROR_CONFLICT, "the object changed since it was read");
  }

  Outcome ensure_folder(Ticket &ticket, const std::string &folder, Uploaded *uploaded) {
    if (is_known(folder)) return success();
    HttpAnswer answer =
        folder.empty() ? client_.make_top(ticket) : client_.send(ticket, "MKCOL", folder + "/");
    if ((has_status(answer, kHttpConflict) || is_absent(answer)) && !folder.empty()) {
      const Outcome parent = ensure_folder(ticket, parent_of(folder), uploaded);
      if (!parent.ok()) return parent;
      answer = client_.send(ticket, "MKCOL", folder + "/");
    }
    if (has_status(answer, kHttpLocked)) look_at_lock(ticket, parent_of(folder));
    // An answer that did not come does not tell that it was not made.
    if (!answer.complete() || has_status(answer, kHttpCreated)) uploaded->made_folder = folder;
    if (!answer.complete()) return answer.problem;
    if (!answer.good()) {
      const Outcome there = find_folder(ticket, folder, answer);
      if (!there.ok()) return there;
    }
    remember(folder);
    return success();
  }

  // A folder that could not be made is there already, or somebody else made it at the same time,
  // which may be answered with any error.
  Outcome find_folder(Ticket &ticket, const std::string &folder, const HttpAnswer &answer) {
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

  // Some servers keep the lock of a device that died for ever. One that was seen for longer than it
  // can have been held is taken away.
  void look_at_lock(Ticket &ticket, const std::string &folder) {
    DavLock lock;
    if (!client_.find_foreign_lock(ticket, folder, &lock)) return;
    {
      const std::lock_guard<std::mutex> guard(mutex_);
      const auto now = std::chrono::steady_clock::now();
      if (lock.token != seen_lock_) {
        seen_lock_ = lock.token;
        lock_seen_at_ = now;
        return;
      }
      if (now - lock_seen_at_ <= kLockDuration) return;
      seen_lock_.clear();
    }
    client_.break_lock(ticket, folder, lock);
  }

  bool is_known(const std::string &folder) {
    const std::lock_guard<std::mutex> guard(mutex_);
    return known_.count(folder) != 0;
  }

  void remember(const std::string &folder) {
    const std::lock_guard<std::mutex> guard(mutex_);
    if (known_.size() >= kMaxKnownFolders) known_.clear();
    known_.insert(folder);
  }

  // What is not known to be there any more: @p folder and everything in it; "" is everything.
  void forget(const std::string &folder) {
    const std::lock_guard<std::mutex> guard(mutex_);
    for (auto it = known_.begin(); it != known_.end();) {
      const bool inside = *it == folder || it->compare(0, folder.size() + 1, folder + "/") == 0;
      it = inside ? known_.erase(it) : std::next(it);
    }
  }

  // Folders that hold nothing vanish, from the innermost outwards, while nobody can put
  // something into them.
  void prune(Ticket &ticket, std::string folder) {
    while (!folder.empty() && is_empty(ticket, folder) && prune_one(ticket, folder))
      folder = parent_of(folder);
  }

  bool is_empty(Ticket &ticket, const std::string &folder) const {
    DavListing listing;
    return client_.list(ticket, folder, &listing).ok() && listing.children.empty() &&
           !listing.has_others;
  }

  bool prune_one(Ticket &ticket, const std::string &folder) {
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

  // Also after a cancellation, therefore with a ticket of its own.
  void tidy_up(const Uploaded &left) {
    Ticket own;
    if (!left.temporary.empty() && !delete_temporary(own, left)) return;
    if (left.place && !left.place->mend("", Next::nothing).ok()) return;
    if (!left.made_folder.empty()) prune(own, left.made_folder);
  }

  HttpRequest deletion_of(const std::string &temporary) const {
    HttpRequest request = client_.request_for("DELETE", temporary);
    request.seconds = kTidyUpSeconds;
    return request;
  }

  // Returns whether the server can be spoken to.
  bool delete_temporary(Ticket &ticket, const Uploaded &left) {
    const HttpRequest request = deletion_of(left.temporary);
    HttpAnswer answer = http_perform(ticket, request);
    for (const std::chrono::milliseconds pause : kTidyUpPauses) {
      // What was cut off may come to lie there after it was looked for.
      const bool may_come = is_absent(answer) && !left.answered;
      if (!answer.complete() || answer.good() || (is_absent(answer) && !may_come)) break;
      http_pause(ticket, pause);
      answer = http_perform(ticket, request);
    }
    if (answer.complete() && left.answered && !left.complete)
      client_.delete_pieces(ticket, parent_of(left.temporary), left.temporary);
    if (!answer.complete()) remember_leftover(left.temporary);
    return answer.complete();
  }

  // Those of a connection that was just lost come first: what is tried after that leaves no more.
  void remember_leftover(const std::string &temporary) {
    const std::lock_guard<std::mutex> guard(mutex_);
    if (leftovers_.size() < kMaxLeftovers) leftovers_.push_back(temporary);
  }

  // "" when there is none.
  std::string next_leftover() {
    const std::lock_guard<std::mutex> guard(mutex_);
    if (leftovers_.empty()) return "";
    std::string temporary = std::move(leftovers_.front());
    leftovers_.pop_front();
    return temporary;
  }

  // Delete what could not be deleted when it should have been, once the server answers again.
  void sweep(Ticket &ticket) {
    std::set<std::string> folders;
    for (std::string left = next_leftover(); !left.empty(); left = next_leftover()) {
      const HttpAnswer answer = http_perform(ticket, deletion_of(left));
      if (!answer.complete() || dav_outcome(answer, "delete").transient) {
        remember_leftover(left);
        return;
      }
      folders.insert(parent_of(left));
    }
    for (const std::string &folder : folders) prune(ticket, folder);
  }

  const DavClient client_;
  std::atomic<Moving> moving_{Moving::unknown};
  std::mutex mutex_;
  std::set<std::string> known_;        // folders that were seen or made
  std::deque<std::string> leftovers_;  // temporary objects that may still lie there
  std::string seen_lock_;              // the last one that was in the way
  std::chrono::steady_clock::time_point lock_seen_at_;
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
