#include "http/http.h"

// The checking macros would want the functions themselves, which are looked up at run time.
#define CURL_DISABLE_TYPECHECK
#include <curl/curl.h>
#include <dlfcn.h>
#include <glib.h>
#include <linux/sockios.h>
#include <netinet/in.h>
#include <pthread.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <list>
#include <memory>
#include <mutex>
#include <set>

#include "core/checksum.h"
#include "core/symbols.h"
#include "http/http_date.h"
#include "http/least_rate.h"
#include "http/upload_queue.h"
#include "http/xml_answer.h"

namespace transport {
namespace {

using Clock = std::chrono::steady_clock;
using Lock = std::unique_lock<std::mutex>;

constexpr char kThreadName[] = "cloud-transport";
constexpr const char *kLibraries[] = {"libcurl.so.4", "libcurl-gnutls.so.4"};
constexpr long kConnectSeconds = 15;
constexpr int kIdleMs = 15000;
constexpr int kLookMs = 1000;  // how soon to look at what the kernel holds
constexpr std::size_t kThreadStackBytes = 1024 * 1024;
constexpr long kUploadBufferBytes = 64 * 1024;
constexpr long kNoContinueMs = 1;
constexpr char kPlainScheme[] = "http:";
constexpr char kNoProxy[] = "";
constexpr std::chrono::seconds kExitPatience{2};
constexpr std::chrono::seconds kLongestRetryAfter{3600};
constexpr guint kDecimal = 10;

struct Curl {
  decltype(&::curl_global_init) global_init = nullptr;
  decltype(&::curl_easy_init) easy_init = nullptr;
  decltype(&::curl_easy_setopt) easy_setopt = nullptr;
  decltype(&::curl_easy_getinfo) easy_getinfo = nullptr;
  decltype(&::curl_easy_cleanup) easy_cleanup = nullptr;
  decltype(&::curl_easy_strerror) easy_strerror = nullptr;
  decltype(&::curl_slist_append) slist_append = nullptr;
  decltype(&::curl_slist_free_all) slist_free_all = nullptr;
  decltype(&::curl_multi_init) multi_init = nullptr;
  decltype(&::curl_multi_setopt) multi_setopt = nullptr;
  decltype(&::curl_multi_add_handle) multi_add_handle = nullptr;
  decltype(&::curl_multi_remove_handle) multi_remove_handle = nullptr;
  decltype(&::curl_multi_perform) multi_perform = nullptr;
  decltype(&::curl_multi_poll) multi_poll = nullptr;
  decltype(&::curl_multi_wakeup) multi_wakeup = nullptr;
  decltype(&::curl_multi_info_read) multi_info_read = nullptr;
  decltype(&::curl_multi_cleanup) multi_cleanup = nullptr;
};

// The TLS library would otherwise take itself down when the process exits, under a thread that is
// only just setting it up.
void keep_tls_until_the_end(void *library) {
  constexpr uint64_t kNoExitHandler = 0x00080000;  // OPENSSL_INIT_NO_ATEXIT of <openssl/crypto.h>
  int (*init)(uint64_t, const void *) = nullptr;
  if (find_symbol(library, "OPENSSL_init_crypto", &init)) init(kNoExitHandler, nullptr);
}

bool load(Curl *curl) {
  void *library = nullptr;
  for (const char *name : kLibraries) {
    if (library == nullptr) library = dlopen(name, RTLD_NOW | RTLD_LOCAL);
  }
  if (library == nullptr) return false;
  keep_tls_until_the_end(library);
  count_checksums_with(library);
  return find_symbol(library, "curl_global_init", &curl->global_init) &&
         find_symbol(library, "curl_easy_init", &curl->easy_init) &&
         find_symbol(library, "curl_easy_setopt", &curl->easy_setopt) &&
         find_symbol(library, "curl_easy_getinfo", &curl->easy_getinfo) &&
         find_symbol(library, "curl_easy_cleanup", &curl->easy_cleanup) &&
         find_symbol(library, "curl_easy_strerror", &curl->easy_strerror) &&
         find_symbol(library, "curl_slist_append", &curl->slist_append) &&
         find_symbol(library, "curl_slist_free_all", &curl->slist_free_all) &&
         find_symbol(library, "curl_multi_init", &curl->multi_init) &&
         find_symbol(library, "curl_multi_setopt", &curl->multi_setopt) &&
         find_symbol(library, "curl_multi_add_handle", &curl->multi_add_handle) &&
         find_symbol(library, "curl_multi_remove_handle", &curl->multi_remove_handle) &&
         find_symbol(library, "curl_multi_perform", &curl->multi_perform) &&
         find_symbol(library, "curl_multi_poll", &curl->multi_poll) &&
         find_symbol(library, "curl_multi_wakeup", &curl->multi_wakeup) &&
         find_symbol(library, "curl_multi_info_read", &curl->multi_info_read) &&
         find_symbol(library, "curl_multi_cleanup", &curl->multi_cleanup) &&
         curl->global_init(CURL_GLOBAL_DEFAULT) == CURLE_OK;
}

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
  Clock::time_point moved_at;
  Clock::time_point began_at;
  bool local_failure = false;
  bool too_long = false;
  bool too_large = false;        // for the request's sink
  std::size_t header_bytes = 0;  // of every answer so far
  uint64_t sunk = 0;
  char error[CURL_ERROR_SIZE] = "";
  // Guarded by the engine's mutex.
  bool done = false;
  bool unwanted = false;
};
using ExchangePtr = std::shared_ptr<Exchange>;

std::size_t read_body(char *buffer, std::size_t size, std::size_t count, void *data) {
  Exchange &exchange = *static_cast<Exchange *>(data);
  const HttpRequest &request = *exchange.request;
  const std::size_t wanted = std::min<uint64_t>(
      size * count,
      (request.body_fd >= 0 ? request.body_size : request.body.size()) - exchange.sent);
  if (request.body_fd < 0) {
    std::memcpy(buffer, request.body.data() + exchange.sent, wanted);
    exchange.sent += wanted;
    return wanted;
  }
  ssize_t got = 0;
  do {
    got = pread(request.body_fd, buffer, wanted, static_cast<off_t>(exchange.sent));
  } while (got < 0 && errno == EINTR);
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
  if (exchange.too_long) return 0;
  const std::size_t room = success ? length : kMaxErrorBytes - exchange.answer.body.size();
  exchange.answer.body.append(buffer, std::min(length, room));
  return length;
}

// Some servers say what they were told.
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

int milliseconds_until(Clock::time_point end, Clock::time_point now) {
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - now).count();
  return static_cast<int>(std::clamp<int64_t>(left, 0, kIdleMs));
}

