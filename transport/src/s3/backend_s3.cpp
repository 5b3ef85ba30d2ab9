#include "s3/backend_s3.h"

#include <glib.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <map>
#include <memory>

#include "core/file_bytes.h"
#include "core/remote_path.h"
#include "http/http_store.h"
#include "s3/s3_answer.h"
#include "s3/s3_client.h"
#include "s3/s3_xml.h"

namespace transport {
namespace {

constexpr std::size_t kMaxKeysPerPage = 1000;
constexpr std::size_t kMaxPages = 1000;  // of one listing
constexpr std::size_t kHashBufferBytes = 64 * 1024;
constexpr int64_t kMillisecondsPerSecond = 1000;
constexpr char kUnsigned[] = "UNSIGNED-PAYLOAD";

// The content that is being sent, and what became of it so far.
struct Sending {
  std::string md5;
  std::string sha256;  // "" where the connection protects the content
  bool asked = false;  // an earlier attempt may have stored it
};

// What the store holds in an object's place.
struct Present {
  Version version;
  bool is_ours = false;
};

// Where a service sends whoever reads a listing: it must not be in circles, nor for ever.
class ListingRoute {
 public:
  bool leads_on(const std::string &token) {
    if (token.empty() || token == mark_ || ++pages_ > kMaxPages) return false;
    // Any circle comes back to a mark that is set ever later.
    if (pages_ == next_mark_) {
      mark_ = token;
      next_mark_ *= 2;
    }
    return true;
  }

 private:
  std::string mark_;
  std::size_t pages_ = 0;
  std::size_t next_mark_ = 1;
};

class S3Backend : public Backend {
 public:
  S3Backend(S3Place place, const Config &config) : client_(std::move(place), config) {}

  Outcome download(Attempt &attempt, const std::string &path, LocalTarget &target,
                   Version *version) override {
    if (!target.begin()) return local_failure("cannot make a local file");
    const std::string key = client_.key_of(path);
    const HttpRequest request = client_.signed_request("GET", key);
    Received received = receive(attempt.ticket, request, G_CHECKSUM_MD5, target);
    if (client_.takes_region_from(received.answer, request))
      received =
          receive(attempt.ticket, client_.signed_request("GET", key), G_CHECKSUM_MD5, target);
    if (is_absent_object(received.answer)) {
      if (version != nullptr) version->reset();
      return no_such_object();
    }
    if (!received.answer.good()) return s3_outcome(received.answer, "download");
    const std::string expected = expected_md5(received.answer);
    if (!expected.empty() && expected != received.checksum)
      return again("download: the object came damaged");
    const Outcome result = publish(attempt.ticket, received, target);
    if (result.ok() && version != nullptr) *version = etag_of(received.answer);
    return result;
  }

  Outcome upload(Attempt &attempt, const Upload &upload, ObjectInfo *info) override {
    if (!attempt.memory.has_value()) {
      auto fresh = std::make_shared<Sending>();
      const Outcome hashed = hash(attempt.ticket, upload.source, fresh.get());
      if (!hashed.ok()) return hashed;
      attempt.memory = fresh;
    }
    const auto sending = std::any_cast<std::shared_ptr<Sending>>(attempt.memory);
    Present present;
    if (sending->asked || upload.basis != nullptr) {
      const Outcome found = look(attempt.ticket, upload, *sending, &present);
      if (!found.ok()) return found;
    }
    Outcome result = success();
    if (!sending->asked || !present.is_ours) {
      if (upload.basis != nullptr && present.version != *upload.basis) return conflict();
      result = store(attempt.ticket, upload, sending.get());
    }
    if (!result.ok()) return result;
    *info = info_of(upload);
    return result;
  }

