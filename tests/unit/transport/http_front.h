/**
 * @file http_front.h
 * @brief An HTTP server on loopback that misbehaves as it is told to.
 *
 * HTTP/1.1, plain or with TLS, one thread a connection. Behind it is a service
 * that answers; rules in front of it spoil chosen requests. Every public
 * function may be called from any thread.
 */
#ifndef TRANSPORT_HTTP_FRONT_H
#define TRANSPORT_HTTP_FRONT_H

#include <chrono>
#include <condition_variable>
#include <functional>
#include <limits>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace front {

struct Request {
  std::string method;
  std::string target;                         /**< as it was sent */
  std::string path;                           /**< decoded, without the query */
  std::map<std::string, std::string> query;   /**< decoded */
  std::map<std::string, std::string> headers; /**< names in lower case */
  std::string body;

  /** "" when absent */
  std::string header(const std::string &name) const;
};

/** "{authorization}" in it stands for what the request says there. */
struct Response {
  Response(int status_code = 200, std::map<std::string, std::string> fields = {},
           std::string content = "")
      : status(status_code), headers(std::move(fields)), body(std::move(content)) {}

  int status;
  std::map<std::string, std::string> headers;
  std::string body;
  std::string reason = "Because";
  std::string raw; /**< sent as it is, instead of all that */
};

/** What is served; several threads at a time. */
class Service {
 public:
  Service() = default;
  Service(const Service &) = delete;
  Service &operator=(const Service &) = delete;
  virtual ~Service() = default;
  virtual Response serve(const Request &request) = 0;
};

enum class Spoil {
  nothing,
  answer,         /**< Fault::answer instead of the service's */
  edit,           /**< the service's answer, after Fault::edit */
  reset_request,  /**< the connection is reset once Fault::at bytes of the request came */
  reset_response, /**< the connection is reset after Fault::at bytes of the answer */
  cut_response,   /**< the connection is closed after Fault::at bytes of the answer */
  stall_request,  /**< no more is read after Fault::at bytes of the request */
  stall_response, /**< no more is sent after Fault::at bytes of the answer */
  slow,           /**< request and answer go at kSlowBytes a second */
  trickle,        /**< the answer goes on with a byte every kTrickleTime after Fault::at bytes */
  endless         /**< it goes on as fast as it can, without its length, after Fault::at bytes */
};

constexpr std::size_t kSlowBytes = 1000;
constexpr std::chrono::seconds kTrickleTime{20};

struct Fault {
  Spoil spoil = Spoil::nothing;
  std::size_t at = 0;
  Response answer;
  std::function<void(Response *)> edit;
};

constexpr int kForEver = std::numeric_limits<int>::max();

/** The requests of a method whose target holds a text, counted from one. */
struct Rule {
  std::string method;      /**< "" is any */
  std::string target;      /**< "" is any */
  std::string header = {}; /**< "" is any; else its value is the next one */
  std::string value = {};
  int first = 1;
  int last = kForEver;
  /** The service sees the request although its answer is never given, or what came of it. */
  bool takes_effect = false;
  Fault fault = {};
};

/** Who the server says it is. */
struct Identity {
  std::string certificate; /**< PEM */
  std::string key;         /**< PEM */
};

class Front {
 public:
  explicit Front(Service &service, const Identity *identity = nullptr);
  Front(const Front &) = delete;
  Front &operator=(const Front &) = delete;
  ~Front();

  int port() const { return port_; }

  /** From now on, with counting from one; the first rule that fits spoils a request. */
  void set_rules(std::vector<Rule> rules);
  /** Requests that fitted a rule since then, spoiled or not. */
  int count(std::size_t rule) const;

  /** All requests in order, "METHOD target". */
  std::vector<std::string> log() const;
  /** Connections are refused, those that are there are cut. */
  void refuse();
  void accept_again();

  /** From now on no request goes on, until release(); those whose sender left by then are lost. */
  void hold();
  void release();

  /** Called where a fault takes time, instead of taking it. */
  void set_time(std::function<void(std::chrono::milliseconds)> pass);

  /** From now on a connection is taken, and nothing is said on it. */
  void fall_silent();

  /** Does a fault hold up a connection now? */
  bool is_stalling() const;

 private:
  class Connection;
  struct Counted {
    Rule rule;
    int seen = 0;
  };

  void accept_all();
  void serve(Connection &connection);
  bool serve_one(Connection &connection);
  bool wait_released(const Connection &connection);
  Fault fault_for(const Request &request, bool *takes_effect);
  void stall(Connection &connection);
  void pass(std::chrono::milliseconds time);
  bool send(Connection &connection, const Fault &fault, const std::string &text);

  Service &service_;
  std::shared_ptr<void> tls_;  // SSL_CTX
  int port_ = 0;
  int wake_ = -1;

  mutable std::mutex mutex_;
  std::condition_variable changed_;
  int listener_ = -1;
  bool listening_ = false;
  bool stopping_ = false;
  bool held_ = false;
  bool silent_ = false;
  int stalling_ = 0;
  std::vector<Counted> rules_;
  std::vector<std::string> log_;
  std::vector<Connection *> connections_;
  std::vector<std::thread> threads_;
  std::function<void(std::chrono::milliseconds)> pass_;
  std::thread acceptor_;
};

/** A port of this machine on which nothing listens as long as this object lives. */
class SilentPort {
 public:
  SilentPort();
  SilentPort(const SilentPort &) = delete;
  SilentPort &operator=(const SilentPort &) = delete;
  ~SilentPort();
  int port() const { return port_; }

 private:
  int fd_ = -1;
  int port_ = 0;
};

std::string encoded(const std::string &path);
std::string decoded(const std::string &text);

}  // namespace front

#endif