class Engine {
 public:
  // Never destroyed: see stop_at_exit().
  static Engine &get() {
    static Engine *const engine = new Engine;
    return *engine;
  }

  HttpAnswer perform(Ticket &ticket, const HttpRequest &request) {
    auto exchange = std::make_shared<Exchange>();
    exchange->request = &request;
    ticket.set_waker([this, exchange] {
      const Lock lock(mutex_);
      exchange->unwanted = true;
      if (multi_ != nullptr) curl_.multi_wakeup(multi_);
    });
    if (ticket.cancelled()) {
      ticket.set_waker(nullptr);
      exchange->answer.problem = cancelled();
      return exchange->answer;
    }
    if (const char *missing = xml_missing_for_answers()) {
      ticket.set_waker(nullptr);
      exchange->answer.problem =
          failure(BACKUP_TRANS_ERROR_NETWORK, std::string(missing) + " cannot be loaded");
      return std::move(exchange->answer);
    }
    {
      Lock lock(mutex_);
      if (start()) {
        incoming_.push_back(exchange);
        curl_.multi_wakeup(multi_);
        finished_.wait(lock, [&] { return exchange->done; });
      } else {
        exchange->answer.problem = failure(
            BACKUP_TRANS_ERROR_NETWORK, loaded_ ? "the HTTP library cannot be started"
                                                : std::string(kLibraries[0]) + " cannot be loaded");
      }
    }
    ticket.set_waker(nullptr);
    if (ticket.cancelled()) exchange->answer.problem = cancelled();
    return std::move(exchange->answer);
  }