  Outcome list(Attempt &attempt, const std::string &folder, int start, int count,
               ListPage *page) override {
    const std::size_t first = static_cast<std::size_t>(start);
    const std::size_t last = first + static_cast<std::size_t>(count);
    // The service's order is not that of names: its folders end in a slash.
    std::map<std::string, ObjectInfo> children;
    const auto add = [&](const std::string &name, bool is_file, uint64_t size) {
      ObjectInfo child;
      child.path = folder + "/" + name;
      child.is_file = is_file;
      child.size = size;
      if (!is_object_path(child.path.c_str()) || name.find('/') != std::string::npos) return;
      const std::string path = child.path;
      children[path] = std::move(child);
      // One more than asked for tells that there is more.
      if (children.size() > last + 1) children.erase(std::prev(children.end()));
    };
    const std::string prefix =
        folder.empty() ? client_.place().prefix : client_.key_of(folder) + "/";
    const Outcome result =
        for_each_page(attempt.ticket, prefix, "/", [&](const S3Listing &listing) {
          for (const S3Object &object : listing.objects)
            add(object.key.substr(prefix.size()), true, object.size);
          for (const std::string &name : listing.prefixes)
            add(name.substr(prefix.size(), name.size() - prefix.size() - 1), false, 0);
          return success();
        });
    if (!result.ok()) return result;
    std::size_t index = 0;
    for (auto &[path, child] : children) {
      if (index >= first && index < last) page->children.push_back(std::move(child));
      ++index;
    }
    page->more = children.size() > last;
    return success();
  }

  Outcome remove_folder(Attempt &attempt, const std::string &folder) override {
    // An earlier attempt that failed may have had its effect all the same.
    bool held_object = attempt.memory.has_value();
    const Outcome result = for_each_page(
        attempt.ticket, client_.key_of(folder) + "/", "", [&](const S3Listing &listing) {
          std::vector<std::string> keys;
          for (const S3Object &object : listing.objects) {
            keys.push_back(object.key);
            const std::string path = "/" + object.key.substr(client_.place().prefix.size());
            held_object = held_object || is_object_path(path.c_str());
          }
          if (held_object) attempt.memory = true;
          return remove(attempt.ticket, keys);
        });
    if (!result.ok()) return result;
    return held_object ? success() : no_such_object();
  }

 private:
  using Parameters = std::map<std::string, std::string>;

  static Outcome conflict() {
    return failure(BACKUP_TRANS_ERROR_CONFLICT, "the object changed since it was read");
  }

  Outcome hash(Ticket &ticket, const LocalSource &source, Sending *sending) const {
    prepare_http();  // what it brings along counts faster
    Checksum md5(G_CHECKSUM_MD5);
    Checksum sha256(G_CHECKSUM_SHA256);
    const std::unique_ptr<char[]> buffer(new char[kHashBufferBytes]);
    uint64_t done = 0;
    for (;;) {
      if (ticket.cancelled()) return cancelled();
      const ssize_t count =
          read_at(source.fd(), buffer.get(), kHashBufferBytes, static_cast<off_t>(done));
      if (count < 0) return local_failure("cannot read the local file");
      if (count == 0) break;
      md5.add(buffer.get(), static_cast<std::size_t>(count));
      if (!client_.place().is_tls) sha256.add(buffer.get(), static_cast<std::size_t>(count));
      done += static_cast<uint64_t>(count);
    }
    if (done != source.size()) return local_change();
    sending->md5 = md5.hex();
    if (!client_.place().is_tls) sending->sha256 = sha256.hex();
    return success();
  }

  static Outcome local_change() {
    return failure(BACKUP_TRANS_ERROR_LOCAL_FILE, "the local file changed while it was sent");
  }

  Outcome look(Ticket &ticket, const Upload &upload, const Sending &sending, Present *present) {
    const HttpAnswer answer = client_.head(ticket, upload.path);
    if (is_absent(answer)) return success();
    if (!answer.good()) return s3_outcome(answer, "upload");
    present->version = etag_of(answer);
    present->is_ours =
        expected_md5(answer) == sending.md5 && has_size(answer, upload.source.size());
    return success();
  }

