/**
 * @file exchange.h
 * @brief One request on its way: what the HTTP library is told of it, and tells.
 *
 * Thread: the transport thread, apart from what says otherwise.
 */
#ifndef BACKUP_TRANSPORT_EXCHANGE_H
#define BACKUP_TRANSPORT_EXCHANGE_H

#include <cstdint>
#include <memory>
#include <set>
#include <string>

#include "http/http.h"
#include "http/least_rate.h"
#include "http/library.h"
#include "http/upload_queue.h"
#include "thread_annotations.h"

namespace transport {

/** Whatever the transport thread shares with those that ask it; one, as the thread is. */
inline Mutex engine_mutex;

/** The sockets of every connection. */
class Sockets {
 public:
  /** For the library, which opens and closes them. @param sockets is a Sockets */
  static curl_socket_t open(void *sockets, curlsocktype purpose, curl_sockaddr *address);
  static int close(void *sockets, curl_socket_t fd);

  /** Bytes that the kernel holds of the connection from @p port of this machine. */
  int queued_from(long port) const;

 private:
  std::set<int> open_;
};

/** One request on its way; owned by its caller, who waits until done. */
struct Exchange {
  const HttpRequest *request = nullptr;
  HttpAnswer answer;
  CURL *easy = nullptr;
  curl_slist *headers = nullptr;
  uint64_t sent = 0;
  int64_t received = 0;  // bytes of headers and body
  int64_t moved = 0;     // bytes sent and received when it was last looked at
  UploadQueue queue;
  LeastRate rate;
  RetryClock::Point moved_at;
  RetryClock::Point began_at;
  bool local_failure = false;
  bool too_long = false;
  bool too_large = false;        // for the request's sink
  bool too_many = false;         // long answers at a time
  std::size_t header_bytes = 0;  // of every answer so far
  uint64_t sunk = 0;
  char error[CURL_ERROR_SIZE] = "";
  bool done QUARN_GUARDED_BY(engine_mutex) = false;
  bool unwanted QUARN_GUARDED_BY(engine_mutex) = false;
};
using ExchangePtr = std::shared_ptr<Exchange>;

/** Make the library's handle, which sends what the exchange's request says. */
void prepare(const Curl &curl, Sockets *sockets, Exchange *exchange);

/** Notice what moved since it was last asked. */
void note_progress(const Curl &curl, const Sockets &sockets, RetryClock::Point now,
                   Exchange *exchange);

/**
 * Has too little moved for too long?
 * @param patience milliseconds; becomes less where it has to be looked at again before
 */
[[nodiscard]] bool is_overdue(RetryClock::Point now, Exchange *exchange, int *patience);

/** How it ended, when the library says that it has. */
Outcome problem_of(const Curl &curl, const Exchange &exchange, CURLcode code);

/** Some servers say what they were told: does @p text hold one of the request's secrets? */
bool gives_away(const HttpRequest &request, const std::string &text);

}  // namespace transport

#endif
