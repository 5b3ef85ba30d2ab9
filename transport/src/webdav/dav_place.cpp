#include "webdav/dav_place.h"

#include <algorithm>

#include "core/file_bytes.h"

namespace transport {
namespace {

// So much is compared, from the end.
constexpr uint64_t kComparedBytes = 4096;

// "" for what is absent.
std::string description_of(const HttpAnswer &answer) {
  if (!answer.good()) return "";
  return answer.header("content-length") + " " + answer.header("etag") + " " +
         answer.header("last-modified");
}

// Does @p content have that end where its first @p size bytes end?
bool has_end(const std::string &content, uint64_t size, const std::string &end) {
  return size <= content.size() && end.size() == std::min(size, kComparedBytes) &&
         content.compare(size - end.size(), end.size(), end) == 0;
}

}  // namespace

Outcome DavPlace::note(Ticket &ticket) {
  const HttpAnswer answer = client_.send(ticket, "HEAD", path_);
  if (!answer.good() && !is_absent(answer)) return dav_outcome(answer, "upload");
  before_ = description_of(answer);
  return success();
}

HttpRequest DavPlace::short_request(const char *method) const {
  HttpRequest request = client_.request_for(method, path_);
  request.seconds = kTidyUpSeconds;
  return request;
}

bool DavPlace::read_end(Ticket &ticket, uint64_t size, std::string *end) const {
  const uint64_t length = std::min(size, kComparedBytes);
  if (length == 0) return true;
  HttpRequest request = short_request("GET");
  request.headers = {"Range: bytes=" + std::to_string(size - length) + "-" +
                     std::to_string(size - 1)};
  // A server that knows no ranges sends everything, which has the same end.
  request.sink_limit = size;
  request.sink = [&](const char *data, std::size_t count) {
    end->append(data, count);
    if (end->size() > length) end->erase(0, end->size() - length);
    return true;
  };
  return http_perform(ticket, request).good();
}

DavPlace::Found DavPlace::compare_source(uint64_t size, const std::string &end) const {
  if (size > source_.size()) return Found::foreign;
  if (spoilt_) return Found::part;
  std::string expected(std::min(size, kComparedBytes), '\0');
  const ssize_t got = read_at(source_.fd(), expected.data(), expected.size(),
                              static_cast<off_t>(size - expected.size()));
  if (got != static_cast<ssize_t>(expected.size()) || end != expected) return Found::foreign;
  return size == source_.size() ? Found::whole : Found::part;
}

DavPlace::Found DavPlace::compare(uint64_t size, const std::string &end) const {
  if (!replaced_ || !has_end(*replaced_, size, end)) return compare_source(size, end);
  return size == replaced_->size() ? Found::before : Found::part;
}

Outcome DavPlace::look(Ticket &ticket, Seen *seen) const {
  const HttpAnswer answer = http_perform(ticket, short_request("HEAD"));
  *seen = {};
  if (is_absent(answer)) return success();
  if (!answer.good()) return dav_outcome(answer, "upload");
  seen->tag = strong_tag(answer);
  seen->found = Found::before;
  if (description_of(answer) == before_) return success();
  const uint64_t size = told_size(answer);
  std::string end;
  if (!read_end(ticket, size, &end)) return again("upload: what lies there cannot be read");
  seen->found = compare(size, end);
  return success();
}

Outcome DavPlace::look(Ticket &ticket, Found *found) const {
  Seen seen;
  const Outcome result = look(ticket, &seen);
  *found = seen.found;
  return result;
}

// What was cut off may come to lie there after it was looked for.
Outcome DavPlace::look_for_late(Ticket &ticket, Seen *seen) const {
  Outcome result = look(ticket, seen);
  for (const std::chrono::milliseconds pause : kTidyUpPauses) {
    const bool may_come =
        !answered_ && (seen->found == Found::nothing || seen->found == Found::before);
    if (!result.ok() || !may_come) break;
    http_pause(ticket, pause);
    result = look(ticket, seen);
  }
  return result;
}

bool DavPlace::arrived(Ticket &ticket, const HttpAnswer &head) const {
  if (!has_size(head, source_.size())) return false;
  if (description_of(head) != before_) return true;
  // Nothing seems to have changed.
  std::string end;
  return read_end(ticket, source_.size(), &end) &&
         compare_source(source_.size(), end) == Found::whole;
}

Outcome DavPlace::mend(const std::string &lock, Next next) const {
  Ticket own;
  Seen seen;
  const Outcome looked = look_for_late(own, &seen);
  if (!looked.ok()) return looked;
  const auto conditional = [&](const char *method) {
    HttpRequest request = short_request(method);
    if (!lock.empty())
      request.headers = {lock};
    else if (!seen.tag.empty())
      request.headers = {"If-Match: " + seen.tag};
    return request;
  };
  if (seen.found == Found::part && replaced_) {
    HttpRequest request = conditional("PUT");
    request.has_body = true;
    request.body = *replaced_;
    const Outcome back = dav_outcome(http_perform(own, request), "upload");
    if (back.ok() || next == Next::another_attempt || !look(own, &seen).ok()) return back;
  }
  if (seen.found != Found::part) return success();
  return dav_outcome(http_perform(own, conditional("DELETE")), "upload");
}

}  // namespace transport
