/**
 * @file http.h
 * @brief HTTP for the network stores: one transport thread that all requests share.
 *
 * libcurl is loaded with the first request. The thread ends when nothing was
 * asked of it for a while, and takes its connections along.
 */
#ifndef BACKUP_TRANSPORT_HTTP_H
#define BACKUP_TRANSPORT_HTTP_H

#include <cstdint>
#include <functional>
#include <string>
#include <vector>

#include "core/outcome.h"
#include "core/retry.h"
#include "core/ticket.h"
#include "http/answer.h"

namespace transport {

/** An exchange in which nothing moves for so long is given up. */
constexpr std::chrono::seconds kStallTime{30};

/** Answers that are kept in memory are cut off with an error beyond this. */
constexpr std::size_t kMaxAnswerBytes = 16 * 1024 * 1024;
/** Of longer ones so many are in memory at a time; one that comes beside them is a transient error.
 */
constexpr std::size_t kShortAnswerBytes = 2 * 1024 * 1024;
constexpr int kMaxLongAnswers = 2;
/** Of one that is no success so much is kept: it says why, and no more. */
constexpr std::size_t kMaxErrorBytes = 64 * 1024;
/** The same for the headers of all answers to one request. */
constexpr std::size_t kMaxHeaderBytes = 256 * 1024;
/** The same for what is only read through, where the request has no limit of its own. */
constexpr uint64_t kMaxReadBytes = uint64_t{256} * 1024 * 1024;

struct HttpRequest {
  std::string method;
  std::string url;
  std::vector<std::string> headers; /**< "Name: value" */
  std::string user;                 /**< empty: no credentials */
  std::string password;
  /** "provider:provider:region:service": sign with the password instead of sending it. */
  std::string signature;
  std::string ca_file; /**< empty: the system's authorities */

  long seconds = 0; /**< for the whole exchange; 0: as long as something moves, see kStallTime */

  bool has_body = false;
  std::string body; /**< sent when body_fd is none */
  int body_fd = -1; /**< sent from its start, body_size bytes */
  uint64_t body_size = 0;

  /** Receives the body of a 2xx answer instead of HttpAnswer::body; false: local failure. */
  std::function<bool(const char *data, std::size_t size)> sink;
  uint64_t sink_limit = kMaxReadBytes; /**< bytes; a longer body is an error of the server */
};

/** Blocks until the answer is there or @p ticket is cancelled. Any thread. */
HttpAnswer http_perform(Ticket &ticket, const HttpRequest &request);

/** Load the HTTP library ahead of the first exchange, whose error it is when that fails. */
void prepare_http();

/** Wait between two exchanges. @return false when @p ticket was cancelled before the end */
bool http_pause(Ticket &ticket, std::chrono::milliseconds duration);

/** The time by which stalls, limits and pauses are measured. */
RetryClock::Point http_now();

/** Have another clock for stalls, limits and pauses; null: the real one. */
void set_http_clock(RetryClock *clock);

/** Have the transport thread take everything that came and look at its clock before this returns.
 */
void wake_http();

}  // namespace transport

#endif