  HttpAnswer put(Ticket &ticket, const Upload &upload, const Sending &sending,
                 const std::string &condition) {
    HttpRequest request = client_.request_to(
        "PUT", client_.place().object_url + encode_path(client_.key_of(upload.path)));
    request.has_body = true;
    request.body_fd = upload.source.fd();
    request.body_size = upload.source.size();
    char time[64];
    g_snprintf(time, sizeof time, "x-amz-meta-mtime: %" G_GINT64_FORMAT ".%03d",
               upload.timestamp_ms / kMillisecondsPerSecond,
               static_cast<int>(upload.timestamp_ms % kMillisecondsPerSecond));
    request.headers = {"Content-Type: " + upload.content_type,
                       "Content-MD5: " + to_base64(sending.md5),
                       kChecksumHeader + (": " + sending.md5), time};
    if (!condition.empty()) request.headers.push_back(condition);
    return client_.perform(ticket, std::move(request),
                           client_.place().is_tls ? kUnsigned : sending.sha256);
  }

  std::string condition_for(const Upload &upload, bool bare_tags) const {
    if (upload.basis == nullptr || !conditions_) return "";
    if (!upload.basis->has_value()) return "If-None-Match: *";
    const std::string quote = bare_tags ? "" : "\"";
    return "If-Match: " + quote + **upload.basis + quote;
  }

  Outcome store(Ticket &ticket, const Upload &upload, Sending *sending) {
    sending->asked = true;
    // Another request may find out at the same time what this one still has to.
    const bool bare_tags = bare_tags_;
    const std::string condition = condition_for(upload, bare_tags);
    HttpAnswer answer = put(ticket, upload, *sending, condition);
    if (upload.basis != nullptr && answer.complete()) {
      if (answer.status == kHttpNotImplemented && !condition.empty()) {
        // Then there is nothing better than having looked right before.
        conditions_ = false;
        answer = put(ticket, upload, *sending, "");
      } else if (answer.status == kHttpPreconditionFailed) {
        Present present;
        const Outcome found = look(ticket, upload, *sending, &present);
        if (!found.ok()) return found;
        // The library itself may have repeated a request whose answer was lost.
        if (present.is_ours) return success();
        if (present.version != *upload.basis || bare_tags || !present.version) return conflict();
        bare_tags_ = true;
        answer = put(ticket, upload, *sending, condition_for(upload, true));
      } else if (is_absent_object(answer)) {
        return conflict();
      }
    }
    if (answer.good()) return verify(ticket, upload, *sending, answer);
    if (answer.complete() && !upload.source.unchanged()) return local_change();
    return s3_outcome(answer, "upload");
  }

  // A service that keeps checksums has said so with its tag; the others must at least have it all.
  Outcome verify(Ticket &ticket, const Upload &upload, const Sending &sending,
                 const HttpAnswer &answer) {
    if (etag_of(answer) == sending.md5) return success();
    const HttpAnswer kept = client_.head(ticket, upload.path);
    if (is_absent(kept)) return again("upload: it did not last");
    if (!kept.good()) return s3_outcome(kept, "upload");
    const std::string found = expected_md5(kept);
    if (!found.empty() && found != sending.md5) return again("upload: something else is there");
    return has_size(kept, upload.source.size()) ? success()
                                                : again("upload: it arrived incomplete");
  }

  // Calls @p visit with what lies below @p prefix, and stops when that fails.
  template <typename Visit>
  Outcome for_each_page(Ticket &ticket, const std::string &prefix, const char *delimiter,
                        Visit visit) {
    std::string token;
    ListingRoute route;
    do {
      Parameters parameters = {{"encoding-type", "url"},
                               {"list-type", "2"},
                               {"max-keys", std::to_string(kMaxKeysPerPage)},
                               {"prefix", prefix}};
      if (*delimiter != '\0') parameters["delimiter"] = delimiter;
      if (!token.empty()) parameters["continuation-token"] = token;
      const HttpAnswer answer = client_.perform(
          ticket,
          client_.request_to("GET", client_.place().bucket_url + make_s3_query(parameters)));
      if (!answer.good()) return s3_outcome(answer, "list");
      S3Listing listing;
      if (!parse_s3_listing(answer.body, &listing))
        return no_store("list: the server's answer is not a listing");
      if (listing.truncated && !route.leads_on(listing.next))
        return failure(BACKUP_TRANS_ERROR_SERVER, "list: the server's listing does not go on");
      drop_others(prefix, &listing);
      const Outcome result = visit(listing);
      if (!result.ok()) return result;
      token = listing.truncated ? listing.next : "";
    } while (!token.empty());
    return success();
  }

