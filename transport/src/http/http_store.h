/**
 * @file http_store.h
 * @brief What the stores behind HTTP have in common.
 *
 * Thread: a worker of the session; see backend.h.
 */
#ifndef BACKUP_TRANSPORT_HTTP_STORE_H
#define BACKUP_TRANSPORT_HTTP_STORE_H

#include <cstdint>
#include <string>

#include "core/checksum.h"
#include "core/local_file.h"
#include "core/outcome.h"
#include "http/http.h"

namespace transport {

constexpr int kHttpOk = 200;
constexpr int kHttpBadRequest = 400;
constexpr int kHttpUnauthorized = 401;
constexpr int kHttpNotFound = 404;
constexpr int kHttpMethodNotAllowed = 405;
constexpr int kHttpConflict = 409;
constexpr int kHttpGone = 410;
constexpr int kHttpPreconditionFailed = 412;
constexpr int kHttpNotImplemented = 501;

Outcome no_such_object();

/** A failure of the store that is worth another attempt. */
Outcome again(std::string message);

/** The answer of something that is no such store. */
Outcome no_store(std::string message);

/** With the text of errno. */
Outcome local_failure(const char *what);

/** The store says that there is nothing of that name. */
bool is_absent(const HttpAnswer &answer);

/** The length of the object that the answer to a HEAD tells of. */
uint64_t told_size(const HttpAnswer &answer);

/** Does the answer to a HEAD tell of an object of that size? */
bool has_size(const HttpAnswer &answer, uint64_t size);

/** An object's content as it came. */
struct Received {
  HttpAnswer answer;
  uint64_t size = 0;
  std::string checksum; /**< hexadecimal, of the kind that was asked for */
};

/**
 * Read an object.
 * @param target receives the bytes in the file that begin() made
 */
Received receive(Ticket &ticket, HttpRequest request, GChecksumType type, LocalTarget &target);

/** What receive() brought, with a good answer, becomes the local file once it is complete. */
Outcome publish(Ticket &ticket, const Received &received, LocalTarget &target);

}  // namespace transport

#endif
