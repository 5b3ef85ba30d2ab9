#include "http/exchange.h"

#include <glib.h>
#include <linux/sockios.h>
#include <netinet/in.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <cstring>
#include <limits>

#include "core/file_bytes.h"

namespace transport {
namespace {

constexpr long kConnectSeconds = 15;
constexpr int kLookMs = 1000;  // how soon to look at what the kernel holds
constexpr long kUploadBufferBytes = 64 * 1024;
constexpr long kNoContinueMs = 1;
constexpr char kPlainScheme[] = "http:";
constexpr char kNoProxy[] = "";
constexpr guint kDecimal = 10;

std::string lower(std::string text) {
  std::transform(text.begin(), text.end(), text.begin(), [](char c) { return g_ascii_tolower(c); });
  return text;
}

std::string trimmed(const std::string &text) {
  static constexpr char kBlank[] = " \t\r\n";
  const std::size_t first = text.find_first_not_of(kBlank);
  if (first == std::string::npos) return "";
  return text.substr(first, text.find_last_not_of(kBlank) - first + 1);
}

uint64_t size_of_body(const HttpRequest &request) {
  return request.body_fd >= 0 ? request.body_size : request.body.size();
}

std::size_t read_body(char *buffer, std::size_t size, std::size_t count, void *data) {
  Exchange &exchange = *static_cast<Exchange *>(data);
  const HttpRequest &request = *exchange.request;
  const std::size_t wanted =
      std::min<uint64_t>(size * count, size_of_body(request) - exchange.sent);
  if (request.body_fd < 0) {
    std::memcpy(buffer, request.body.data() + exchange.sent, wanted);
    exchange.sent += wanted;
    return wanted;
  }
  const ssize_t got = read_at(request.body_fd, buffer, wanted, static_cast<off_t>(exchange.sent));
  if (got < 0 || (got == 0 && wanted > 0)) {
    exchange.local_failure = true;
    return CURL_READFUNC_ABORT;
  }
  exchange.sent += static_cast<uint64_t>(got);
  return static_cast<std::size_t>(got);
}

int seek_body(void *data, curl_off_t offset, int origin) {
  if (origin != SEEK_SET || offset < 0) return CURL_SEEKFUNC_FAIL;
  static_cast<Exchange *>(data)->sent = static_cast<uint64_t>(offset);
  return CURL_SEEKFUNC_OK;
}

std::size_t take_header(char *buffer, std::size_t size, std::size_t count, void *data) {
  Exchange &exchange = *static_cast<Exchange *>(data);
  const std::string line(buffer, size * count);
  exchange.received += static_cast<int64_t>(line.size());
  exchange.header_bytes += line.size();
  if (exchange.header_bytes > kMaxHeaderBytes) {
    exchange.too_long = true;
    return 0;
  }
  if (line.compare(0, 5, "HTTP/") == 0) {
    // The answer after a 100 is another one.
    exchange.answer.headers.clear();
    const std::size_t space = line.find(' ');
    exchange.answer.status = space == std::string::npos
                                 ? 0
                                 : static_cast<int>(std::strtol(line.c_str() + space, nullptr, 10));
    const std::size_t words = space == std::string::npos ? space : line.find(' ', space + 1);
    exchange.answer.reason = words == std::string::npos ? "" : trimmed(line.substr(words));
    return line.size();
  }
  const std::size_t colon = line.find(':');
  if (colon != std::string::npos)
    exchange.answer.headers[lower(line.substr(0, colon))] = trimmed(line.substr(colon + 1));
  return line.size();
}

// A length that was announced need not be waited for.
bool is_too_large(const Exchange &exchange, std::size_t more) {
  const uint64_t limit = exchange.request->sink_limit;
  return exchange.sunk + more > limit ||
         g_ascii_strtoull(exchange.answer.header("content-length").c_str(), nullptr, kDecimal) >
             limit;
}

std::atomic<int> long_answers{0};

// Null when there are as many as there may be.
std::shared_ptr<void> take_room() {
  if (++long_answers <= kMaxLongAnswers) {
    return {nullptr, [](void *) { --long_answers; }};
  }
  --long_answers;
  return nullptr;
}

bool fits_memory(Exchange *exchange) {
  if (exchange->sunk <= kShortAnswerBytes) return true;
  if (exchange->answer.room.use_count() == 0) exchange->answer.room = take_room();
  exchange->too_many = exchange->answer.room.use_count() == 0;
  return !exchange->too_many;
}

std::size_t take_body(char *buffer, std::size_t size, std::size_t count, void *data) {
  Exchange &exchange = *static_cast<Exchange *>(data);
  const std::size_t length = size * count;
  exchange.received += static_cast<int64_t>(length);
  const bool success = exchange.answer.status >= 200 && exchange.answer.status <= 299;
  if (exchange.request->sink && success) {
    exchange.too_large = is_too_large(exchange, length);
    if (exchange.too_large) return 0;
    exchange.sunk += length;
    if (exchange.request->sink(buffer, length)) return length;
    exchange.local_failure = true;
    return 0;
  }
  exchange.sunk += length;
  exchange.too_long = exchange.sunk > kMaxAnswerBytes;
  if (exchange.too_long || (success && !fits_memory(&exchange))) return 0;
  const std::size_t room = success ? length : kMaxErrorBytes - exchange.answer.body.size();
  exchange.answer.body.append(buffer, std::min(length, room));
  return length;
}

// What the network has not taken yet.
int queued_bytes(int socket) {
  int count = 0;
  return ioctl(socket, SIOCOUTQ, &count) == 0 ? count : 0;
}

bool has_port(int socket, long port) {
  sockaddr_storage address{};
  socklen_t length = sizeof address;
  if (getsockname(socket, reinterpret_cast<sockaddr *>(&address), &length) != 0) return false;
  return address.ss_family == AF_INET6
             ? ntohs(reinterpret_cast<const sockaddr_in6 &>(address).sin6_port) == port
             : ntohs(reinterpret_cast<const sockaddr_in &>(address).sin_port) == port;
}

int milliseconds_until(RetryClock::Point end, RetryClock::Point now) {
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - now).count();
  return static_cast<int>(std::clamp<int64_t>(left, 0, std::numeric_limits<int>::max()));
}

// How long the server thinks is for the stall to tell.
bool waits_for_answer(const Exchange &exchange, curl_off_t sent) {
  if (exchange.received > 0) return false;
  const HttpRequest &request = *exchange.request;
  return !request.has_body ||
         (static_cast<uint64_t>(sent) >= size_of_body(request) && exchange.queue.is_empty());
}

// The kernel takes megabytes at once, which can be minutes of a slow network.
int queued_of(const Curl &curl, const Sockets &sockets, const Exchange &exchange) {
  long port = 0;
  curl.easy_getinfo(exchange.easy, CURLINFO_LOCAL_PORT, &port);
  return sockets.queued_from(port);
}

/** The options of one exchange's handle. */
class Options {
 public:
  Options(const Curl &curl, Exchange *exchange) : curl_(curl), exchange_(*exchange) {}

