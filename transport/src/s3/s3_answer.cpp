#include "s3/s3_answer.h"

#include <glib.h>

#include <array>

#include "http/xml_answer.h"

namespace transport {
namespace {

constexpr std::size_t kMd5Bytes = 16;
constexpr char kHexDigits[] = "0123456789abcdef";

// What codes mean where the status does not tell, or not enough.
struct Meaning {
  const char *code;
  backup_trans_error_code result;
  bool transient;
  const char *text;  // for people; null: the code says it
};
constexpr Meaning kMeanings[] = {
    {"AccessDenied", BACKUP_TRANS_ERROR_AUTHENTICATION, false, nullptr},
    {"AuthorizationHeaderMalformed", BACKUP_TRANS_ERROR_AUTHENTICATION, false,
     "is the region the right one?"},
    {"BadDigest", BACKUP_TRANS_ERROR_SERVER, true, "it did not arrive as it was sent"},
    // Swift's, to a writer who was overtaken.
    {"BrokenMPU", BACKUP_TRANS_ERROR_SERVER, true, nullptr},
    {"ConditionalRequestConflict", BACKUP_TRANS_ERROR_SERVER, true, nullptr},
    {"EntityTooLarge", BACKUP_TRANS_ERROR_QUOTA, false, nullptr},
    {"ExpiredToken", BACKUP_TRANS_ERROR_AUTHENTICATION, false, nullptr},
    {"IncompleteBody", BACKUP_TRANS_ERROR_SERVER, true, nullptr},
    {"InternalError", BACKUP_TRANS_ERROR_SERVER, true, nullptr},
    {"InvalidAccessKeyId", BACKUP_TRANS_ERROR_AUTHENTICATION, false,
     "the access key is not known there"},
    {"NoSuchBucket", BACKUP_TRANS_ERROR_SERVER, false, "there is no such bucket"},
    {"OperationAborted", BACKUP_TRANS_ERROR_SERVER, true, nullptr},
    {"PermanentRedirect", BACKUP_TRANS_ERROR_SERVER, false, "the bucket is at another endpoint"},
    {"QuotaExceeded", BACKUP_TRANS_ERROR_QUOTA, false, nullptr},
    {"RequestTimeTooSkewed", BACKUP_TRANS_ERROR_AUTHENTICATION, false,
     "the device's clock differs too much from the server's"},
    {"RequestTimeout", BACKUP_TRANS_ERROR_NETWORK, true, nullptr},
    {"ServiceUnavailable", BACKUP_TRANS_ERROR_SERVER, true, nullptr},
    {"SignatureDoesNotMatch", BACKUP_TRANS_ERROR_AUTHENTICATION, false,
     "is the secret the right one?"},
    {"SlowDown", BACKUP_TRANS_ERROR_SERVER, true, nullptr},
    {"XAmzContentSHA256Mismatch", BACKUP_TRANS_ERROR_SERVER, true,
     "it did not arrive as it was sent"},
};

bool is_md5(const std::string &text) {
  return text.size() == 2 * kMd5Bytes && text.find_first_not_of(kHexDigits) == std::string::npos;
}

}  // namespace

void explain(const S3Error &error, Outcome *outcome) {
  if (error.code.empty()) return;
  const char *text = nullptr;
  for (const Meaning &meaning : kMeanings) {
    if (error.code != meaning.code) continue;
    outcome->code = meaning.result;
    outcome->transient = meaning.transient;
    text = meaning.text;
  }
  outcome->message += " (" + error.code + (text == nullptr ? "" : std::string(": ") + text) + ")";
}

Outcome s3_outcome(const HttpAnswer &answer, const char *what) {
  Outcome result = outcome_of(answer, what);
  if (!answer.complete() || answer.good()) return result;
  explain(parse_s3_error(answer.body), &result);
  if (const char *missing = xml_missing_for_answers()) {
    result.message += std::string(" (") + missing + " cannot be loaded)";
  }
  if (result.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT) result.code = BACKUP_TRANS_ERROR_SERVER;
  return result;
}

bool is_absent_object(const HttpAnswer &answer) {
  // An answer without a body, to a HEAD, does not tell a missing bucket from a missing object.
  return is_absent(answer) && parse_s3_error(answer.body).code != "NoSuchBucket" &&
         xml_missing_for_answers() == nullptr;
}

std::string to_base64(const std::string &hex) {
  std::array<guchar, kMd5Bytes> bytes{};
  for (std::size_t i = 0; i < bytes.size(); ++i)
    bytes[i] = static_cast<guchar>(g_ascii_xdigit_value(hex[2 * i]) * 16 +
                                   g_ascii_xdigit_value(hex[2 * i + 1]));
  char *text = g_base64_encode(bytes.data(), bytes.size());
  std::string base64 = text;
  g_free(text);
  return base64;
}

std::string etag_of(const HttpAnswer &answer) {
  std::string etag = answer.header("etag");
  if (etag.size() >= 2 && etag.front() == '"' && etag.back() == '"')
    etag = etag.substr(1, etag.size() - 2);
  return etag;
}

std::string expected_md5(const HttpAnswer &answer) {
  const std::string own = answer.header(kChecksumHeader);
  if (is_md5(own)) return own;
  // With keys that the service does not hold itself the tag is something else.
  const std::string encryption = answer.header("x-amz-server-side-encryption");
  const bool plain_tag = (encryption.empty() || encryption == "AES256") &&
                         answer.header("x-amz-server-side-encryption-customer-algorithm").empty();
  const std::string etag = etag_of(answer);
  return plain_tag && is_md5(etag) ? etag : "";
}

}  // namespace transport
