#include "s3_model.h"

#include <glib.h>

#include <algorithm>

using front::Request;
using front::Response;

namespace {

constexpr std::size_t kMaxKeys = 1000;
constexpr char kUnsigned[] = "UNSIGNED-PAYLOAD";

std::string checksum_of(GChecksumType type, const std::string &text) {
  char *sum = g_compute_checksum_for_string(type, text.data(), static_cast<gssize>(text.size()));
  std::string hex = sum;
  g_free(sum);
  return hex;
}

std::string tag_of(const std::string &content) {
  return "\"" + checksum_of(G_CHECKSUM_MD5, content) + "\"";
}

std::string base64_md5(const std::string &text) {
  GChecksum *checksum = g_checksum_new(G_CHECKSUM_MD5);
  g_checksum_update(checksum, reinterpret_cast<const guchar *>(text.data()),
                    static_cast<gssize>(text.size()));
  guchar digest[16];
  gsize size = sizeof digest;
  g_checksum_get_digest(checksum, digest, &size);
  g_checksum_free(checksum);
  char *code = g_base64_encode(digest, size);
  std::string result = code;
  g_free(code);
  return result;
}

Response error(int status, const std::string &code) {
  return {status,
          {{"Content-Type", "application/xml"}},
          "<?xml version=\"1.0\"?><Error><Code>" + code + "</Code><Message>No.</Message></Error>"};
}

Response xml(const std::string &body) { return {200, {{"Content-Type", "application/xml"}}, body}; }

std::string query_of(const Request &request, const std::string &name) {
  const auto it = request.query.find(name);
  return it == request.query.end() ? "" : it->second;
}

std::string unescaped(const std::string &text) {
  std::string plain;
  for (std::size_t at = 0; at < text.size(); ++at) {
    if (text.compare(at, 2, "&#") != 0) {
      plain += text[at];
      continue;
    }
    const std::size_t end = text.find(';', at);
    plain += static_cast<char>(std::stoi(text.substr(at + 2, end - at - 2)));
    at = end;
  }
  return plain;
}

bool has_prefix(const std::string &text, const std::string &prefix) {
  return text.compare(0, prefix.size(), prefix) == 0;
}

}  // namespace

void S3Model::set_accepting(bool accepting) {
  const std::lock_guard<std::mutex> guard(mutex_);
  accepting_ = accepting;
}

void S3Model::set_room(std::size_t bytes) {
  const std::lock_guard<std::mutex> guard(mutex_);
  room_ = bytes;
}

std::map<std::string, std::string> S3Model::content() const {
  const std::lock_guard<std::mutex> guard(mutex_);
  std::map<std::string, std::string> found;
  for (const auto &[key, object] : objects_) found["/" + key] = object.content;
  return found;
}

void S3Model::put(const std::string &path, const std::string &content) {
  const std::lock_guard<std::mutex> guard(mutex_);
  objects_[path.substr(1)] = {content, {}};
}

Response S3Model::serve(const Request &request) {
  const std::lock_guard<std::mutex> guard(mutex_);
  const bool is_signed = has_prefix(request.header("authorization"),
                                    std::string("AWS4-HMAC-SHA256 Credential=") + kUser + "/");
  if (!is_signed || !accepting_) return error(403, "SignatureDoesNotMatch");
  const std::string sent = request.header("x-amz-content-sha256");
  if (sent != kUnsigned && sent != checksum_of(G_CHECKSUM_SHA256, request.body))
    return error(400, "XAmzContentSHA256Mismatch");
  if (!has_prefix(request.path, kBucket)) return error(404, "NoSuchBucket");
  std::string key = request.path.substr(std::string(kBucket).size());
  if (!key.empty()) key.erase(0, 1);
  if (key.empty() && request.method == "GET") return list(request);
  if (key.empty() && request.method == "POST") return remove_many(request);
  if (request.method == "GET" || request.method == "HEAD") return get(key);
  if (request.method == "PUT") return put_object(request, key);
  if (request.method != "DELETE") return error(405, "MethodNotAllowed");
  objects_.erase(key);
  return 204;
}

Response S3Model::get(const std::string &key) const {
  const auto object = objects_.find(key);
  if (object == objects_.end()) return error(404, "NoSuchKey");
  Response response(200, object->second.metadata, object->second.content);
  response.headers["ETag"] = tag_of(object->second.content);
  return response;
}

bool S3Model::conditions_hold(const Request &request, const std::string &key) const {
  const auto object = objects_.find(key);
  const bool present = object != objects_.end();
  const std::string match = request.header("if-match");
  if (!match.empty() && (!present || match != tag_of(object->second.content))) return false;
  return request.header("if-none-match").empty() || !present;
}

Response S3Model::put_object(const Request &request, const std::string &key) {
  const std::string md5 = request.header("content-md5");
  if (!md5.empty() && md5 != base64_md5(request.body)) return error(400, "BadDigest");
  if (request.body.size() > room_) return error(403, "QuotaExceeded");
  if (!conditions_hold(request, key)) return error(412, "PreconditionFailed");
  Object &object = objects_[key];
  object.content = request.body;
  object.metadata.clear();
  for (const auto &[name, value] : request.headers) {
    if (has_prefix(name, "x-amz-meta-")) object.metadata[name] = value;
  }
  return {200, {{"ETag", tag_of(request.body)}}};
}

Response S3Model::list(const Request &request) const {
  const std::string prefix = query_of(request, "prefix");
  const std::string delimiter = query_of(request, "delimiter");
  const std::string after = query_of(request, "continuation-token");
  const std::string limit = query_of(request, "max-keys");
  const std::size_t most = limit.empty() ? kMaxKeys : std::min(kMaxKeys, std::stoul(limit));
  std::string body;
  std::string last;
  std::size_t count = 0;
  bool truncated = false;
  for (const auto &[key, object] : objects_) {
    if (!has_prefix(key, prefix) || (!last.empty() && last.back() == '/' && has_prefix(key, last)))
      continue;
    const std::size_t end =
        delimiter.empty() ? std::string::npos : key.find(delimiter, prefix.size());
    const std::string shown = end == std::string::npos ? key : key.substr(0, end + 1);
    if (!after.empty() && shown <= after) continue;
    truncated = count == most;
    if (truncated) break;
    ++count;
    last = shown;
    const std::string name = front::encoded(shown);
    body += end != std::string::npos
                ? "<CommonPrefixes><Prefix>" + name + "</Prefix></CommonPrefixes>"
                : "<Contents><Key>" + name + "</Key><Size>" +
                      std::to_string(object.content.size()) + "</Size></Contents>";
  }
  return xml(
      "<?xml version=\"1.0\"?><ListBucketResult><EncodingType>url</EncodingType><IsTruncated>" +
      std::string(truncated ? "true" : "false") + "</IsTruncated>" +
      (truncated ? "<NextContinuationToken>" + last + "</NextContinuationToken>" : "") + body +
      "</ListBucketResult>");
}

Response S3Model::remove_many(const Request &request) {
  static constexpr char kOpen[] = "<Key>";
  if (request.header("content-md5") != base64_md5(request.body)) return error(400, "BadDigest");
  for (std::size_t at = request.body.find(kOpen); at != std::string::npos;
       at = request.body.find(kOpen, at)) {
    at += std::string(kOpen).size();
    objects_.erase(unescaped(request.body.substr(at, request.body.find('<', at) - at)));
  }
  return xml("<?xml version=\"1.0\"?><DeleteResult></DeleteResult>");
}