  // Nothing outside may be shown, let alone deleted, whatever the service says.
  static void drop_others(const std::string &prefix, S3Listing *listing) {
    const auto outside = [&](const std::string &key) {
      return key.size() < prefix.size() || key.compare(0, prefix.size(), prefix) != 0;
    };
    auto &objects = listing->objects;
    objects.erase(std::remove_if(objects.begin(), objects.end(),
                                 [&](const S3Object &object) { return outside(object.key); }),
                  objects.end());
    auto &prefixes = listing->prefixes;
    prefixes.erase(std::remove_if(prefixes.begin(), prefixes.end(),
                                  [&](const std::string &other) {
                                    return outside(other) || other.size() == prefix.size();
                                  }),
                   prefixes.end());
  }

  Outcome remove(Ticket &ticket, const std::vector<std::string> &keys) {
    std::vector<std::string> together;
    std::vector<std::string> alone;
    for (const std::string &key : keys)
      (many_at_once_ && fits_xml(key) ? together : alone).push_back(key);
    if (!together.empty()) {
      bool refused = false;
      const Outcome result = remove_together(ticket, together, &refused);
      if (!result.ok()) return result;
      if (refused) alone.insert(alone.end(), together.begin(), together.end());
    }
    for (const std::string &key : alone) {
      const HttpAnswer answer = client_.perform(
          ticket, client_.request_to("DELETE", client_.place().object_url + encode_path(key)));
      if (!answer.good() && !is_absent_object(answer)) return s3_outcome(answer, "delete");
    }
    return success();
  }

  Outcome remove_together(Ticket &ticket, const std::vector<std::string> &keys, bool *refused) {
    HttpRequest request =
        client_.request_to("POST", client_.place().bucket_url + make_s3_query({{"delete", ""}}));
    request.has_body = true;
    request.body = make_s3_deletion(keys);
    request.headers = {"Content-Type: application/xml",
                       "Content-MD5: " + to_base64(checksum_of(G_CHECKSUM_MD5, request.body))};
    const HttpAnswer answer = client_.perform(ticket, std::move(request));
    if (answer.complete() &&
        (answer.status == kHttpNotImplemented || answer.status == kHttpMethodNotAllowed)) {
      many_at_once_ = false;
      *refused = true;
      return success();
    }
    if (!answer.good()) return s3_outcome(answer, "delete");
    std::vector<S3Error> errors;
    if (!parse_s3_deletion(answer.body, &errors))
      return failure(BACKUP_TRANS_ERROR_SERVER, "delete: the server's answer tells no result");
    if (errors.empty()) return success();
    Outcome kept = failure(BACKUP_TRANS_ERROR_SERVER, "delete: the server kept an object");
    explain(errors.front(), &kept);
    return kept;
  }

  S3Client client_;
  // What the service turned out not to have.
  std::atomic<bool> conditions_{true};
  std::atomic<bool> bare_tags_{false};  // it compares tags without their quotes
  std::atomic<bool> many_at_once_{true};
};

}  // namespace

std::shared_ptr<Backend> make_s3_backend(const StoreUrl &url, const Config &config,
                                         std::string *problem) {
  S3Place place;
  *problem = find_s3_place(url, config, &place);
  if (!problem->empty()) return nullptr;
  return std::make_shared<S3Backend>(std::move(place), config);
}

}  // namespace transport
