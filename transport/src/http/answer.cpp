#include "http/answer.h"

#include <glib.h>

#include <algorithm>
#include <chrono>
#include <optional>

#include "http/http_date.h"

namespace transport {
namespace {

constexpr std::chrono::seconds kLongestRetryAfter{3600};
constexpr guint kDecimal = 10;

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

}  // namespace transport
