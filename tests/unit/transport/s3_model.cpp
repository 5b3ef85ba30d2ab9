#include "s3_model.h"

#include <glib.h>
#include <libxml/parser.h>
#include <libxml/tree.h>

#include <algorithm>

using front::Request;
using front::Response;

namespace {

Response error(int status, const std::string &code, const std::string &more = "") {
  return {status,
          {{"Content-Type", "application/xml"}},
          "<?xml version=\"1.0\" encoding=\"UTF-8\"?><Error><Code>" + code +
              "</Code><Message>Because</Message>" + more + "</Error>"};
}

std::string hex_of(GChecksumType type, const std::string &text) {
  char *sum = g_compute_checksum_for_string(type, text.data(), static_cast<gssize>(text.size()));
  const std::string hex = sum;
  g_free(sum);
  return hex;
}

std::string md5_in_base64(const std::string &text) {
  guint8 digest[16];
  gsize length = sizeof digest;
  GChecksum *checksum = g_checksum_new(G_CHECKSUM_MD5);
  g_checksum_update(checksum, reinterpret_cast<const guchar *>(text.data()),
                    static_cast<gssize>(text.size()));
  g_checksum_get_digest(checksum, digest, &length);
  g_checksum_free(checksum);
  char *code = g_base64_encode(digest, length);
  const std::string base64 = code;
  g_free(code);
  return base64;
}

std::string hmac(const std::string &key, const std::string &text) {
  guint8 digest[32];
  gsize length = sizeof digest;
  GHmac *code =
      g_hmac_new(G_CHECKSUM_SHA256, reinterpret_cast<const guchar *>(key.data()), key.size());
  g_hmac_update(code, reinterpret_cast<const guchar *>(text.data()),
                static_cast<gssize>(text.size()));
  g_hmac_get_digest(code, digest, &length);
  g_hmac_unref(code);
  return {reinterpret_cast<const char *>(digest), length};
}

std::string in_hex(const std::string &bytes) {
  std::string hex;
  for (const char c : bytes) {
    char two[3];
    g_snprintf(two, sizeof two, "%02x", static_cast<unsigned char>(c));
    hex += two;
  }
  return hex;
}

// What follows @p name= up to a comma.
std::string field(const std::string &text, const std::string &name) {
  const std::size_t start = text.find(name + "=");
  if (start == std::string::npos) return "";
  const std::size_t from = start + name.size() + 1;
  return text.substr(from, text.find(',', from) - from);
}

std::vector<std::string> split(const std::string &text, char separator) {
  std::vector<std::string> parts(1);
  for (const char c : text) {
    if (c == separator)
      parts.emplace_back();
    else
      parts.back() += c;
  }
  return parts;
}

// As a service computes it, from the request as it came.
std::string signature_of(const Request &request, const std::string &secret,
                         const std::string &region) {
  const std::string signed_names = field(request.header("authorization"), "SignedHeaders");
  const std::size_t mark = request.target.find('?');
  std::string canonical = request.method + "\n" + request.target.substr(0, mark) + "\n" +
                          (mark == std::string::npos ? "" : request.target.substr(mark + 1)) + "\n";
  for (const std::string &name : split(signed_names, ';'))
    canonical += name + ":" + request.header(name) + "\n";
  canonical += "\n" + signed_names + "\n" + request.header("x-amz-content-sha256");
  const std::string time = request.header("x-amz-date");
  const std::string day = time.substr(0, time.find('T'));
  const std::string scope = day + "/" + region + "/s3/aws4_request";
  std::string key = "AWS4" + secret;
  for (const std::string &part : {day, region, std::string("s3"), std::string("aws4_request")})
    key = hmac(key, part);
  return in_hex(hmac(key, "AWS4-HMAC-SHA256\n" + time + "\n" + scope + "\n" +
                              hex_of(G_CHECKSUM_SHA256, canonical)));
}

bool is_sorted_query(const std::string &target) {
  const std::size_t mark = target.find('?');
  if (mark == std::string::npos) return true;
  const std::vector<std::string> parts = split(target.substr(mark + 1), '&');
  return std::is_sorted(parts.begin(), parts.end());
}

// A blank as a plus, as some services do it.
std::string url_encoded(const std::string &text) {
  std::string encoded;
  char *escaped = g_uri_escape_string(text.c_str(), "/", FALSE);
  for (const char *c = escaped; *c != '\0'; ++c) {
    if (std::string(c, 3) == "%20") {
      encoded += '+';
      c += 2;
    } else {
      encoded += *c;
    }
  }
  g_free(escaped);
  return encoded;
}

std::string xml_escaped(const std::string &text) {
  char *escaped = g_markup_escape_text(text.c_str(), -1);
  const std::string xml = escaped;
  g_free(escaped);
  return xml;
}

std::vector<std::string> keys_in(const std::string &xml) {
  std::vector<std::string> keys;
  xmlDoc *document = xmlReadMemory(xml.data(), static_cast<int>(xml.size()), nullptr, nullptr, 0);
  if (document == nullptr) return keys;
  const xmlNode *root = xmlDocGetRootElement(document);
  for (const xmlNode *object = root->children; object != nullptr; object = object->next) {
    if (std::string(reinterpret_cast<const char *>(object->name)) != "Object") continue;
    xmlChar *text = xmlNodeGetContent(object->children);
    keys.emplace_back(reinterpret_cast<const char *>(text));
    xmlFree(text);
  }
  xmlFreeDoc(document);
  return keys;
}

std::string parameter(const Request &request, const std::string &name) {
  const auto it = request.query.find(name);
  return it == request.query.end() ? "" : it->second;
}

}  // namespace

