#include "http_front.h"

#include <arpa/inet.h>
#include <glib.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <poll.h>
#include <signal.h>
#include <sys/eventfd.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "http/http.h"
#include "loopback.h"

namespace front {
namespace {

using std::chrono::milliseconds;
using Lock = std::unique_lock<std::mutex>;

constexpr std::size_t kBufferBytes = 16 * 1024;
constexpr std::size_t kMaxHeadBytes = 64 * 1024;
// Small, so that a server that reads slowly is felt by who sends.
constexpr int kReceiveBufferBytes = 8 * 1024;
// How long a fault that ends nothing is waited for before time passes once more.
constexpr int kStallPatienceMs = 5000;
constexpr char kHeadEnd[] = "\r\n\r\n";
constexpr char kBadRequest[] = "HTTP/1.1 400 Bad Request\r\nConnection: close\r\n\r\n";
constexpr char kEcho[] = "{authorization}";

// -1 when the port is taken.
int bound_socket(int port) {
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  setsockopt(fd, SOL_SOCKET, SO_RCVBUF, &kReceiveBufferBytes, sizeof kReceiveBufferBytes);
  const sockaddr_in address = loopback(port);
  if (bind(fd, reinterpret_cast<const sockaddr *>(&address), sizeof address) == 0) return fd;
  close(fd);
  return -1;
}

int port_of(int fd) {
  sockaddr_in address{};
  socklen_t length = sizeof address;
  getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length);
  return ntohs(address.sin_port);
}

// A port that was asked for by its number stays ours while nobody listens on it.
int reserved_socket() {
  for (;;) {
    const int any = bound_socket(0);
    const int port = port_of(any);
    close(any);
    const int fd = bound_socket(port);
    if (fd >= 0) return fd;
  }
}

std::string lower(std::string text) {
  for (char &c : text) c = g_ascii_tolower(c);
  return text;
}

std::string trimmed(const std::string &text) {
  const std::size_t first = text.find_first_not_of(" \t\r");
  if (first == std::string::npos) return "";
  return text.substr(first, text.find_last_not_of(" \t\r") - first + 1);
}

std::shared_ptr<void> tls_context(const Identity &identity) {
  SSL_CTX *context = SSL_CTX_new(TLS_server_method());
  BIO *text =
      BIO_new_mem_buf(identity.certificate.data(), static_cast<int>(identity.certificate.size()));
  X509 *certificate = PEM_read_bio_X509(text, nullptr, nullptr, nullptr);
  BIO_free(text);
  text = BIO_new_mem_buf(identity.key.data(), static_cast<int>(identity.key.size()));
  EVP_PKEY *key = PEM_read_bio_PrivateKey(text, nullptr, nullptr, nullptr);
  BIO_free(text);
  if (SSL_CTX_use_certificate(context, certificate) != 1 ||
      SSL_CTX_use_PrivateKey(context, key) != 1)
    abort();
  X509_free(certificate);
  EVP_PKEY_free(key);
  return {context, [](void *owned) { SSL_CTX_free(static_cast<SSL_CTX *>(owned)); }};
}

void parse_target(const std::string &target, Request *request) {
  request->target = target;
  const std::size_t mark = target.find('?');
  request->path = decoded(target.substr(0, mark));
  if (mark == std::string::npos) return;
  for (std::size_t at = mark + 1; at <= target.size();) {
    const std::size_t end = std::min(target.find('&', at), target.size());
    const std::string pair = target.substr(at, end - at);
    const std::size_t equals = std::min(pair.find('='), pair.size());
    request->query[decoded(pair.substr(0, equals))] =
        equals < pair.size() ? decoded(pair.substr(equals + 1)) : "";
    at = end + 1;
  }
}

bool parse_head(const std::string &head, Request *request) {
  std::size_t at = head.find("\r\n");
  const std::string line = head.substr(0, at);
  const std::size_t first = line.find(' ');
  const std::size_t second = line.rfind(' ');
  if (first == std::string::npos || second == first) return false;
  request->method = line.substr(0, first);
  parse_target(line.substr(first + 1, second - first - 1), request);
  while (at != std::string::npos && at + 2 < head.size()) {
    const std::size_t end = head.find("\r\n", at + 2);
    const std::string field = head.substr(at + 2, end - at - 2);
    const std::size_t colon = field.find(':');
    if (colon != std::string::npos)
      request->headers[lower(field.substr(0, colon))] = trimmed(field.substr(colon + 1));
    at = end;
  }
  return true;
}

std::string echoed(const Request &request, std::string text) {
  const std::size_t at = text.find(kEcho);
  return at == std::string::npos
             ? text
             : text.replace(at, std::strlen(kEcho), request.header("authorization"));
}

std::string wire_text(const Request &request, Response response) {
  if (!response.raw.empty()) return response.raw;
  response.body = echoed(request, std::move(response.body));
  response.reason = echoed(request, std::move(response.reason));
  if (response.headers.count("Transfer-Encoding") == 0)
    response.headers.emplace("Content-Length", std::to_string(response.body.size()));
  std::string text = "HTTP/1.1 " + std::to_string(response.status) + " " + response.reason + "\r\n";
  for (const auto &[name, value] : response.headers)
    text += name + ": " + echoed(request, value) + "\r\n";
  text += "\r\n";
  return request.method == "HEAD" ? text : text + response.body;
}

}  // namespace