  void set_clock(RetryClock *clock) {
    const Lock lock(mutex_);
    clock_ = clock == nullptr ? &RetryClock::system() : clock;
  }

  RetryClock *clock() {
    const Lock lock(mutex_);
    return clock_;
  }

  void prepare() {
    const Lock lock(mutex_);
    load_library();
  }

  void wake() {
    Lock lock(mutex_);
    if (!running_) return;
    const unsigned wanted = begun_rounds_ + 1;
    curl_.multi_wakeup(multi_);
    finished_.wait(lock, [&] { return !running_ || ended_rounds_ >= wanted; });
  }

 private:
  Engine() = default;

  // With the mutex held.
  bool load_library() {
    if (loaded_) return true;
    loaded_ = load(&curl_);
    if (!loaded_ && !told_) g_warning("cloud transport: %s cannot be loaded", kLibraries[0]);
    told_ = true;
    // After the TLS library's own handler was registered, thus to run before it.
    if (loaded_) std::atexit([] { get().stop_at_exit(); });
    return loaded_;
  }

  // With the mutex held.
  bool start() {
    if (running_) return true;
    if (!load_library() || stopping_) return false;
    if (multi_ == nullptr) {
      multi_ = curl_.multi_init();
      if (multi_ == nullptr) return false;
      curl_.multi_setopt(multi_, CURLMOPT_PIPELINING, CURLPIPE_MULTIPLEX);
      // By itself it closes connections when few transfers are left, to make others soon after.
      curl_.multi_setopt(multi_, CURLMOPT_MAXCONNECTS,
                         static_cast<long>(BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS));
    }
    pthread_attr_t attributes;
    pthread_attr_init(&attributes);
    pthread_attr_setdetachstate(&attributes, PTHREAD_CREATE_DETACHED);
    pthread_attr_setstacksize(&attributes, kThreadStackBytes);
    sigset_t all;
    sigset_t before;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &before);
    pthread_t thread;
    const int error = pthread_create(
        &thread, &attributes,
        [](void *engine) -> void * {
          prctl(PR_SET_NAME, kThreadName);
          static_cast<Engine *>(engine)->run();
          return nullptr;
        },
        this);
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    pthread_attr_destroy(&attributes);
    running_ = error == 0;
    return running_;
  }

  // Nothing may be inside the TLS library when the process takes it down.
  void stop_at_exit() {
    Lock lock(mutex_);
    stopping_ = true;
    if (!running_) return;
    curl_.multi_wakeup(multi_);
    finished_.wait_for(lock, kExitPatience, [this] { return !running_; });
  }

  void run() {
    std::list<ExchangePtr> active;
    for (;;) {
      Clock::time_point now;
      {
        const Lock lock(mutex_);
        // From before the bytes are moved, so that none which came in time counts as missing.
        now = clock_->now();
        ++begun_rounds_;
        if (stopping_) {
          running_ = false;
          finished_.notify_all();
          return;
        }
        for (const ExchangePtr &exchange : incoming_) {
          begin(*exchange, now);
          active.push_back(exchange);
        }
        incoming_.clear();
        for (auto it = active.begin(); it != active.end();) {
          if ((*it)->unwanted) end(**it);
          it = (*it)->done ? active.erase(it) : std::next(it);
        }
      }
      int still_running = 0;
      curl_.multi_perform(multi_, &still_running);
      collect(&active);
      int patience = kIdleMs;
      for (auto it = active.begin(); it != active.end();) {
        const ExchangePtr exchange = *it++;
        note_progress(*exchange, now);
        if (overdue(*exchange, now, &patience)) give_up(exchange, &active);
      }
      {
        const Lock lock(mutex_);
        ended_rounds_ = begun_rounds_;
        finished_.notify_all();
      }
      int events = 0;
      curl_.multi_poll(multi_, nullptr, 0, patience, &events);
      const Lock lock(mutex_);
      if (active.empty() && incoming_.empty() && events == 0 && idle_over()) {
        curl_.multi_cleanup(multi_);
        multi_ = nullptr;
        running_ = false;
        finished_.notify_all();
        return;
      }
    }
  }

  bool idle_over() const { return Clock::now() - last_end_ >= std::chrono::milliseconds(kIdleMs); }

  // The kernel takes megabytes at once, which can be minutes of a slow network.
  int queued_of(const Exchange &exchange) const {
    long port = 0;
    curl_.easy_getinfo(exchange.easy, CURLINFO_LOCAL_PORT, &port);
    const auto socket = std::find_if(sockets_.begin(), sockets_.end(),
                                     [port](int known) { return has_port(known, port); });
    return socket == sockets_.end() ? 0 : queued_bytes(*socket);
  }

  void note_progress(Exchange &exchange, Clock::time_point now) {
    curl_off_t sent = 0;
    curl_.easy_getinfo(exchange.easy, CURLINFO_SIZE_UPLOAD_T, &sent);
    int64_t moved = sent + exchange.received - exchange.moved;
    if (moved != 0) {
      exchange.moved += moved;
      exchange.queue.restart();
    } else if (exchange.request->has_body) {
      moved = exchange.queue.look(queued_of(exchange));
    }
    if (moved != 0) exchange.moved_at = now;
    exchange.rate.note(moved, waits_for_answer(exchange, sent), now);
  }

  // How long the server thinks is for the stall to tell.
  static bool waits_for_answer(const Exchange &exchange, curl_off_t sent) {
    if (exchange.received > 0) return false;
    const HttpRequest &request = *exchange.request;
    const uint64_t size = request.body_fd >= 0 ? request.body_size : request.body.size();
    return !request.has_body || (static_cast<uint64_t>(sent) >= size && exchange.queue.is_empty());
  }

  // Also tells when to look again.
  static bool overdue(Exchange &exchange, Clock::time_point now, int *patience) {
    auto end = exchange.moved_at + kStallTime;
    const std::chrono::seconds limit(exchange.request->seconds);
    if (limit.count() > 0) end = std::min(end, exchange.began_at + limit);
    end = std::min(end, exchange.rate.judged_at());
    *patience = std::min(*patience, milliseconds_until(end, now));
    if (exchange.request->has_body && !exchange.queue.is_known())
      *patience = std::min(*patience, kLookMs);
    return now >= end && !(end == exchange.rate.judged_at() && exchange.rate.goes_on(now));
  }

  void give_up(const ExchangePtr &exchange, std::list<ExchangePtr> *active) {
    exchange->answer.problem =
        failure(BACKUP_TRANS_ERROR_NETWORK,
                exchange->rate.is_kept() ? "the server went silent" : "the server is too slow");
    exchange->answer.problem.transient = true;
    const Lock lock(mutex_);
    end(*exchange);
    active->remove(exchange);
  }

  static curl_socket_t open_socket(void *data, curlsocktype, curl_sockaddr *address) {
    const int fd = socket(address->family, address->socktype | SOCK_CLOEXEC, address->protocol);
    if (fd >= 0) static_cast<Engine *>(data)->sockets_.insert(fd);
    return fd;
  }

  static int close_socket(void *data, curl_socket_t fd) {
    static_cast<Engine *>(data)->sockets_.erase(fd);
    return close(fd);
  }

  template <typename Value>
  void set(Exchange &exchange, CURLoption option, Value value) {
    curl_.easy_setopt(exchange.easy, option, value);
  }

  void trust_only(Exchange &exchange, const std::string &ca_file) {
    set(exchange, CURLOPT_CAINFO, ca_file.c_str());
    // Else the directory that libcurl was built with vouches as well.
    set(exchange, CURLOPT_CAPATH, static_cast<const char *>(nullptr));
    // Without a directory it would not read the file again for a day.
    set(exchange, CURLOPT_CA_CACHE_TIMEOUT, 0L);
  }

  // With the mutex held, on the transport thread.
  void begin(Exchange &exchange, Clock::time_point now) {
    const HttpRequest &request = *exchange.request;
    exchange.began_at = now;
    exchange.moved_at = now;
    exchange.rate.begin(now);
    exchange.easy = curl_.easy_init();
    for (const std::string &header : request.headers)
      exchange.headers = curl_.slist_append(exchange.headers, header.c_str());
    set(exchange, CURLOPT_PRIVATE, &exchange);
    set(exchange, CURLOPT_URL, request.url.c_str());
    set(exchange, CURLOPT_PROTOCOLS_STR, "http,https");
    // It is for this machine itself only, and would show a proxy the password.
    if (g_str_has_prefix(request.url.c_str(), kPlainScheme))
      set(exchange, CURLOPT_PROXY, static_cast<const char *>(kNoProxy));
    set(exchange, CURLOPT_FOLLOWLOCATION, 0L);
    set(exchange, CURLOPT_PATH_AS_IS, 1L);
    set(exchange, CURLOPT_NOSIGNAL, 1L);
    set(exchange, CURLOPT_QUICK_EXIT, 1L);
    set(exchange, CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_2TLS));
    set(exchange, CURLOPT_PIPEWAIT, 1L);
    set(exchange, CURLOPT_SSL_VERIFYPEER, 1L);
    set(exchange, CURLOPT_SSL_VERIFYHOST, 2L);
    if (!request.ca_file.empty()) trust_only(exchange, request.ca_file);
    set(exchange, CURLOPT_CONNECTTIMEOUT, kConnectSeconds);
    set(exchange, CURLOPT_OPENSOCKETFUNCTION, &open_socket);
    set(exchange, CURLOPT_OPENSOCKETDATA, this);
    set(exchange, CURLOPT_CLOSESOCKETFUNCTION, &close_socket);
    set(exchange, CURLOPT_CLOSESOCKETDATA, this);
    set(exchange, CURLOPT_ERRORBUFFER, static_cast<char *>(exchange.error));
    set(exchange, CURLOPT_HTTPHEADER, exchange.headers);
    if (!request.user.empty()) {
      if (request.signature.empty())
        set(exchange, CURLOPT_HTTPAUTH, static_cast<long>(CURLAUTH_BASIC));
      else
        set(exchange, CURLOPT_AWS_SIGV4, request.signature.c_str());
      set(exchange, CURLOPT_USERNAME, request.user.c_str());
      set(exchange, CURLOPT_PASSWORD, request.password.c_str());
    }
    if (request.has_body) {
      set(exchange, CURLOPT_UPLOAD, 1L);
      set(exchange, CURLOPT_UPLOAD_BUFFERSIZE, kUploadBufferBytes);
      // Small ones are not worth the wait for a go-ahead, which some servers never give.
      if (request.body_fd < 0) set(exchange, CURLOPT_EXPECT_100_TIMEOUT_MS, kNoContinueMs);
      set(exchange, CURLOPT_INFILESIZE_LARGE,
          static_cast<curl_off_t>(request.body_fd >= 0 ? request.body_size : request.body.size()));
      set(exchange, CURLOPT_READFUNCTION, &read_body);
      set(exchange, CURLOPT_READDATA, &exchange);
      set(exchange, CURLOPT_SEEKFUNCTION, &seek_body);
      set(exchange, CURLOPT_SEEKDATA, &exchange);
    }
    if (request.method == "HEAD") set(exchange, CURLOPT_NOBODY, 1L);
    set(exchange, CURLOPT_CUSTOMREQUEST, request.method.c_str());
    set(exchange, CURLOPT_HEADERFUNCTION, &take_header);
    set(exchange, CURLOPT_HEADERDATA, &exchange);
    set(exchange, CURLOPT_WRITEFUNCTION, &take_body);
    set(exchange, CURLOPT_WRITEDATA, &exchange);
    curl_.multi_add_handle(multi_, exchange.easy);
  }

  // With the mutex held, on the transport thread.
  void end(Exchange &exchange) {
    if (exchange.done) return;
    curl_.multi_remove_handle(multi_, exchange.easy);
    curl_.easy_cleanup(exchange.easy);
    curl_.slist_free_all(exchange.headers);
    exchange.done = true;
    last_end_ = Clock::now();
    finished_.notify_all();
  }

  void collect(std::list<ExchangePtr> *active) {
    int left = 0;
    while (CURLMsg *message = curl_.multi_info_read(multi_, &left)) {
      if (message->msg != CURLMSG_DONE) continue;
      const CURLcode code = message->data.result;
      char *data = nullptr;
      curl_.easy_getinfo(message->easy_handle, CURLINFO_PRIVATE, &data);
      Exchange &exchange = *reinterpret_cast<Exchange *>(data);
      exchange.answer.problem = problem_of(exchange, code);
      if (gives_away(*exchange.request, exchange.answer.reason)) exchange.answer.reason.clear();
      const Lock lock(mutex_);
      end(exchange);
      active->remove_if([&](const ExchangePtr &other) { return other.get() == &exchange; });
    }
  }

  Outcome problem_of(const Exchange &exchange, CURLcode code) const {
    if (code == CURLE_OK) return success();
    if (exchange.local_failure)
      return failure(BACKUP_TRANS_ERROR_LOCAL_FILE, "the local file cannot be read or written");
    if (exchange.too_large)
      return failure(BACKUP_TRANS_ERROR_TOO_LARGE, "the object is larger than it may be");
    if (exchange.too_long)
      return failure(BACKUP_TRANS_ERROR_SERVER, "the server's answer is too long");
    std::string text = exchange.error[0] != '\0' ? exchange.error : curl_.easy_strerror(code);
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

  std::mutex mutex_;
  std::condition_variable finished_;
  Curl curl_;
  CURLM *multi_ = nullptr;
  bool loaded_ = false;
  bool told_ = false;  // that it could not be loaded
  bool running_ = false;
  bool stopping_ = false;
  std::deque<ExchangePtr> incoming_;
  std::set<int> sockets_;  // the transport thread's own
  Clock::time_point last_end_;
  unsigned begun_rounds_ = 0;
  unsigned ended_rounds_ = 0;
  RetryClock *clock_ = &RetryClock::system();
};

