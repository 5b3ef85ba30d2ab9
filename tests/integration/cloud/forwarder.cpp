#include "forwarder.h"

#include <set>

#include "http/http.h"

namespace {

std::string origin_of(int port) { return "http://127.0.0.1:" + std::to_string(port); }

// What each of the two connections has of its own.
bool is_handed_on(const std::string &header) {
  static const std::set<std::string> kOwn = {"host",       "content-length", "transfer-encoding",
                                             "connection", "expect",         "keep-alive"};
  return kOwn.count(header) == 0;
}

}  // namespace

Forwarder::Forwarder(int port) : server_(origin_of(port)) {}

void Forwarder::before(const std::string &method, Hook hook) {
  const std::lock_guard<std::mutex> guard(mutex_);
  hooks_[method] = std::move(hook);
}

front::Response Forwarder::serve(const front::Request &request) {
  Hook hook;
  {
    const std::lock_guard<std::mutex> guard(mutex_);
    hook.swap(hooks_[request.method]);
  }
  if (hook) hook(request);
  transport::HttpRequest on;
  on.method = request.method;
  on.url = server_ + request.target;
  const std::string own = origin_of(port());
  for (const auto &[name, value] : request.headers) {
    std::string text = value;
    // Conditions and destinations are told with the server's name.
    for (auto at = text.find(own); at != std::string::npos; at = text.find(own, at))
      text.replace(at, own.size(), server_);
    if (is_handed_on(name)) on.headers.push_back(name + ": " + text);
  }
  on.has_body = !request.header("content-length").empty();
  on.body = request.body;
  transport::Ticket ticket;
  const transport::HttpAnswer answer = transport::http_perform(ticket, on);
  front::Response response(answer.complete() ? answer.status : 502);
  for (const auto &[name, value] : answer.headers) {
    if (is_handed_on(name)) response.headers[name] = value;
  }
  response.body = answer.body;
  if (request.method == "HEAD")
    response.headers["Content-Length"] = answer.header("content-length");
  return response;
}
