#include "webdav/dav_client.h"

#include <algorithm>
#include <optional>

#include "core/remote_path.h"
#include "http/http_date.h"

namespace transport {
namespace {

constexpr int64_t kLeftoverSeconds = 24L * 60 * 60;
// So many of them go with one listing: whoever names more than uploads leave is not believed.
constexpr int kMaxSwept = 64;
constexpr int kRedirection = 3;
constexpr int kUnlockAttempts = 2;
constexpr int kStatusClass = 100;
constexpr char kStoredDot[] = "%2E";
constexpr char kStoredPercent[] = "%25";
constexpr std::size_t kStoredBytes = sizeof kStoredDot - 1;

constexpr char kPropfind[] =
    "<?xml version=\"1.0\" encoding=\"utf-8\"?>"
    "<d:propfind xmlns:d=\"DAV:\"><d:prop><d:resourcetype/><d:getcontentlength/>"
    "<d:getlastmodified/></d:prop></d:propfind>";
constexpr char kFindLocks[] =
    "<?xml version=\"1.0\" encoding=\"utf-8\"?>"
    "<d:propfind xmlns:d=\"DAV:\"><d:prop><d:lockdiscovery/></d:prop></d:propfind>";
constexpr char kLockInfo[] =
    "<?xml version=\"1.0\" encoding=\"utf-8\"?>"
    "<d:lockinfo xmlns:d=\"DAV:\"><d:lockscope><d:exclusive/></d:lockscope>"
    "<d:locktype><d:write/></d:locktype><d:owner>";
constexpr char kLockInfoEnd[] = "</d:owner></d:lockinfo>";
constexpr char kXmlType[] = "Content-Type: application/xml; charset=utf-8";

// Old enough that nobody is sending it any more, by the server's own clock.
bool is_leftover(const DavEntry &entry, const std::optional<int64_t> &now) {
  return now && entry.modified && *now - *entry.modified > kLeftoverSeconds;
}

// There is no answer yet, or one that does not tell.
bool outcome_is_open(const HttpAnswer &answer) {
  return answer.status == 0 || outcome_of(answer, "").transient;
}

// Some find an object's name with a slash too odd to say that there is nothing.
bool is_odd(const HttpAnswer &answer, const Outcome &problem) {
  return answer.complete() && !problem.transient && answer.status != kHttpUnauthorized;
}

Outcome no_listing(const char *what) {
  return no_store(std::string(what) + ": the server's answer is not a listing");
}

}  // namespace

std::string stored_name(const std::string &name) {
  if (name.empty() || (name[0] != '.' && name[0] != '%')) return name;
  return (name[0] == '.' ? kStoredDot : kStoredPercent) + name.substr(1);
}

std::string name_of_stored(const std::string &stored) {
  const bool dot = stored.compare(0, kStoredBytes, kStoredDot) == 0;
  const bool percent = stored.compare(0, kStoredBytes, kStoredPercent) == 0;
  if (!dot && !percent) return stored;
  return (dot ? "." : "%") + stored.substr(kStoredBytes);
}

std::string stored_path(const std::string &path) {
  std::string stored;
  std::size_t start = 0;
  while (start < path.size()) {
    const std::size_t slash = std::min(path.find('/', start), path.size());
    stored += stored_name(path.substr(start, slash - start));
    if (slash < path.size()) stored += '/';
    start = slash + 1;
  }
  return stored;
}

bool has_status(const HttpAnswer &answer, int status) {
  return answer.complete() && answer.status == status;
}

bool is_unsupported(const HttpAnswer &answer) {
  return has_status(answer, kHttpMethodNotAllowed) || has_status(answer, kHttpNotImplemented);
}

std::string strong_tag(const HttpAnswer &answer) {
  const std::string tag = answer.header("etag");
  return tag.size() > 2 && tag.front() == '"' && tag.back() == '"' ? tag : "";
}

Outcome dav_outcome(const HttpAnswer &answer, const char *what) {
  Outcome result = outcome_of(answer, what);
  if (has_status(answer, kHttpLocked)) result.transient = true;
  return result;
}

Outcome of_upload(Outcome outcome) {
  if (outcome.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) outcome.code = BACKUP_TRANS_ERROR_SERVER;
  return outcome;
}

std::string DavClient::url_of(const std::string &path) const {
  return url_.base + encode_path(stored_path(path));
}

HttpRequest DavClient::request_for(const char *method, const std::string &path) const {
  HttpRequest request;
  request.method = method;
  request.url = url_of(path);
  request.user = user_;
  request.password = password_;
  request.ca_file = ca_file_;
  return request;
}

HttpAnswer DavClient::send(Ticket &ticket, const char *method, const std::string &path) const {
  return http_perform(ticket, request_for(method, path));
}

HttpRequest DavClient::question(const char *body, const std::string &folder,
                                const char *depth) const {
  HttpRequest request = request_for("PROPFIND", folder + "/");
  request.has_body = true;
  request.body = body;
  request.headers = {kXmlType, std::string("Depth: ") + depth};
  return request;
}

HttpAnswer DavClient::propfind(Ticket &ticket, const std::string &folder, const char *depth) const {
  return http_perform(ticket, question(kPropfind, folder, depth));
}

bool DavClient::read_listing(const HttpAnswer &answer, const std::string &folder,
                             DavListing *listing, std::vector<DavEntry> *temporary,
                             bool *is_folder) const {
  std::vector<DavEntry> all;
  bool left_out = false;
  if (!has_status(answer, kHttpMultiStatus) ||
      !parse_multistatus(answer.body, url_.host, &all, &left_out))
    return false;
  listing->has_others = left_out;
  const std::string own = url_.path + stored_path(folder);
  for (DavEntry &entry : all) {
    if (entry.path == own || (own.empty() && entry.path == "/")) {
      *is_folder = entry.is_collection;
      continue;
    }
    if (entry.path.compare(0, own.size() + 1, own + "/") != 0) continue;
    const std::string stored = entry.path.substr(own.size() + 1);
    const std::string name = name_of_stored(stored);
    entry.path = folder + "/" + name;
    if (is_temporary_name(name)) {
      temporary->push_back(std::move(entry));
    } else if (stored.find('/') == std::string::npos && is_object_path(entry.path.c_str())) {
      listing->children.push_back(std::move(entry));
    } else {
      listing->has_others = true;
    }
  }
  return true;
}

Outcome DavClient::list(Ticket &ticket, const std::string &folder, DavListing *listing) const {
  const HttpAnswer answer = propfind(ticket, folder, "1");
  if (is_absent(answer)) return no_such_object();
  if (!answer.good()) {
    const Outcome problem = dav_outcome(answer, "list");
    if (is_odd(answer, problem) && !folder.empty() && is_object(ticket, folder))
      return no_such_object();
    return problem;
  }
  std::vector<DavEntry> temporary;
  bool is_folder = false;
  if (!read_listing(answer, folder, listing, &temporary, &is_folder)) return no_listing("list");
  if (!is_folder) return no_such_object();
  const std::optional<int64_t> now = parse_http_date(answer.header("date"));
  int left = kMaxSwept;
  for (const DavEntry &entry : temporary) {
    bool swept = false;
    if (left > 0 && is_leftover(entry, now)) {
      const HttpAnswer deleted = send(ticket, "DELETE", entry.path);
      swept = deleted.good();
      left = deleted.complete() ? left - 1 : 0;
    }
    listing->has_others = listing->has_others || !swept;
  }
  return success();
}

HttpAnswer DavClient::make_top(Ticket &ticket) const { return make_collection(ticket, url_.path); }

// By its path on the server.
HttpAnswer DavClient::make_collection(Ticket &ticket, const std::string &path) const {
  HttpRequest request = request_for("MKCOL", "/");
  request.url = url_.origin + encode_path(path) + "/";
  const HttpAnswer answer = http_perform(ticket, request);
  const bool lacks_parent = has_status(answer, kHttpConflict) || is_absent(answer);
  if (!lacks_parent || parent_of(path).empty() || !make_collection(ticket, parent_of(path)).good())
    return answer;
  return http_perform(ticket, request);
}

Outcome DavClient::find_folder(Ticket &ticket, const std::string &folder, bool *found) const {
  *found = false;
  const HttpAnswer answer = propfind(ticket, folder, "0");
  if (has_status(answer, kHttpMultiStatus)) {
    DavListing listing;
    std::vector<DavEntry> temporary;
    return read_listing(answer, folder, &listing, &temporary, found)
               ? success()
               : no_listing("look for a folder");
  }
  const Outcome problem = dav_outcome(answer, "look for a folder");
  return is_absent(answer) || is_odd(answer, problem) ? success() : problem;
}

// Also when it is below one.
bool DavClient::is_object(Ticket &ticket, std::string path) const {
  for (; !path.empty(); path = parent_of(path)) {
    if (send(ticket, "HEAD", path).good()) return true;
  }
  return false;
}

Outcome DavClient::lock(Ticket &ticket, const std::string &folder, std::string *token) const {
  HttpRequest request = request_for("LOCK", folder + "/");
  request.has_body = true;
  const std::string owner = make_temporary_name();
  request.body = kLockInfo + owner + kLockInfoEnd;
  request.headers = {kXmlType, "Depth: infinity",
                     "Timeout: Second-" + std::to_string(kLockDuration.count())};
  const HttpAnswer answer = http_perform(ticket, request);
  if (is_unsupported(answer)) return success();
  const bool done = answer.status / kStatusClass == kHttpOk / kStatusClass;
  *token = done ? answer.header("lock-token") : "";
  Outcome result = done && !token->empty() ? success() : dav_outcome(answer, "lock");
  if (has_status(answer, kHttpConflict)) result.code = BACKUP_TRANS_ERROR_NO_SUCH_OBJECT;
  // An answer that was lost, or an error on its way, does not tell that there is no lock now, and
  // ours would keep us out like everybody else.
  const bool unclear = result.transient || ticket.cancelled();
  if (!result.ok() && unclear && !has_status(answer, kHttpLocked))
    *token = find_lock(folder, owner);
  if (ticket.cancelled()) {
    unlock(folder, *token);
    return cancelled();
  }
  if (!result.ok() && token->empty()) return result;
  if (answer.status != kHttpCreated) return success();
  // There was nothing, and now there is an empty object where a folder was wanted.
  HttpRequest removal = request_for("DELETE", folder);
  removal.headers = {lock_condition(folder, *token)};
  http_perform(ticket, removal);
  unlock(folder, *token);
  token->clear();
  return failure(BACKUP_TRANS_ERROR_NO_SUCH_OBJECT, "lock: the folder was deleted meanwhile");
}

void DavClient::unlock(const std::string &folder, const std::string &token) const {
  if (token.empty()) return;
  HttpRequest request = request_for("UNLOCK", folder + "/");
  request.headers = {"Lock-Token: " + token};
  request.seconds = kTidyUpSeconds;
  Ticket own;
  HttpAnswer answer;
  for (int i = 0; i < kUnlockAttempts && outcome_is_open(answer); ++i)
    answer = http_perform(own, request);
}

// "" when there is none.
std::string DavClient::find_lock(const std::string &folder, const std::string &owner) const {
  HttpRequest request = question(kFindLocks, folder, "0");
  request.seconds = kTidyUpSeconds;
  Ticket own;
  const HttpAnswer answer = http_perform(own, request);
  return has_status(answer, kHttpMultiStatus) ? parse_lock_token(answer.body, owner) : "";
}

bool DavClient::find_foreign_lock(Ticket &ticket, const std::string &folder, DavLock *lock) const {
  const HttpAnswer answer = http_perform(ticket, question(kFindLocks, folder, "0"));
  if (!has_status(answer, kHttpMultiStatus) || !parse_lock(answer.body, url_.host, lock))
    return false;
  // Some forget who the owner is; nobody else has locks as short as ours.
  const bool as_ours =
      lock->seconds > 0 && lock->seconds <= static_cast<uint64_t>(kLockDuration.count());
  return is_temporary_name(lock->owner) || (lock->owner.empty() && as_ours);
}

void DavClient::break_lock(Ticket &ticket, const std::string &folder, const DavLock &lock) const {
  HttpRequest request = request_for("UNLOCK", folder + "/");
  if (!lock.root.empty()) request.url = url_.origin + encode_path(lock.root) + "/";
  request.headers = {"Lock-Token: " + lock.token};
  http_perform(ticket, request);
}

std::string DavClient::lock_condition(const std::string &folder, const std::string &token) const {
  return "If: <" + url_of(folder) + "/> (" + token + ")";
}

std::string DavClient::tag_condition(const std::string &path, const std::string &tag) const {
  return "If: <" + url_of(path) + "> ([" + tag + "])";
}

void DavClient::delete_pieces(Ticket &ticket, const std::string &folder,
                              const std::string &temporary) const {
  DavListing listing;
  std::vector<DavEntry> pieces;
  bool is_folder = false;
  if (!read_listing(propfind(ticket, folder, "1"), folder, &listing, &pieces, &is_folder)) return;
  for (const DavEntry &piece : pieces) {
    if (piece.path.compare(0, temporary.size(), temporary) == 0) send(ticket, "DELETE", piece.path);
  }
}

bool DavClient::means_folder(const HttpAnswer &answer, const std::string &path) const {
  if (!answer.complete() || answer.status / kStatusClass != kRedirection) return false;
  const std::string expected = url_of(path) + "/";
  const std::string location = answer.header("location");
  return location == expected || url_.origin + location == expected;
}

}  // namespace transport
