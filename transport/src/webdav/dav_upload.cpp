#include "webdav/dav_upload.h"

#include <any>
#include <array>
#include <memory>
#include <set>

#include "core/file_bytes.h"
#include "core/remote_path.h"

namespace transport {
namespace {

using Next = DavPlace::Next;

constexpr int64_t kMillisecondsPerSecond = 1000;
// So often does a server that takes empty objects refuse one until it counts as full.
constexpr int kRefusalsOfAFullStore = 3;
// So often does a condition fail that should hold until it counts as a conflict.
constexpr int kFailuresOfAConflict = 3;
// What an upload in place replaces is kept up to this size, to be put back.
constexpr uint64_t kMaxKeptBytes = 1024 * 1024;

}  // namespace

Outcome DavUploads::attempt(Attempt &attempt, const Upload &upload) {
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
  if (result.ok()) uploaded->settle();
  return result;
}

// Puts the bytes where they are wanted and makes sure that they all arrived.
Outcome DavUploads::send(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                         const Destination &destination) {
  const std::string folder = parent_of(destination.path);
  Outcome result = folders_.ensure(ticket, folder, &uploaded->made_folder);
  if (!result.ok()) return result;
  HttpAnswer answer = put(ticket, upload, uploaded, destination);
  const bool folder_gone = has_status(answer, kHttpNotFound) || has_status(answer, kHttpConflict) ||
                           has_status(answer, kHttpServerError);
  bool is_there = folder.empty();
  if (folder_gone && !is_there) {
    result = client_.find_folder(ticket, folder, &is_there);
    if (!result.ok()) return result;
  }
  if (folder_gone && !is_there) {
    // Another device has deleted what was known.
    folders_.forget("");
    result = folders_.ensure(ticket, folder, &uploaded->made_folder);
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

HttpAnswer DavUploads::put(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                           const Destination &destination) {
  HttpRequest request = client_.request_for("PUT", destination.path);
  request.has_body = true;
  request.body_fd = upload.source.fd();
  request.body_size = upload.source.size();
  request.headers = {"Content-Type: " + upload.content_type,
                     "X-OC-Mtime: " + std::to_string(upload.timestamp_ms / kMillisecondsPerSecond)};
  for (const std::string &header : {destination.lock, destination.condition}) {
    if (!header.empty()) request.headers.push_back(header);
  }
  if (destination.path != upload.path) uploaded->temporary = destination.path;
  uploaded->answered = false;
  HttpAnswer answer = http_perform(ticket, request);
  uploaded->answered = answer.complete();
  if (uploaded->place) uploaded->place->sent(answer.complete());
  if (has_status(answer, kHttpLocked)) locks_.look(ticket, parent_of(destination.path));
  return answer;
}

// Few servers say that their disk is full. One that takes an object without content and
// refuses the content again and again has no room for it.
Outcome DavUploads::refused(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
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

// A condition that does not hold. Where it is the proof of a lock on the folder, some say that
// this is what the rest depended on.
Outcome DavUploads::outcome_under(const std::string &condition, const HttpAnswer &answer) {
  Outcome result = of_upload(dav_outcome(answer, "upload"));
  if (has_status(answer, kHttpFailedDependency) && !condition.empty())
    result.code = BACKUP_TRANS_ERROR_CONFLICT;
  return result;
}

// The folder was deleted, and what had been sent with it; not again and again.
Outcome DavUploads::start_over(Outcome result, Uploaded *uploaded) {
  folders_.forget("");
  result.transient = !uploaded->was_lost;
  uploaded->was_lost = true;
  if (uploaded->complete) uploaded->give_up();
  return of_upload(result);
}

// To be sure that there is none in the object's place.
Outcome DavUploads::look_for_folder(Ticket &ticket, const std::string &path) const {
  bool found = false;
  const Outcome looked = client_.find_folder(ticket, path, &found);
  return found ? folder_in_its_place() : looked;
}

Outcome DavUploads::folder_in_its_place() {
  return failure(BACKUP_TRANS_ERROR_SERVER, "upload: there is a folder in its place");
}

Outcome DavUploads::while_locked(Ticket &ticket, const std::string &folder, Uploaded *uploaded,
                                 const std::function<Outcome(const HeldLock &lock)> &step) {
  HeldLock lock;
  lock.until = http_now() + kLockDuration;
  Outcome result = client_.lock(ticket, folder, &lock.token);
  if (result.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) return start_over(result, uploaded);
  if (!result.ok()) {
    folders_.forget("");
    if (result.transient) locks_.look(ticket, folder);
    return result;
  }
  result = step(lock);
  client_.unlock(folder, lock.token);
  return result;
}

// Nothing was done. Either the object is another one now, or the condition was not as it should
// be: a lock that ended, a tag that means nothing.
Outcome DavUploads::explain_refusal(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                                    const Outcome &result) const {
  const Outcome compared = compare_basis(ticket, upload, nullptr);
  if (!compared.ok()) return compared;
  if (++uploaded->failed_preconditions >= kFailuresOfAConflict) return result;
  return again(result.message);
}

// The version of what is there now, its tag where that can be relied on, and its content where
// that is small.
Outcome DavUploads::read_version(Ticket &ticket, const std::string &path, Version *version,
                                 std::string *tag, std::optional<std::string> *content) const {
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

Version DavUploads::version_of(const LocalSource &source) {
  Checksum checksum(G_CHECKSUM_SHA256);
  std::array<char, 64 * 1024> buffer{};
  for (off_t at = 0;;) {
    const ssize_t got = read_at(source.fd(), buffer.data(), buffer.size(), at);
    if (got <= 0) return checksum.hex();
    checksum.add(buffer.data(), static_cast<std::size_t>(got));
    at += got;
  }
}

Outcome DavUploads::compare_basis(Ticket &ticket, const Upload &upload, std::string *tag,
                                  std::optional<std::string> *content) const {
  Version present;
  const Outcome found = read_version(ticket, upload.path, &present, tag, content);
  if (!found.ok() || present == *upload.basis) return found;
  return failure(BACKUP_TRANS_ERROR_CONFLICT, "the object changed since it was read");
}

// Also after a cancellation, therefore with a ticket of its own.
void DavUploads::tidy_up(const Uploaded &left) {
  Ticket own;
  if (!left.temporary.empty() && !delete_temporary(own, left)) return;
  if (left.place && !left.place->mend("", Next::nothing).ok()) return;
  if (!left.made_folder.empty()) folders_.prune(own, left.made_folder);
}

HttpRequest DavUploads::deletion_of(const std::string &temporary) const {
  HttpRequest request = client_.request_for("DELETE", temporary);
  request.seconds = kTidyUpSeconds;
  return request;
}

// Returns whether the server can be spoken to.
bool DavUploads::delete_temporary(Ticket &ticket, const Uploaded &left) {
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
  if (!answer.complete()) leftovers_.remember(left.temporary);
  return answer.complete();
}

// Delete what could not be deleted when it should have been, once the server answers again.
void DavUploads::sweep(Ticket &ticket) {
  std::set<std::string> folders;
  for (std::string left = leftovers_.take(); !left.empty(); left = leftovers_.take()) {
    const HttpAnswer answer = http_perform(ticket, deletion_of(left));
    if (!answer.complete() || dav_outcome(answer, "delete").transient) {
      leftovers_.remember(left);
      return;
    }
    folders.insert(parent_of(left));
  }
  for (const std::string &folder : folders) folders_.prune(ticket, folder);
}

}  // namespace transport