  void set_address() const {
    set(CURLOPT_PRIVATE, &exchange_);
    set(CURLOPT_URL, request().url.c_str());
    set(CURLOPT_PROTOCOLS_STR, "http,https");
    // It is for this machine itself only, and would show a proxy the password.
    if (g_str_has_prefix(request().url.c_str(), kPlainScheme))
      set(CURLOPT_PROXY, static_cast<const char *>(kNoProxy));
    set(CURLOPT_FOLLOWLOCATION, 0L);
    set(CURLOPT_PATH_AS_IS, 1L);
  }

  void set_connection(Sockets *sockets) const {
    set(CURLOPT_NOSIGNAL, 1L);
    set(CURLOPT_QUICK_EXIT, 1L);
    set(CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_2TLS));
    set(CURLOPT_PIPEWAIT, 1L);
    set(CURLOPT_SSL_VERIFYPEER, 1L);
    set(CURLOPT_SSL_VERIFYHOST, 2L);
    if (!request().ca_file.empty()) trust_only(request().ca_file);
    set(CURLOPT_CONNECTTIMEOUT, kConnectSeconds);
    set(CURLOPT_OPENSOCKETFUNCTION, &Sockets::open);
    set(CURLOPT_OPENSOCKETDATA, sockets);
    set(CURLOPT_CLOSESOCKETFUNCTION, &Sockets::close);
    set(CURLOPT_CLOSESOCKETDATA, sockets);
  }

