/**
 * @file forwarder.h
 * @brief Stands between a session and a WebDAV server, to have things happen right in between.
 */
#ifndef CLOUD_FORWARDER_H
#define CLOUD_FORWARDER_H

#include <functional>
#include <map>
#include <mutex>
#include <string>

#include "http_front.h"

/** Hands every request on. Any thread. */
class Forwarder : public front::Service {
 public:
  /** Called with the request on a thread of the front's, which waits for it. */
  using Hook = std::function<void(const front::Request &request)>;

  /** @param port of the server on loopback */
  explicit Forwarder(int port);

  /** Have @p hook called once, before the next request of @p method is handed on. */
  void before(const std::string &method, Hook hook);

  front::Response serve(const front::Request &request) override;

  int port() const { return front_.port(); }

 private:
  const std::string server_;
  std::mutex mutex_;
  std::map<std::string, Hook> hooks_;
  front::Front front_{*this};
};

#endif