std::string encoded(const std::string &path) {
  char *text = g_uri_escape_string(path.c_str(), "/", FALSE);
  std::string result = text;
  g_free(text);
  return result;
}

std::string decoded(const std::string &text) {
  char *plain = g_uri_unescape_string(text.c_str(), nullptr);
  std::string result = plain == nullptr ? text : plain;
  g_free(plain);
  return result;
}

std::string Request::header(const std::string &name) const {
  const auto it = headers.find(name);
  return it == headers.end() ? "" : it->second;
}

SilentPort::SilentPort() : fd_(reserved_socket()), port_(port_of(fd_)) {}

SilentPort::~SilentPort() { close(fd_); }

/** One client's; its own thread's, but for cut(). */
class Front::Connection {
 public:
  Connection(int fd, SSL_CTX *tls) : fd_(fd) {
    const int on = 1;
    setsockopt(fd_, IPPROTO_TCP, TCP_NODELAY, &on, sizeof on);
    if (tls == nullptr) return;
    tls_ = SSL_new(tls);
    SSL_set_fd(tls_, fd_);
  }
  Connection(const Connection &) = delete;
  Connection &operator=(const Connection &) = delete;
  ~Connection() {
    if (tls_ != nullptr) SSL_free(tls_);
    close(fd_);
  }

  bool greet() { return tls_ == nullptr || SSL_accept(tls_) == 1; }

  /** @return false at the end */
  bool read_some(std::size_t limit, std::string *text) {
    char buffer[kBufferBytes];
    const std::size_t wanted = std::min(limit, sizeof buffer);
    const ssize_t got = tls_ != nullptr ? SSL_read(tls_, buffer, static_cast<int>(wanted))
                                        : recv(fd_, buffer, wanted, 0);
    if (got <= 0) return false;
    const int on = 1;
    setsockopt(fd_, IPPROTO_TCP, TCP_QUICKACK, &on, sizeof on);
    text->append(buffer, static_cast<std::size_t>(got));
    return true;
  }

  bool write_all(const char *data, std::size_t size) {
    while (size > 0) {
      const ssize_t sent = tls_ != nullptr ? SSL_write(tls_, data, static_cast<int>(size))
                                           : ::send(fd_, data, size, MSG_NOSIGNAL);
      if (sent <= 0) return false;
      data += sent;
      size -= static_cast<std::size_t>(sent);
    }
    return true;
  }

  void reset() const {
    const linger now{1, 0};
    setsockopt(fd_, SOL_SOCKET, SO_LINGER, &now, sizeof now);
  }

  void cut() const { shutdown(fd_, SHUT_RDWR); }

  /** @return whether the other side went away meanwhile */
  bool wait_for_end(int patience_ms) const {
    pollfd waiting{fd_, POLLRDHUP, 0};
    return poll(&waiting, 1, patience_ms) != 0;
  }

  std::string pending;  // read, and not yet looked at

 private:
  int fd_;
  SSL *tls_ = nullptr;
};

Front::Front(Service &service, const Identity *identity)
    : service_(service), wake_(eventfd(0, EFD_CLOEXEC)) {
  // The TLS library writes without the flag that would prevent it.
  signal(SIGPIPE, SIG_IGN);
  if (identity != nullptr) tls_ = tls_context(*identity);
  listener_ = reserved_socket();
  port_ = port_of(listener_);
  listen(listener_, SOMAXCONN);
  listening_ = true;
  acceptor_ = std::thread([this] { accept_all(); });
}