  void set_headers() const {
    for (const std::string &header : request().headers)
      exchange_.headers = curl_.slist_append(exchange_.headers, header.c_str());
    set(CURLOPT_HTTPHEADER, exchange_.headers);
    if (request().user.empty()) return;
    if (request().signature.empty())
      set(CURLOPT_HTTPAUTH, static_cast<long>(CURLAUTH_BASIC));
    else
      set(CURLOPT_AWS_SIGV4, request().signature.c_str());
    set(CURLOPT_USERNAME, request().user.c_str());
    set(CURLOPT_PASSWORD, request().password.c_str());
  }

  void set_body() const {
    if (!request().has_body) return;
    set(CURLOPT_UPLOAD, 1L);
    set(CURLOPT_UPLOAD_BUFFERSIZE, kUploadBufferBytes);
    // Small ones are not worth the wait for a go-ahead, which some servers never give.
    if (request().body_fd < 0) set(CURLOPT_EXPECT_100_TIMEOUT_MS, kNoContinueMs);
    set(CURLOPT_INFILESIZE_LARGE, static_cast<curl_off_t>(size_of_body(request())));
    set(CURLOPT_READFUNCTION, &read_body);
    set(CURLOPT_READDATA, &exchange_);
    set(CURLOPT_SEEKFUNCTION, &seek_body);
    set(CURLOPT_SEEKDATA, &exchange_);
  }

  // After the body, which would choose a method of its own.
  void set_method_and_answer() const {
    if (request().method == "HEAD") set(CURLOPT_NOBODY, 1L);
    set(CURLOPT_CUSTOMREQUEST, request().method.c_str());
    set(CURLOPT_HEADERFUNCTION, &take_header);
    set(CURLOPT_HEADERDATA, &exchange_);
    set(CURLOPT_WRITEFUNCTION, &take_body);
    set(CURLOPT_WRITEDATA, &exchange_);
    set(CURLOPT_ERRORBUFFER, static_cast<char *>(exchange_.error));
  }

 private:
  const HttpRequest &request() const { return *exchange_.request; }

  template <typename Value>
  void set(CURLoption option, Value value) const {
    curl_.easy_setopt(exchange_.easy, option, value);
  }

  void trust_only(const std::string &ca_file) const {
    set(CURLOPT_CAINFO, ca_file.c_str());
    // Else the directory that libcurl was built with vouches as well.
    set(CURLOPT_CAPATH, static_cast<const char *>(nullptr));
    // Without a directory it would not read the file again for a day.
    set(CURLOPT_CA_CACHE_TIMEOUT, 0L);
  }

  const Curl &curl_;
  Exchange &exchange_;
};

}  // namespace

curl_socket_t Sockets::open(void *sockets, curlsocktype, curl_sockaddr *address) {
  const int fd = socket(address->family, address->socktype | SOCK_CLOEXEC, address->protocol);
  if (fd >= 0) static_cast<Sockets *>(sockets)->open_.insert(fd);
  return fd;
}

int Sockets::close(void *sockets, curl_socket_t fd) {
  static_cast<Sockets *>(sockets)->open_.erase(fd);
  return ::close(fd);
}

int Sockets::queued_from(long port) const {
  const auto socket =
      std::find_if(open_.begin(), open_.end(), [port](int known) { return has_port(known, port); });
  return socket == open_.end() ? 0 : queued_bytes(*socket);
}