std::optional<std::chrono::milliseconds> retry_after(const HttpAnswer &answer) {
  const std::string text = answer.header("retry-after");
  if (text.empty()) return std::nullopt;
  int64_t seconds = 0;
  if (text.find_first_not_of("0123456789") == std::string::npos) {
    seconds = static_cast<int64_t>(
        std::min<guint64>(g_ascii_strtoull(text.c_str(), nullptr, kDecimal), G_MAXINT64));
  } else {
    const std::optional<int64_t> when = parse_http_date(text);
    if (!when) return std::nullopt;
    // By the clock that the date is of: the device's may be another.
    const std::optional<int64_t> now = parse_http_date(answer.header("date"));
    seconds = std::max<int64_t>(0, *when - now.value_or(g_get_real_time() / G_USEC_PER_SEC));
  }
  return std::min(std::chrono::seconds(seconds), kLongestRetryAfter);
}

constexpr std::size_t kMaxSaidBytes = 200;

std::string printable(std::string text) {
  if (text.size() > kMaxSaidBytes) text.resize(kMaxSaidBytes);
  for (char &c : text) {
    if (c < ' ' || c > '~') c = '?';
  }
  return text;
}

/** Moved elsewhere, not there, or there but no such store. */
bool means_another_address(int status) {
  return (status >= 300 && status <= 399) || status == 404 || status == 405 || status == 410 ||
         status == 501;
}

}  // namespace