Front::~Front() {
  {
    const Lock lock(mutex_);
    stopping_ = true;
    changed_.notify_all();
    for (const Connection *connection : connections_) connection->cut();
  }
  eventfd_write(wake_, 1);
  acceptor_.join();
  for (std::thread &thread : threads_) thread.join();
  close(listener_);
  close(wake_);
}

void Front::set_rules(std::vector<Rule> rules) {
  const Lock lock(mutex_);
  rules_.clear();
  for (Rule &rule : rules) rules_.push_back({std::move(rule)});
}

int Front::count(std::size_t rule) const {
  const Lock lock(mutex_);
  return rules_.at(rule).seen;
}

std::vector<std::string> Front::log() const {
  const Lock lock(mutex_);
  return log_;
}

void Front::refuse() {
  const Lock lock(mutex_);
  listening_ = false;
  shutdown(listener_, SHUT_RDWR);
  for (const Connection *connection : connections_) connection->cut();
  eventfd_write(wake_, 1);
}

void Front::accept_again() {
  const Lock lock(mutex_);
  listen(listener_, SOMAXCONN);
  listening_ = true;
  eventfd_write(wake_, 1);
}

void Front::hold() {
  const Lock lock(mutex_);
  held_ = true;
}

void Front::release() {
  const Lock lock(mutex_);
  held_ = false;
  changed_.notify_all();
}

void Front::set_time(std::function<void(milliseconds)> pass) {
  const Lock lock(mutex_);
  pass_ = std::move(pass);
}

void Front::fall_silent() {
  const Lock lock(mutex_);
  silent_ = true;
}

bool Front::is_stalling() const {
  const Lock lock(mutex_);
  return stalling_ > 0;
}

void Front::pass(milliseconds time) {
  std::function<void(milliseconds)> function;
  {
    const Lock lock(mutex_);
    function = pass_;
  }
  if (function) function(time);
}

void Front::accept_all() {
  for (;;) {
    int listener = -1;
    {
      const Lock lock(mutex_);
      if (stopping_) return;
      listener = listening_ ? listener_ : -1;
    }
    pollfd waiting[] = {{wake_, POLLIN, 0}, {listener, POLLIN, 0}};
    poll(waiting, 2, -1);
    if ((waiting[0].revents & POLLIN) != 0) {
      eventfd_t count = 0;
      eventfd_read(wake_, &count);
      continue;
    }
    const int fd = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) continue;
    const Lock lock(mutex_);
    if (stopping_) {
      close(fd);
      return;
    }
    auto connection = std::make_shared<Connection>(fd, static_cast<SSL_CTX *>(tls_.get()));
    connections_.push_back(connection.get());
    threads_.emplace_back([this, connection = std::move(connection)]() mutable {
      serve(*connection);
      const Lock done(mutex_);
      connections_.erase(std::find(connections_.begin(), connections_.end(), connection.get()));
      connection.reset();
    });
  }
}

void Front::serve(Connection &connection) {
  bool silent = false;
  {
    const Lock lock(mutex_);
    silent = silent_;
  }
  if (silent) {
    stall(connection);
    return;
  }
  if (!connection.greet()) return;
  while (serve_one(connection)) {
  }
}

Fault Front::fault_for(const Request &request, bool *takes_effect) {
  const Lock lock(mutex_);
  log_.push_back(request.method + " " + request.target);
  for (Counted &counted : rules_) {
    const Rule &rule = counted.rule;
    if (!rule.method.empty() && rule.method != request.method) continue;
    if (request.target.find(rule.target) == std::string::npos) continue;
    if (!rule.header.empty() && request.header(rule.header) != rule.value) continue;
    ++counted.seen;
    if (counted.seen < rule.first || counted.seen > rule.last) continue;
    *takes_effect = rule.takes_effect;
    return rule.fault;
  }
  return {};
}

bool Front::wait_released(const Connection &connection) {
  Lock lock(mutex_);
  const bool waited = held_;
  changed_.wait(lock, [this] { return !held_ || stopping_; });
  return !stopping_ && (!waited || !connection.wait_for_end(0));
}