void prepare(const Curl &curl, Sockets *sockets, Exchange *exchange) {
  exchange->easy = curl.easy_init();
  const Options options(curl, exchange);
  options.set_address();
  options.set_connection(sockets);
  options.set_headers();
  options.set_body();
  options.set_method_and_answer();
}

void note_progress(const Curl &curl, const Sockets &sockets, RetryClock::Point now,
                   Exchange *exchange) {
  curl_off_t sent = 0;
  curl.easy_getinfo(exchange->easy, CURLINFO_SIZE_UPLOAD_T, &sent);
  int64_t moved = sent + exchange->received - exchange->moved;
  if (moved != 0) {
    exchange->moved += moved;
    exchange->queue.restart();
  } else if (exchange->request->has_body) {
    moved = exchange->queue.look(queued_of(curl, sockets, *exchange));
  }
  if (moved != 0) exchange->moved_at = now;
  exchange->rate.note(moved, waits_for_answer(*exchange, sent), now);
}

bool is_overdue(RetryClock::Point now, Exchange *exchange, int *patience) {
  auto end = exchange->moved_at + kStallTime;
  const std::chrono::seconds limit(exchange->request->seconds);
  if (limit.count() > 0) end = std::min(end, exchange->began_at + limit);
  end = std::min(end, exchange->rate.judged_at());
  *patience = std::min(*patience, milliseconds_until(end, now));
  if (exchange->request->has_body && !exchange->queue.is_known())
    *patience = std::min(*patience, kLookMs);
  return now >= end && !(end == exchange->rate.judged_at() && exchange->rate.goes_on(now));
}

bool gives_away(const HttpRequest &request, const std::string &text) {
  if (request.password.empty() || text.empty()) return false;
  const std::string pair = request.user + ":" + request.password;
  char *code = g_base64_encode(reinterpret_cast<const guchar *>(pair.data()), pair.size());
  const std::string basic = code;
  g_free(code);
  const auto holds = [&](const std::string &secret) {
    return text.find(secret) != std::string::npos;
  };
  return holds(request.password) || holds(basic) || holds("Signature=");
}

Outcome problem_of(const Curl &curl, const Exchange &exchange, CURLcode code) {
  if (code == CURLE_OK) return success();
  if (exchange.local_failure)
    return failure(BACKUP_TRANS_ERROR_LOCAL_FILE, "the local file cannot be read or written");
  if (exchange.too_large)
    return failure(BACKUP_TRANS_ERROR_TOO_LARGE, "the object is larger than it may be");
  if (exchange.too_long)
    return failure(BACKUP_TRANS_ERROR_SERVER, "the server's answer is too long");
  if (exchange.too_many) {
    Outcome later =
        failure(BACKUP_TRANS_ERROR_SERVER, "the server's answers are too long together");
    later.transient = true;
    return later;
  }
  std::string text = exchange.error[0] != '\0' ? exchange.error : curl.easy_strerror(code);
  switch (code) {
    case CURLE_PEER_FAILED_VERIFICATION:
    case CURLE_SSL_CACERT_BADFILE:
    case CURLE_SSL_ISSUER_ERROR:
    case CURLE_SSL_PINNEDPUBKEYNOTMATCH:
      return failure(BACKUP_TRANS_ERROR_CERTIFICATE, std::move(text));
    case CURLE_UNSUPPORTED_PROTOCOL:
    case CURLE_WEIRD_SERVER_REPLY: {
      Outcome stranger = failure(BACKUP_TRANS_ERROR_SERVER, std::move(text));
      stranger.wrong_address = true;
      return stranger;
    }
    default: {
      Outcome lost = failure(BACKUP_TRANS_ERROR_NETWORK, std::move(text));
      lost.transient = true;
      lost.wrong_address = code == CURLE_COULDNT_RESOLVE_HOST || code == CURLE_SSL_CONNECT_ERROR;
      return lost;
    }
  }
}

}  // namespace transport