void S3Model::set_secret(const std::string &secret) {
  const std::lock_guard<std::mutex> guard(mutex_);
  secret_ = secret;
}

void S3Model::set_room(std::size_t bytes) {
  const std::lock_guard<std::mutex> guard(mutex_);
  room_ = bytes;
}

std::map<std::string, std::string> S3Model::content(const std::string &prefix) const {
  const std::lock_guard<std::mutex> guard(mutex_);
  std::map<std::string, std::string> found;
  for (const auto &[key, object] : objects_) {
    if (key.compare(0, prefix.size(), prefix) == 0)
      found[key.substr(prefix.size())] = object.content;
  }
  return found;
}

void S3Model::put(const std::string &key, const std::string &content) {
  const std::lock_guard<std::mutex> guard(mutex_);
  ++writes_;
  objects_[key] = object_of(content);
}

void S3Model::erase(const std::string &key) {
  const std::lock_guard<std::mutex> guard(mutex_);
  objects_.erase(key);
}

std::string S3Model::header(const std::string &key, const std::string &name) const {
  const std::lock_guard<std::mutex> guard(mutex_);
  const auto object = objects_.find(key);
  if (object == objects_.end()) return "";
  const auto it = object->second.headers.find(name);
  return it == object->second.headers.end() ? "" : it->second;
}

void S3Model::set_header(const std::string &key, const std::string &name,
                         const std::string &value) {
  const std::lock_guard<std::mutex> guard(mutex_);
  objects_.at(key).headers[name] = value;
}

S3Model::Object S3Model::object_of(const std::string &content) const {
  Object object;
  object.content = content;
  object.tag =
      settings.tags_are_md5 ? hex_of(G_CHECKSUM_MD5, content) : "opaque-" + std::to_string(writes_);
  return object;
}

Response S3Model::serve(const Request &request) {
  const std::lock_guard<std::mutex> guard(mutex_);
  Response refused = refusal(request);
  if (refused.status != 200) {
    // An answer to a HEAD has no body, whatever it says.
    if (request.method == "HEAD") refused.body.clear();
    return refused;
  }
  std::string path = request.path;
  if (settings.host.empty()) {
    const std::string bucket = std::string("/") + kBucket;
    if (path != bucket && path.compare(0, bucket.size() + 1, bucket + "/") != 0)
      return error(404, "NoSuchBucket");
    path.erase(0, bucket.size());
  }
  const std::string key = path.empty() ? "" : path.substr(1);
  const std::string &method = request.method;
  if (key.empty() && method == "GET") return list(request);
  if (key.empty() && method == "POST" && request.query.count("delete") != 0)
    return remove_many(request);
  if (key.empty()) return error(405, "MethodNotAllowed");
  if (method == "GET" || method == "HEAD") return get(request, key);
  if (method == "PUT") return put_object(request, key);
  if (method != "DELETE") return error(405, "MethodNotAllowed");
  objects_.erase(key);
  return 204;
}

Response S3Model::refusal(const Request &request) const {
  if (!settings.host.empty() && request.header("host") != kBucket + ("." + settings.host))
    return error(404, "NoSuchBucket");
  const std::string authorization = request.header("authorization");
  const std::vector<std::string> scope = split(field(authorization, "Credential"), '/');
  if (scope.size() != 5 || scope[3] != "s3") return error(403, "AccessDenied");
  if (scope[0] != kUser) return error(403, "InvalidAccessKeyId");
  if (scope[2] != settings.region)
    return error(400, "AuthorizationHeaderMalformed", "<Region>" + settings.region + "</Region>");
  if (!is_sorted_query(request.target) ||
      field(authorization, "Signature") != signature_of(request, secret_, settings.region))
    return error(403, "SignatureDoesNotMatch");
  if (!settings.checks_bodies) return 200;
  const std::string payload = request.header("x-amz-content-sha256");
  if (payload != "UNSIGNED-PAYLOAD" && payload != hex_of(G_CHECKSUM_SHA256, request.body))
    return error(400, "XAmzContentSHA256Mismatch");
  const std::string md5 = request.header("content-md5");
  if (!md5.empty() && md5 != md5_in_base64(request.body)) return error(400, "BadDigest");
  return 200;
}

