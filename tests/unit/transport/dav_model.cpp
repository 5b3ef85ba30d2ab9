#include "dav_model.h"

#include <glib.h>

using front::Request;
using front::Response;

namespace {

std::string parent_of(const std::string &path) { return path.substr(0, path.rfind('/')); }

bool is_within(const std::string &path, const std::string &folder) {
  return path == folder || path.compare(0, folder.size() + 1, folder + "/") == 0;
}

std::string tag_of(const std::string &content) {
  char *sum = g_compute_checksum_for_string(G_CHECKSUM_SHA256, content.data(),
                                            static_cast<gssize>(content.size()));
  const std::string tag = std::string("\"") + sum + "\"";
  g_free(sum);
  return tag;
}

// The content of the first element of that name with the prefix "d".
std::string element_of(const std::string &xml, const std::string &name) {
  const std::string open = "<d:" + name + ">";
  const std::size_t begin = xml.find(open);
  if (begin == std::string::npos) return "";
  const std::size_t end = xml.find("</d:" + name + ">", begin);
  return xml.substr(begin + open.size(), end - begin - open.size());
}

// "" for what is not below the root.
std::string path_of(const std::string &decoded) {
  if (!is_within(decoded, DavModel::kRoot)) return "";
  std::string path = decoded.substr(std::string(DavModel::kRoot).size());
  while (!path.empty() && path.back() == '/') path.pop_back();
  return path;
}

}  // namespace

void DavModel::set_password(const std::string &password) {
  const std::lock_guard<std::mutex> guard(mutex_);
  password_ = password;
}

void DavModel::refuse(const std::string &method, int status) {
  const std::lock_guard<std::mutex> guard(mutex_);
  refused_[method] = status;
}

void DavModel::set_room(std::size_t bytes) {
  const std::lock_guard<std::mutex> guard(mutex_);
  room_ = bytes;
}

std::map<std::string, std::string> DavModel::content(const std::string &folder) const {
  const std::lock_guard<std::mutex> guard(mutex_);
  std::map<std::string, std::string> found;
  for (const auto &[path, node] : nodes_) {
    if (path == folder || !is_within(path, folder)) continue;
    const auto child = nodes_.lower_bound(path + "/");
    const bool is_empty = child == nodes_.end() || !is_within(child->first, path);
    const std::string name = path.substr(folder.size());
    if (!node.is_collection) found[name] = node.content;
    if (node.is_collection && is_empty) found[name + "/"] = "";
  }
  return found;
}

void DavModel::put(const std::string &path, const std::string &content) {
  const std::lock_guard<std::mutex> guard(mutex_);
  for (std::string folder = parent_of(path); !folder.empty(); folder = parent_of(folder))
    nodes_[folder].is_collection = true;
  nodes_[path] = {false, content};
}

void DavModel::drop(const std::string &path) {
  const std::lock_guard<std::mutex> guard(mutex_);
  remove(path);
}

std::size_t DavModel::locks() const {
  const std::lock_guard<std::mutex> guard(mutex_);
  return locks_.size();
}

Response DavModel::serve(const Request &request) {
  const std::lock_guard<std::mutex> guard(mutex_);
  if (!authorized(request)) return {401, {{"WWW-Authenticate", "Basic realm=\"cloud\""}}};
  if (!is_within(request.path, kRoot)) return 404;
  const std::string path = path_of(request.path);
  const std::string &method = request.method;
  const auto refused = refused_.find(method);
  if (refused != refused_.end() && refused->second != 0) return refused->second;
  if (method == "GET" || method == "HEAD") return get(request, path);
  if (method == "PROPFIND") return list(request, path);
  if (method == "LOCK") return lock(request, path);
  if (method == "UNLOCK") return unlock(request, path);
  if (locked(request, path)) return 423;
  if (method == "PUT") return put_object(request, path);
  if (method == "MKCOL") return make_collection(path);
  if (method == "DELETE") return remove(path);
  if (method == "MOVE") return move(request, path);
  return 405;
}

bool DavModel::authorized(const Request &request) const {
  const std::string pair = std::string(kUser) + ":" + password_;
  char *code = g_base64_encode(reinterpret_cast<const guchar *>(pair.data()), pair.size());
  const bool right = request.header("authorization") == std::string("Basic ") + code;
  g_free(code);
  return right;
}

// Whoever names the token in a condition holds the lock.
bool DavModel::locked(const Request &request, const std::string &path) const {
  const std::string condition = request.header("if");
  for (const auto &[held, lock] : locks_) {
    const bool concerned =
        is_within(path, held) || (request.method == "DELETE" && is_within(held, path));
    if (concerned && condition.find(lock.token) == std::string::npos) return true;
  }
  return false;
}

bool DavModel::conditions_hold(const Request &request, const std::string &path) const {
  const auto node = nodes_.find(path);
  const bool present = node != nodes_.end();
  const std::string tag = present ? tag_of(node->second.content) : "";
  const std::string match = request.header("if-match");
  const std::string none = request.header("if-none-match");
  if (!match.empty() && (!present || (match != "*" && match != tag))) return false;
  return none.empty() || !present || (none != "*" && none != tag);
}