std::string HttpAnswer::header(const std::string &name) const {
  const auto it = headers.find(name);
  return it == headers.end() ? "" : it->second;
}

HttpAnswer http_perform(Ticket &ticket, const HttpRequest &request) {
  return Engine::get().perform(ticket, request);
}

bool http_pause(Ticket &ticket, std::chrono::milliseconds duration) {
  return Engine::get().clock()->pause(ticket, duration);
}

RetryClock::Point http_now() { return Engine::get().clock()->now(); }

void set_http_clock(RetryClock *clock) { Engine::get().set_clock(clock); }

void prepare_http() { Engine::get().prepare(); }

void wake_http() { Engine::get().wake(); }

Outcome outcome_of(const HttpAnswer &answer, const char *what) {
  if (!answer.complete()) return answer.problem;
  if (answer.good()) return success();
  Outcome outcome =
      failure(BACKUP_TRANS_ERROR_SERVER,
              std::string(what) + ": the server answered " + std::to_string(answer.status));
  outcome.said = printable(answer.reason);
  outcome.wrong_address = means_another_address(answer.status);
  switch (answer.status) {
    case 401:
    case 403:
    case 407:
      outcome.code = BACKUP_TRANS_ERROR_AUTHENTICATION;
      break;
    case 404:
    case 410:
      outcome.code = BACKUP_TRANS_ERROR_NO_SUCH_OBJECT;
      break;
    case 412:
      outcome.code = BACKUP_TRANS_ERROR_CONFLICT;
      break;
    case 413:
    case 507:
      outcome.code = BACKUP_TRANS_ERROR_QUOTA;
      break;
    case 408:
      outcome.code = BACKUP_TRANS_ERROR_NETWORK;
      outcome.transient = true;
      break;
    case 425:
    case 429:
    case 500:
    case 502:
    case 503:
    case 504:
      outcome.transient = true;
      break;
    default:
      break;
  }
  if (outcome.transient) outcome.retry_after = retry_after(answer);
  return outcome;
}