Response S3Model::list(const Request &request) const {
  const std::string prefix = parameter(request, "prefix");
  const std::string delimiter = parameter(request, "delimiter");
  const std::string after = parameter(request, "continuation-token");
  const bool encoded = settings.encodes_keys && parameter(request, "encoding-type") == "url";
  const auto written = [&](const std::string &key) {
    return xml_escaped(encoded ? url_encoded(key) : key);
  };
  std::string entries;
  std::string last;
  std::size_t count = 0;
  bool truncated = false;
  for (const auto &[key, object] : objects_) {
    if (key.compare(0, prefix.size(), prefix) != 0) continue;
    const std::size_t end =
        delimiter.empty() ? std::string::npos : key.find(delimiter, prefix.size());
    const std::string name = end == std::string::npos ? key : key.substr(0, end + 1);
    if (name <= after || name == last) continue;
    if (count == settings.page) {
      truncated = true;
      break;
    }
    ++count;
    last = name;
    if (end == std::string::npos) {
      entries += "<Contents><Key>" + written(name) +
                 "</Key><LastModified>2026-11-21T19:44:52.000Z</LastModified><ETag>&quot;" +
                 object.tag + "&quot;</ETag><Size>" + std::to_string(object.content.size()) +
                 "</Size><StorageClass>STANDARD</StorageClass></Contents>";
    } else {
      entries += "<CommonPrefixes><Prefix>" + written(name) + "</Prefix></CommonPrefixes>";
    }
  }
  return {
      200,
      {{"Content-Type", "application/xml"}},
      std::string("<?xml version=\"1.0\" encoding=\"UTF-8\"?><ListBucketResult "
                  "xmlns=\"http://s3.amazonaws.com/doc/2006-03-01/\">") +
          (encoded ? "<EncodingType>url</EncodingType>" : "") + "<IsTruncated>" +
          (truncated ? "true" : "false") + "</IsTruncated>" +
          (truncated ? "<NextContinuationToken>" + xml_escaped(last) + "</NextContinuationToken>"
                     : "") +
          entries + "</ListBucketResult>"};
}

Response S3Model::remove_many(const Request &request) {
  if (!settings.deletes_many) return error(501, "NotImplemented");
  if (request.header("content-md5").empty()) return error(400, "InvalidRequest");
  std::string errors;
  for (const std::string &key : keys_in(request.body)) {
    if (settings.sticking.count(key) != 0)
      errors += "<Error><Key>" + xml_escaped(key) + "</Key><Code>" + settings.sticking_code +
                "</Code></Error>";
    else
      objects_.erase(key);
  }
  return {200,
          {{"Content-Type", "application/xml"}},
          "<?xml version=\"1.0\"?><DeleteResult>" + errors + "</DeleteResult>"};
}

Response S3Model::get(const Request &request, const std::string &key) const {
  const auto it = objects_.find(key);
  if (it == objects_.end())
    return request.method == "HEAD" ? Response(404) : error(404, "NoSuchKey");
  Response response(200, it->second.headers, it->second.content);
  response.headers["ETag"] = "\"" + it->second.tag + "\"";
  return response;
}

Response S3Model::put_object(const Request &request, const std::string &key) {
  if (request.body.size() > room_) return error(403, "QuotaExceeded");
  const std::string match = request.header("if-match");
  const bool if_absent = request.header("if-none-match") == "*";
  if (!match.empty() || if_absent) {
    const auto it = objects_.find(key);
    const bool quoted = match.size() > 1 && match.front() == '"';
    const std::string bare = quoted ? match.substr(1, match.size() - 2) : match;
    const bool same =
        it != objects_.end() &&
        it->second.tag == (settings.conditions == Conditions::bare_tags_only ? match : bare);
    if (settings.conditions == Conditions::refused) return error(501, "NotImplemented");
    if (settings.conditions != Conditions::ignored) {
      if (if_absent && it != objects_.end()) return error(412, "PreconditionFailed");
      if (!match.empty() && it == objects_.end()) return error(404, "NoSuchKey");
      if (!match.empty() && !same) return error(412, "PreconditionFailed");
    }
  }
  ++writes_;
  Object object = object_of(request.body);
  for (const auto &[name, value] : request.headers) {
    if (name.compare(0, 11, "x-amz-meta-") == 0 || name == "content-type")
      object.headers[name] = value;
  }
  objects_[key] = object;
  return {200, {{"ETag", "\"" + object.tag + "\""}}};
}