// Ends with the connection.
void Front::stall(Connection &connection) {
  {
    const Lock lock(mutex_);
    ++stalling_;
  }
  do {
    pass(transport::kStallTime);
  } while (!connection.wait_for_end(kStallPatienceMs));
  const Lock lock(mutex_);
  --stalling_;
}

bool Front::serve_one(Connection &connection) {
  std::string &pending = connection.pending;
  std::size_t head_size = std::string::npos;
  while ((head_size = pending.find(kHeadEnd)) == std::string::npos) {
    if (pending.size() > kMaxHeadBytes || !connection.read_some(kBufferBytes, &pending))
      return false;
    // Where HTTP is spoken, TLS is a bad request.
    if (!g_ascii_isupper(pending[0])) {
      connection.write_all(kBadRequest, std::strlen(kBadRequest));
      return false;
    }
  }
  head_size += std::strlen(kHeadEnd);
  Request request;
  if (!parse_head(pending.substr(0, head_size), &request)) return false;
  if (!wait_released(connection)) return false;
  bool takes_effect = false;
  const Fault fault = fault_for(request, &takes_effect);
  const std::size_t size =
      head_size + std::strtoull(request.header("content-length").c_str(), nullptr, 10);
  if (!request.header("expect").empty() &&
      !connection.write_all("HTTP/1.1 100 Continue\r\n\r\n", 25))
    return false;
  const bool stops_early =
      fault.spoil == Spoil::reset_request || fault.spoil == Spoil::stall_request;
  const std::size_t wanted = stops_early ? std::min(fault.at, size) : size;
  const std::size_t step = fault.spoil == Spoil::slow ? kSlowBytes : kBufferBytes;
  bool whole = true;
  while (whole && pending.size() < wanted) {
    whole = connection.read_some(std::min(step, wanted - pending.size()), &pending);
    if (fault.spoil == Spoil::slow) pass(std::chrono::seconds(1));
  }
  if (!whole) return false;
  if (stops_early && takes_effect && wanted > head_size) {
    request.body = pending.substr(head_size, wanted - head_size);
    service_.serve(request);
  }
  if (fault.spoil == Spoil::reset_request) connection.reset();
  if (fault.spoil == Spoil::stall_request) stall(connection);
  if (stops_early) return false;
  request.body = pending.substr(head_size, size - head_size);
  pending.erase(0, size);
  const bool answers =
      fault.spoil != Spoil::answer &&
      (fault.at > 0 || takes_effect || fault.spoil == Spoil::nothing ||
       fault.spoil == Spoil::edit || fault.spoil == Spoil::slow || fault.spoil == Spoil::endless);
  Response response;
  if (answers || takes_effect) response = service_.serve(request);
  if (fault.spoil == Spoil::answer) response = fault.answer;
  if (fault.edit) fault.edit(&response);
  return send(connection, fault, wire_text(request, std::move(response)));
}

// @return whether the connection goes on
bool Front::send(Connection &connection, const Fault &fault, const std::string &text) {
  const std::size_t size = std::min(fault.at, text.size());
  switch (fault.spoil) {
    case Spoil::reset_response:
      connection.write_all(text.data(), size);
      connection.reset();
      return false;
    case Spoil::cut_response:
      connection.write_all(text.data(), size);
      return false;
    case Spoil::stall_response:
      connection.write_all(text.data(), size);
      stall(connection);
      return false;
    case Spoil::trickle:
      connection.write_all(text.data(), size);
      for (std::size_t at = size; at < text.size(); ++at) {
        pass(kTrickleTime);
        if (!connection.write_all(text.data() + at, 1) || connection.wait_for_end(0)) return false;
      }
      return true;
    case Spoil::endless: {
      const std::string more(kBufferBytes, text.empty() ? 'x' : text.back());
      bool taken = connection.write_all(text.data(), size);
      while (taken) taken = connection.write_all(more.data(), more.size());
      return false;
    }
    case Spoil::slow:
      for (std::size_t at = 0; at < text.size(); at += kSlowBytes) {
        if (!connection.write_all(text.data() + at, std::min(kSlowBytes, text.size() - at)))
          return false;
        pass(std::chrono::seconds(1));
      }
      return true;
    default:
      return connection.write_all(text.data(), text.size()) &&
             text.find("\r\nConnection: close\r\n") == std::string::npos;
  }
}

}  // namespace front