std::string encode_path(const std::string &path) {
  char *text = g_uri_escape_string(path.c_str(), "/", FALSE);
  std::string encoded = text;
  g_free(text);
  return encoded;
}

bool is_loopback(const std::string &host) {
  return host == "localhost" || host == "::1" ||
         (host.compare(0, 4, "127.") == 0 &&
          host.find_first_not_of("0123456789.") == std::string::npos);
}

namespace {

// An escape can stand for anything, also for what would end the name.
bool is_host(const std::string &host) {
  // Behind a percent sign is the interface that an address is reached through.
  if (host.find(':') != std::string::npos)
    return g_hostname_is_ip_address(host.substr(0, host.find('%')).c_str()) != FALSE;
  return std::all_of(host.begin(), host.end(),
                     [](char c) { return g_ascii_isalnum(c) || c == '-' || c == '.' || c == '_'; });
}

// WebDAV servers answer with single slashes whatever they are asked for; to S3 services "a//b" is
// another name than "a/b".
std::string with_single_slashes(const std::string &path) {
  std::string single;
  for (const char c : path) {
    if (c != '/' || single.empty() || single.back() != '/') single += c;
  }
  return single;
}

}  // namespace

bool parse_store_url(const std::string &url, const std::string &scheme, StoreUrl *parsed,
                     std::string *problem) {
  const std::string prefix = scheme + "+";
  if (url.compare(0, prefix.size(), prefix) != 0) return false;
  GUri *uri = g_uri_parse(url.c_str() + prefix.size(), G_URI_FLAGS_NONE, nullptr);
  const auto problem_of_uri = [&]() -> const char * {
    if (uri == nullptr || g_uri_get_host(uri) == nullptr || *g_uri_get_host(uri) == '\0')
      return "the url is not complete";
    if (g_uri_get_userinfo(uri) != nullptr)
      return "the url holds a user or password, which belong into keys of their own";
    if (!is_host(g_uri_get_host(uri))) return "the url's host is no name or address";
    if (g_uri_get_port(uri) == 0) return "the url's port cannot be 0";
    if (g_uri_get_query(uri) != nullptr || g_uri_get_fragment(uri) != nullptr)
      return "the url has a query or fragment";
    const std::string transport = g_uri_get_scheme(uri);
    if (transport == "https" || (transport == "http" && is_loopback(g_uri_get_host(uri))))
      return nullptr;
    return transport == "http" ? "plain http is for this machine itself only"
                               : "the url names no store that is known";
  };
  const char *found = problem_of_uri();
  if (found != nullptr) {
    *problem = found;
  } else {
    const std::string host = g_uri_get_host(uri);
    parsed->host = host;
    parsed->origin = std::string(g_uri_get_scheme(uri)) + "://" +
                     (host.find(':') == std::string::npos ? host : "[" + host + "]");
    if (g_uri_get_port(uri) > 0) parsed->origin += ":" + std::to_string(g_uri_get_port(uri));
    parsed->path = g_uri_get_path(uri);
    if (scheme == "webdav") parsed->path = with_single_slashes(parsed->path);
    while (!parsed->path.empty() && parsed->path.back() == '/') parsed->path.pop_back();
    parsed->base = parsed->origin + encode_path(parsed->path);
  }
  if (uri != nullptr) g_uri_unref(uri);
  return found == nullptr;
}

}  // namespace transport
