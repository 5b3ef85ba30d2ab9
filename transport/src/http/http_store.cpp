#include "http/http_store.h"

#include <glib.h>

#include <cerrno>

#include "core/file_bytes.h"

namespace transport {

Outcome no_such_object() {
  return failure(BACKUP_TRANS_ERROR_NO_SUCH_OBJECT, "no such object in the store");
}

Outcome again(std::string message) {
  Outcome outcome = failure(BACKUP_TRANS_ERROR_SERVER, std::move(message));
  outcome.transient = true;
  return outcome;
}

Outcome no_store(std::string message) {
  Outcome outcome = failure(BACKUP_TRANS_ERROR_SERVER, std::move(message));
  outcome.wrong_address = true;
  return outcome;
}

Outcome local_failure(const char *what) {
  return failure(BACKUP_TRANS_ERROR_LOCAL_FILE, std::string(what) + ": " + g_strerror(errno));
}

bool is_absent(const HttpAnswer &answer) {
  return answer.complete() && (answer.status == kHttpNotFound || answer.status == kHttpGone);
}

uint64_t told_size(const HttpAnswer &answer) {
  // Some leave the length of an empty object out.
  return g_ascii_strtoull(answer.header("content-length").c_str(), nullptr, 10);
}

bool has_size(const HttpAnswer &answer, uint64_t size) { return told_size(answer) == size; }

Received receive(Ticket &ticket, HttpRequest request, GChecksumType type, LocalTarget &target) {
  Received received;
  Checksum checksum(type);
  request.sink_limit = target.limit();
  request.sink = [&](const char *data, std::size_t size) {
    checksum.add(data, size);
    received.size += size;
    return write_all(target.fd(), data, size);
  };
  received.answer = http_perform(ticket, request);
  received.checksum = checksum.hex();
  return received;
}

Outcome publish(Ticket &ticket, const Received &received, LocalTarget &target) {
  const std::string length = received.answer.header("content-length");
  if (received.answer.status != kHttpOk ||
      (!length.empty() && g_ascii_strtoull(length.c_str(), nullptr, 10) != received.size))
    return again("download: the object came incomplete");
  if (!target.sync()) return local_failure("cannot write the local file");
  if (!ticket.begin_commit()) return cancelled();
  if (!target.publish()) return local_failure("cannot replace the local file");
  return success();
}

}  // namespace transport