bool DavModel::has_collection(const std::string &path) const {
  const auto node = nodes_.find(path);
  return path.empty() || (node != nodes_.end() && node->second.is_collection);
}

Response DavModel::get(const Request &request, const std::string &path) const {
  const auto node = nodes_.find(path);
  if (has_collection(path)) {
    if (request.path.back() == '/') return 403;
    return {301, {{"Location", front::encoded(kRoot + path) + "/"}}};
  }
  if (node == nodes_.end() || request.path.back() == '/') return 404;
  return {200, {{"ETag", tag_of(node->second.content)}}, node->second.content};
}

Response DavModel::put_object(const Request &request, const std::string &path) {
  if (has_collection(path)) return 405;
  if (!has_collection(parent_of(path))) return 409;
  if (!conditions_hold(request, path)) return 412;
  if (request.body.size() > room_) return 507;
  const bool created = nodes_.count(path) == 0;
  nodes_[path] = {false, request.body};
  return {created ? 201 : 204, {{"ETag", tag_of(request.body)}}};
}

Response DavModel::make_collection(const std::string &path) {
  if (path.empty() || nodes_.count(path) != 0) return 405;
  if (!has_collection(parent_of(path))) return 409;
  nodes_[path].is_collection = true;
  return 201;
}

Response DavModel::remove(const std::string &path) {
  if (nodes_.count(path) == 0) return 404;
  for (auto it = nodes_.begin(); it != nodes_.end();)
    it = is_within(it->first, path) ? nodes_.erase(it) : std::next(it);
  for (auto it = locks_.begin(); it != locks_.end();)
    it = is_within(it->first, path) ? locks_.erase(it) : std::next(it);
  return 204;
}

Response DavModel::move(const Request &request, const std::string &path) {
  const std::string destination = request.header("destination");
  const std::size_t root = destination.find(kRoot);
  if (root == std::string::npos) return 502;
  const std::string target = path_of(front::decoded(destination.substr(root)));
  const auto node = nodes_.find(path);
  if (node == nodes_.end()) return 404;
  if (!has_collection(parent_of(target))) return 409;
  if (locked(request, target)) return 423;
  const bool replaces = nodes_.count(target) != 0;
  if (replaces && (request.header("overwrite") == "F" || has_collection(target))) return 412;
  nodes_[target] = node->second;
  nodes_.erase(path);
  return Response(replaces ? 204 : 201);
}

std::string DavModel::description(const std::string &path) const {
  const bool is_collection = has_collection(path);
  std::string text = "<response><href>" + front::encoded(kRoot + path) +
                     (is_collection ? "/" : "") + "</href><propstat><prop><resourcetype>" +
                     (is_collection ? "<collection/>" : "") + "</resourcetype>";
  if (!is_collection) {
    const std::string &content = nodes_.at(path).content;
    text += "<getcontentlength>" + std::to_string(content.size()) + "</getcontentlength><getetag>" +
            tag_of(content) + "</getetag>";
  }
  const auto held = locks_.find(path);
  text += "<lockdiscovery>";
  if (held != locks_.end()) {
    text += "<activelock><owner>" + held->second.owner + "</owner><locktoken><href>" +
            held->second.token + "</href></locktoken></activelock>";
  }
  return text + "</lockdiscovery></prop><status>HTTP/1.1 200 OK</status></propstat></response>";
}

Response DavModel::list(const Request &request, const std::string &path) const {
  const auto node = nodes_.find(path);
  if (!has_collection(path) && (node == nodes_.end() || request.path.back() == '/')) return 404;
  if (request.header("depth") == "infinity") return 403;
  std::string text =
      "<?xml version=\"1.0\" encoding=\"utf-8\"?><multistatus xmlns=\"DAV:\">" + description(path);
  if (request.header("depth") == "1") {
    for (const auto &[child, ignored] : nodes_) {
      if (child != path && parent_of(child) == path) text += description(child);
    }
  }
  return {207, {{"Content-Type", "application/xml"}}, text + "</multistatus>"};
}

Response DavModel::lock(const Request &request, const std::string &path) {
  if (!path.empty() && nodes_.count(path) == 0) return 404;
  for (const auto &[held, ignored] : locks_) {
    if (is_within(path, held) || is_within(held, path)) return 423;
  }
  const std::string token = "opaquelocktoken:" + std::to_string(++tokens_);
  locks_[path] = {token, element_of(request.body, "owner")};
  return {
      200,
      {{"Lock-Token", "<" + token + ">"}, {"Content-Type", "application/xml"}},
      "<?xml version=\"1.0\"?><prop xmlns=\"DAV:\"><lockdiscovery><activelock><locktoken><href>" +
          token + "</href></locktoken></activelock></lockdiscovery></prop>"};
}

Response DavModel::unlock(const Request &request, const std::string &path) {
  const auto held = locks_.find(path);
  if (held == locks_.end() || request.header("lock-token") != "<" + held->second.token + ">")
    return 409;
  locks_.erase(held);
  return 204;
}
