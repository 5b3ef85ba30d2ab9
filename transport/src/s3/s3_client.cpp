#include "s3/s3_client.h"

#include <glib.h>

#include <utility>

#include "core/remote_path.h"
#include "s3/s3_xml.h"

namespace transport {
namespace {

constexpr int kMovedPermanently = 301;
constexpr std::size_t kMaxPrefixBytes = 1024 - kMaxPathBytes;  // a key has 1024 bytes at the most
constexpr char kUsualRegion[] = "us-east-1";

bool is_ip_address(const std::string &host) { return g_hostname_is_ip_address(host.c_str()) != 0; }

std::string signature_in(const std::string &region) { return "aws:amz:" + region + ":s3"; }

}  // namespace

std::string find_s3_place(const StoreUrl &url, const Config &config, S3Place *place) {
  const std::string path = url.path.empty() ? "" : url.path.substr(1);
  const std::string bucket = path.substr(0, path.find('/'));
  const std::string prefix = bucket.size() == path.size() ? "" : path.substr(bucket.size());
  if (!is_s3_name(bucket) || bucket.front() == '.') return "the url names no bucket";
  if (!prefix.empty() && !is_object_path(prefix.c_str()))
    return "the url's path behind the bucket is no folder";
  if (prefix.size() > kMaxPrefixBytes) return "the url's path behind the bucket is too long";
  if (config.user.empty() || config.password.empty())
    return "the store needs an access key as user and a secret as password";
  if (!config.region.empty() && !is_s3_name(config.region)) return "the region is no name";
  const bool is_virtual = config.addressing == "virtual";
  if (!is_virtual && !config.addressing.empty() && config.addressing != "path")
    return "the addressing is neither path nor virtual";
  if (is_virtual && is_ip_address(url.host)) return "virtual addressing needs a host with a name";
  place->is_tls = url.origin.compare(0, 6, "https:") == 0;
  place->prefix = prefix.empty() ? "" : prefix.substr(1) + "/";
  if (is_virtual) {
    std::string origin = url.origin;
    origin.insert(origin.find("//") + 2, bucket + ".");
    place->object_url = origin + "/";
    place->bucket_url = origin + "/";
  } else {
    place->bucket_url = url.origin + "/" + bucket;
    place->object_url = place->bucket_url + "/";
  }
  return "";
}

std::string checksum_of(GChecksumType type, const std::string &text) {
  Checksum checksum(type);
  checksum.add(text.data(), text.size());
  return checksum.hex();
}

S3Client::S3Client(S3Place place, const Config &config)
    : place_(std::move(place)),
      user_(config.user),
      password_(config.password),
      ca_file_(config.ca_file),
      region_(config.region.empty() ? kUsualRegion : config.region) {}

HttpRequest S3Client::request_to(const char *method, std::string url) const {
  HttpRequest request;
  request.method = method;
  request.url = std::move(url);
  request.user = user_;
  request.password = password_;
  request.ca_file = ca_file_;
  return request;
}

void S3Client::sign(const std::string &payload, HttpRequest *request) {
  const MutexLock guard(mutex_);
  request->headers.push_back("x-amz-content-sha256: " + payload);
  request->signature = signature_in(region_);
}

HttpRequest S3Client::signed_request(const char *method, const std::string &key) {
  HttpRequest request = request_to(method, place_.object_url + encode_path(key));
  sign(checksum_of(G_CHECKSUM_SHA256, ""), &request);
  return request;
}

bool S3Client::takes_region_from(const HttpAnswer &answer, const HttpRequest &request) {
  if (!answer.complete() ||
      (answer.status != kMovedPermanently && answer.status != kHttpBadRequest))
    return false;
  std::string named = answer.header("x-amz-bucket-region");
  if (!is_s3_name(named)) named = parse_s3_error(answer.body).region;
  const MutexLock guard(mutex_);
  if (named.empty() || signature_in(named) == request.signature) return false;
  region_ = named;
  return true;
}

HttpAnswer S3Client::perform(Ticket &ticket, HttpRequest request, const std::string &payload) {
  const std::vector<std::string> headers = request.headers;
  sign(payload, &request);
  HttpAnswer answer = http_perform(ticket, request);
  if (!takes_region_from(answer, request)) return answer;
  request.headers = headers;
  sign(payload, &request);
  return http_perform(ticket, request);
}

HttpAnswer S3Client::perform(Ticket &ticket, HttpRequest request) {
  const std::string payload = checksum_of(G_CHECKSUM_SHA256, request.body);
  return perform(ticket, std::move(request), payload);
}

HttpAnswer S3Client::head(Ticket &ticket, const std::string &path) {
  return perform(ticket, request_to("HEAD", place_.object_url + encode_path(key_of(path))));
}

}  // namespace transport
