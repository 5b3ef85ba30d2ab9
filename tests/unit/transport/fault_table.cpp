#include "fault_table.h"

#include <algorithm>
#include <ctime>

#include "dav_model.h"

using front::Fault;
using front::Response;
using front::Spoil;

namespace {

constexpr std::size_t kInBody = 60000;
constexpr std::size_t kInHead = 20;
constexpr std::size_t kInListing = 300;
constexpr std::size_t kEndlessBytes = 17 * 1024 * 1024;
constexpr long kRetryAfterSeconds = 100;

Fault answer(const Response &response) {
  Fault fault;
  fault.spoil = Spoil::answer;
  fault.answer = response;
  return fault;
}

Fault at(Spoil spoil, std::size_t byte) {
  Fault fault;
  fault.spoil = spoil;
  fault.at = byte;
  return fault;
}

Fault edit(std::function<void(Response *)> change) {
  Fault fault;
  fault.spoil = Spoil::edit;
  fault.edit = std::move(change);
  return fault;
}

Response raw(std::string text) {
  Response response;
  response.raw = std::move(text);
  return response;
}

Response listing(const std::string &body) {
  return {207, {{"Content-Type", "application/xml"}}, body};
}

std::string date_in(long seconds) {
  const time_t then = time(nullptr) + seconds;
  tm parts{};
  gmtime_r(&then, &parts);
  char text[64];
  strftime(text, sizeof text, "%a, %d %b %Y %H:%M:%S GMT", &parts);
  return text;
}

std::string bomb() {
  std::string text = "<?xml version=\"1.0\"?><!DOCTYPE b [<!ENTITY a0 \"aaaaaaaaaaaaaaaaaaaa\">";
  for (int i = 1; i < 10; ++i) {
    text += "<!ENTITY a" + std::to_string(i) + " \"";
    for (int j = 0; j < 10; ++j) text += "&a" + std::to_string(i - 1) + ";";
    text += "\">";
  }
  return text +
         "]><multistatus xmlns=\"DAV:\"><response><href>&a9;</href></response></multistatus>";
}

// Nobody finds the document type in it by looking for the letters.
std::string wide(const std::string &text) {
  std::string result = "\xff\xfe";
  for (const char c : text) result += {c, '\0'};
  return result;
}

void shorten(Response *response) {
  response->headers["Content-Length"] = std::to_string(response->body.size());
  response->headers["Connection"] = "close";
  response->body.resize(response->body.size() / 2);
}

void shorten_chunked(Response *response) {
  response->headers["Transfer-Encoding"] = "chunked";
  response->headers["Connection"] = "close";
  response->body = "100000\r\n" + response->body;
}

void tell_wrong_length(Response *response) {
  response->headers["Content-Length"] = std::to_string(response->body.size() + 1);
}

void answer_a_part(Response *response) {
  response->status = 206;
  response->body.resize(response->body.size() / 2);
}

void change_a_byte(Response *response) {
  if (!response->body.empty()) response->body.back() = static_cast<char>(response->body.back() ^ 1);
}

class Table {
 public:
  std::vector<FaultRow> rows;

  FaultRow &add(const std::string &name, const Fault &fault = {}) {
    rows.emplace_back();
    rows.back().name = name;
    rows.back().fault = fault;
    return rows.back();
  }

  /** The request is lost with it, or was done. */
  void add_once_and_for_ever(const std::string &name, const Fault &fault, bool done) {
    for (const int last : {1, front::kForEver}) {
      FaultRow &row =
          add(name + (done ? ", request done" : "") + (last == 1 ? ", once" : ""), fault);
      row.last = last;
      row.takes_effect = done;
    }
  }

  void add_tls(const std::string &name, Place place, const std::string &certificate_name,
               const Validity &validity = kValidNow) {
    FaultRow &row = add(name);
    row.place = place;
    row.certificate_name = certificate_name;
    row.validity = validity;
  }
};

void add_connection_faults(Table *table) {
  table->add("connection refused").place = Place::silent_port;
  table->add("connection refused, once").refused_once = true;
  table->add("host name unknown").place = Place::unknown_name;
  table->add_once_and_for_ever("reset at byte 1 of the request", at(Spoil::reset_request, 1),
                               false);
  table->add_once_and_for_ever("reset at byte 60000 of the request",
                               at(Spoil::reset_request, kInBody), false);
  for (const bool done : {false, true})
    table->add_once_and_for_ever("reset before the answer", at(Spoil::reset_response, 0), done);
  table->add_once_and_for_ever("reset at byte 20 of the answer", at(Spoil::reset_response, kInHead),
                               true);
  table->add_once_and_for_ever("reset at byte 300 of the answer",
                               at(Spoil::reset_response, kInListing), true);
  table->add_once_and_for_ever("reset at byte 60000 of the answer",
                               at(Spoil::reset_response, kInBody), true);
  // Once only: how much the kernels still move by themselves decides when the silence begins.
  table->add("stalled at byte 60000 of the request, once", at(Spoil::stall_request, kInBody)).last =
      1;
  for (const bool done : {false, true})
    table->add_once_and_for_ever("stalled before the answer", at(Spoil::stall_response, 0), done);
  table->add_once_and_for_ever("stalled at byte 20 of the answer",
                               at(Spoil::stall_response, kInHead), true);
  table->add_once_and_for_ever("stalled at byte 60000 of the answer",
                               at(Spoil::stall_response, kInBody), true);
  table->add("slow, 1 kB/s", at(Spoil::slow, 0)).last = 1;
  table->add_once_and_for_ever("a byte in 20 s from byte 20 of the answer",
                               at(Spoil::trickle, kInHead), true);
  table->add_once_and_for_ever("a byte in 20 s from byte 300 of the answer",
                               at(Spoil::trickle, kInListing), true);
  table->add_once_and_for_ever("a byte in 20 s from byte 60000 of the answer",
                               at(Spoil::trickle, kInBody), true);
}

// Says all that it knows to whoever listens.
Response status(int code) {
  Response response(code, {{"X-Echo", "{authorization}"}},
                    "<Error><Code>{authorization}</Code></Error>");
  response.reason = "{authorization}";
  return response;
}

void add_statuses(Table *table) {
  for (const int code : {401, 403, 404, 409, 412, 413})
    table->add(std::to_string(code), answer(status(code)));
  for (const int code : {408, 423, 425})
    table->add_once_and_for_ever(std::to_string(code), answer(status(code)), false);
  const auto too_many = [](const std::string &when) {
    Response response = status(429);
    response.headers["Retry-After"] = when;
    return answer(response);
  };
  table->add_once_and_for_ever("429", answer(status(429)), false);
  table->add_once_and_for_ever("429, Retry-After 100", too_many(std::to_string(kRetryAfterSeconds)),
                               false);
  table->add_once_and_for_ever("429, Retry-After a date in 100 s",
                               too_many(date_in(kRetryAfterSeconds)), false);
  table->add("429, Retry-After 3600", too_many("3600"));
  for (const int code : {500, 501, 502, 503, 504}) {
    for (const bool done : {false, true})
      table->add_once_and_for_ever(std::to_string(code), answer(status(code)), done);
  }
  table->add("507", answer(status(507)));
  table->add("207, a part failed",
             answer(listing("<multistatus xmlns=\"DAV:\"><response><href>/dav/f/o</href>"
                            "<status>HTTP/1.1 423 Locked</status></response></multistatus>")));
}

void add_lies(Table *table, const std::string &elsewhere) {
  FaultRow &stored = table->add("stored with another length", edit(tell_wrong_length));
  stored.at_look = true;
  FaultRow &stored_once = table->add("stored with another length, once", edit(tell_wrong_length));
  stored_once.at_look = true;
  stored_once.last = 1;
  const Response damaged(400, {}, "<Error><Code>BadDigest</Code></Error>");
  table->add_once_and_for_ever("damaged on its way (BadDigest)", answer(damaged), false);
  table->add_once_and_for_ever("wrong checksum", edit(change_a_byte), false);
  table->add_once_and_for_ever("truncated body", edit(shorten), false);
  table->add_once_and_for_ever("truncated chunked body", edit(shorten_chunked), false);
  table->add_once_and_for_ever("a part only (206)", edit(answer_a_part), false);
  table->add("garbage instead of HTTP", answer(raw("\x01\x02 garbage\r\n\r\n")));
  table->add("garbage XML", answer(listing("<multistatus xmlns=\"DAV:\"><resp")));
  table->add("other XML", answer(listing("<html><body>Welcome</body></html>")));
  table->add("XML bomb", answer(listing(bomb())));
  table->add("XML bomb in UTF-16", answer(listing(wide(bomb()))));
  table->add("endless listing", answer(listing(std::string(kEndlessBytes, ' '))));
  table->add("redirect to another host", answer({307, {{"Location", elsewhere + "/dav/f/o"}}}));
}

void add_tls_faults(Table *table) {
  table->add_tls("certificate expired", Place::tls, "127.0.0.1", kExpired);
  table->add_tls("certificate not valid yet", Place::tls, "127.0.0.1", kNotYet);
  table->add_tls("certificate of another host", Place::tls, "store.example");
  table->add_tls("certificate of an unknown authority", Place::tls_unknown, "127.0.0.1");
  table->add_tls("no TLS at a TLS port", Place::tls_plain, "");
  table->add_tls("stalled in the TLS greeting", Place::tls_silent, "");
}

struct Cells {
  const char *name;
  Expected dav;
  Expected s3;
  Expected in_place = {};
};

const Cells kCells[] = {
    {"connection refused",
     {{"network 17 old", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "network 17 old"}},
     {{"network 17 old", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "network 17 old"}},
     {{"network 17 old"}}},
    {"connection refused, once",
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new"}}},
    {"host name unknown",
     {{"network 17 old", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "network 17 old"}},
     {{"network 17 old", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "network 17 old"}},
     {{"network 17 old"}}},
    {"reset at byte 1 of the request, once",
     {{"success 2 new", "success 1 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 1 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"reset at byte 1 of the request",
     {{"network 15 old", "network 17 old", "network 17 old", nullptr, "network 17 kept",
       "network 17 none", "network 17 old"}},
     {{"network 17 old", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "network 17 old"}},
     {{"network 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "network 15 old"}}},
    {"reset at byte 60000 of the request, once",
     {{"success 2 new"}},
     {{"success 2 new"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"reset at byte 60000 of the request",
     {{"network 15 old"}},
     {{"network 17 old"}},
     {{"network 17 gone", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr,
       "network 17 gone"}}},
    {"reset before the answer, once",
     {{"success 2 new", "success 1 new", "success 2 new", "success 1 new", "success 2 whole",
       "success 2 whole", "success 1 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"reset before the answer",
     {{"network 15 old", "network 17 old", "network 17 old", "success 1 new + lock",
       "network 17 kept", "network 17 none", "network 17 old"}},
     {{"network 17 old", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "network 17 old"}},
     {{"network 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "network 15 old"}}},
    {"reset before the answer, request done, once",
     {{"success 2 new", "success 2 new", "success 1 new", "success 1 new", "success 2 whole",
       "success 2 whole", "success 1 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"reset before the answer, request done",
     {{"network 17 old", "success 2 new", "success 1 new", "success 1 new", "network 17 kept",
       "network 17 none", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"reset at byte 20 of the answer, request done, once",
     {{"success 2 new", "success 2 new", "success 1 new", nullptr, "success 2 whole",
       "success 2 whole", "success 1 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"reset at byte 20 of the answer, request done",
     {{"network 17 old", "success 2 new", "success 1 new", nullptr, "network 17 kept",
       "network 17 none", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"reset at byte 300 of the answer, request done, once",
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole"}},
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole"}}},
    {"reset at byte 300 of the answer, request done",
     {{nullptr, nullptr, nullptr, nullptr, "network 17 kept", "network 17 none"}},
     {{nullptr, nullptr, nullptr, nullptr, "network 17 kept", "network 17 none"}}},
    {"reset at byte 60000 of the answer, request done, once",
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole"}},
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole"}}},
    {"reset at byte 60000 of the answer, request done",
     {{nullptr, nullptr, nullptr, nullptr, "network 17 kept"}},
     {{nullptr, nullptr, nullptr, nullptr, "network 17 kept"}}},
    {"stalled at byte 60000 of the request, once",
     {{"success 2 new"}},
     {{"success 2 new"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"stalled before the answer, once",
     {{"success 2 new", "success 2 new", "success 2 new", "success 1 new", "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"stalled before the answer",
     {{"network 5 old", "network 5 old", "network 5 old", "success 1 new + lock", "network 5 kept",
       "network 5 none", "network 5 old"}},
     {{"network 5 old", nullptr, nullptr, nullptr, "network 5 kept", "network 5 none",
       "network 5 old"}},
     {{"network 5 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "network 5 old"}}},
    {"stalled before the answer, request done, once",
     {{"success 2 new", "success 2 new", "success 2 new", "success 1 new", "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"stalled before the answer, request done",
     {{"network 5 old", "success 2 new", "server 5 old", "success 1 new", "network 5 kept",
       "network 5 none", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "network 5 kept", "network 5 none",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"stalled at byte 20 of the answer, request done, once",
     {{"success 2 new", "success 2 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"stalled at byte 20 of the answer, request done",
     {{"network 5 old", "success 2 new", "server 5 old", nullptr, "network 5 kept",
       "network 5 none", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "network 5 kept", "network 5 none",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"stalled at byte 60000 of the answer, request done, once",
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole"}},
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole"}}},
    {"stalled at byte 60000 of the answer, request done",
     {{nullptr, nullptr, nullptr, nullptr, "network 5 kept"}},
     {{nullptr, nullptr, nullptr, nullptr, "network 5 kept"}}},
    {"slow, 1 kB/s",
     {{"success 1 new", "success 1 new", "success 1 new", nullptr, "success 1 whole",
       "success 1 whole", "success 1 gone"}},
     {{"success 1 new", nullptr, nullptr, nullptr, "success 1 whole", "success 1 whole",
       "success 1 gone"}},
     {{"success 1 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 1 new"}}},
    {"a byte in 20 s from byte 20 of the answer, request done, once",
     {{"success 2 new", "success 2 new", "success 2 new", "success 1 new", "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"a byte in 20 s from byte 20 of the answer, request done",
     {{"network 4 old", "success 2 new", "server 4 old", "success 1 new", "network 4 kept",
       "network 4 none", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "network 4 kept", "network 4 none",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"a byte in 20 s from byte 300 of the answer, request done, once",
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole"}},
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole"}}},
    {"a byte in 20 s from byte 300 of the answer, request done",
     {{nullptr, nullptr, nullptr, nullptr, "network 3 kept", "network 3 none"}},
     {{nullptr, nullptr, nullptr, nullptr, "network 3 kept", "network 3 none"}}},
    {"a byte in 20 s from byte 60000 of the answer, request done, once",
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole"}},
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole"}}},
    {"a byte in 20 s from byte 60000 of the answer, request done",
     {{nullptr, nullptr, nullptr, nullptr, "network 2 kept"}},
     {{nullptr, nullptr, nullptr, nullptr, "network 2 kept"}}},
    {"401",
     {{"authentication 1 old", "authentication 1 old", "authentication 1 old", nullptr,
       "authentication 1 kept", "authentication 1 none", "authentication 1 old"}},
     {{"authentication 1 old", nullptr, nullptr, nullptr, "authentication 1 kept",
       "authentication 1 none", "authentication 1 old"}},
     {{"authentication 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr,
       "authentication 1 old"}}},
    {"403",
     {{"authentication 1 old", "authentication 1 old", "authentication 1 old", nullptr,
       "authentication 1 kept", "authentication 1 none", "authentication 1 old"}},
     {{"authentication 1 old", nullptr, nullptr, nullptr, "authentication 1 kept",
       "authentication 1 none", "authentication 1 old"}},
     {{"authentication 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr,
       "authentication 1 old"}}},
    {"404",
     {{"server 1 old", "server 2 old", "server 2 old", nullptr, "absent 1 kept", "success 1 none",
       "success 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, "absent 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 old"}}},
    {"409",
     {{"server 1 old", "server 2 old", "server 2 old", nullptr, "server 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, "server 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 old"}}},
    {"412",
     {{"conflict 1 old", "conflict 1 old", "conflict 1 old", nullptr, "conflict 1 kept",
       "conflict 1 none", "conflict 1 old"}},
     {{"conflict 1 old", nullptr, nullptr, nullptr, "conflict 1 kept", "conflict 1 none",
       "conflict 1 old"}},
     {{"conflict 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "conflict 3 old"}}},
    {"413",
     {{"quota 1 old", "quota 1 old", "quota 1 old", nullptr, "quota 1 kept", "quota 1 none",
       "quota 1 old"}},
     {{"quota 1 old", nullptr, nullptr, nullptr, "quota 1 kept", "quota 1 none", "quota 1 old"}},
     {{"quota 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "quota 1 old"}}},
    {"408, once",
     {{"success 2 new", "success 2 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"408",
     {{"network 17 old", "network 17 old", "network 17 old", nullptr, "network 17 kept",
       "network 17 none", "network 17 old"}},
     {{"network 17 old", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "network 17 old"}},
     {{"network 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "network 17 old"}}},
    {"423, once",
     {{"success 2 new", "success 2 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"423",
     {{"server 17 old", "server 17 old", "server 17 old", nullptr, "server 17 kept",
       "server 17 none", "server 17 old"}},
     {},
     {{"server 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 17 old"}}},
    {"425, once",
     {{"success 2 new", "success 2 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"425",
     {{"server 17 old", "server 17 old", "server 17 old", nullptr, "server 17 kept",
       "server 17 none", "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, "server 17 kept", "server 17 none",
       "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 17 old"}}},
    {"429, once",
     {{"success 2 new", "success 2 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"429",
     {{"server 17 old", "server 17 old", "server 17 old", nullptr, "server 17 kept",
       "server 17 none", "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, "server 17 kept", "server 17 none",
       "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 17 old"}}},
    {"429, Retry-After 100, once",
     {{"success 2 new", "success 2 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"429, Retry-After 100",
     {{"server 2 old", "server 2 old", "server 2 old", nullptr, "server 2 kept", "server 2 none",
       "server 2 old"}},
     {{"server 2 old", nullptr, nullptr, nullptr, "server 2 kept", "server 2 none",
       "server 2 old"}},
     {{"server 2 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 2 old"}}},
    {"429, Retry-After a date in 100 s, once",
     {{"success 2 new", "success 2 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"429, Retry-After a date in 100 s",
     {{"server 2 old", "server 2 old", "server 2 old", nullptr, "server 2 kept", "server 2 none",
       "server 2 old"}},
     {{"server 2 old", nullptr, nullptr, nullptr, "server 2 kept", "server 2 none",
       "server 2 old"}},
     {{"server 2 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 2 old"}}},
    {"429, Retry-After 3600",
     {{"server 1 old", "server 1 old", "server 1 old", nullptr, "server 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, "server 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 old"}}},
    {"500, once",
     {{"success 2 new", "success 2 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"500",
     {{"server 17 old", "server 17 old", "server 17 old", nullptr, "server 17 kept",
       "server 17 none", "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, "server 17 kept", "server 17 none",
       "server 17 old"}},
     {{"quota 3 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "quota 3 old"}}},
    {"500, request done, once",
     {{"success 2 new", "success 2 new", "success 1 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"500, request done",
     {{"server 17 old", "success 2 new", "success 1 new", nullptr, "server 17 kept",
       "server 17 none", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "server 17 kept", "server 17 none",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"501, once",
     {{"server 1 old", "success 1 new", "success 1 new", nullptr, "server 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, "server 1 kept", "server 1 none",
       "success 1 gone"}},
     {{"server 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 old"}}},
    {"501",
     {{"server 1 old", "success 1 new", "success 1 new", nullptr, "server 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, "server 1 kept", "server 1 none",
       "success 1 gone"}},
     {{"server 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 old"}}},
    {"502, once",
     {{"success 2 new", "success 2 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"502",
     {{"server 17 old", "server 17 old", "server 17 old", nullptr, "server 17 kept",
       "server 17 none", "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, "server 17 kept", "server 17 none",
       "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 17 old"}}},
    {"502, request done, once",
     {{"success 2 new", "success 2 new", "success 1 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"502, request done",
     {{"server 17 old", "success 2 new", "success 1 new", nullptr, "server 17 kept",
       "server 17 none", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "server 17 kept", "server 17 none",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"503, once",
     {{"success 2 new", "success 2 new", "success 2 new", "success 1 new", "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"503",
     {{"server 17 old", "server 17 old", "server 17 old", "success 1 new + lock", "server 17 kept",
       "server 17 none", "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, "server 17 kept", "server 17 none",
       "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 17 old"}}},
    {"503, request done, once",
     {{"success 2 new", "success 2 new", "success 1 new", "success 1 new", "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"503, request done",
     {{"server 17 old", "success 2 new", "success 1 new", "success 1 new", "server 17 kept",
       "server 17 none", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "server 17 kept", "server 17 none",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"504, once",
     {{"success 2 new", "success 2 new", "success 2 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"504",
     {{"server 17 old", "server 17 old", "server 17 old", nullptr, "server 17 kept",
       "server 17 none", "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, "server 17 kept", "server 17 none",
       "server 17 old"}},
     {{"server 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 17 old"}}},
    {"504, request done, once",
     {{"success 2 new", "success 2 new", "success 1 new", nullptr, "success 2 whole",
       "success 2 whole", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"504, request done",
     {{"server 17 old", "success 2 new", "success 1 new", nullptr, "server 17 kept",
       "server 17 none", "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, "server 17 kept", "server 17 none",
       "success 2 gone"}},
     {{"success 2 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 2 new"}}},
    {"507",
     {{"quota 1 old", "quota 1 old", "quota 1 old", nullptr, "quota 1 kept", "quota 1 none",
       "quota 1 old"}},
     {{"quota 1 old", nullptr, nullptr, nullptr, "quota 1 kept", "quota 1 none", "quota 1 old"}},
     {{"quota 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "quota 1 old"}}},
    {"207, a part failed",
     {{nullptr, "server 1 old", nullptr, nullptr, nullptr, nullptr, "server 1 old"}},
     {},
     {{"server 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 17 old"}}},
    {"stored with another length",
     {{"server 17 old"}},
     {},
     {{"server 17 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "conflict 2 new"}}},
    {"stored with another length, once",
     {{"success 2 new"}},
     {},
     {{"success 1 new", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "success 1 new"}}},
    {"damaged on its way (BadDigest), once", {}, {{"success 2 new"}}},
    {"damaged on its way (BadDigest)", {}, {{"server 17 old"}}},
    {"wrong checksum, once", {}, {{nullptr, nullptr, nullptr, nullptr, "success 2 whole"}}},
    {"wrong checksum", {}, {{nullptr, nullptr, nullptr, nullptr, "server 17 kept"}}},
    {"truncated body, once",
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole"}},
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole"}}},
    {"truncated body",
     {{nullptr, nullptr, nullptr, nullptr, "network 17 kept", "network 17 none"}},
     {{nullptr, nullptr, nullptr, nullptr, "network 17 kept", "network 17 none"}}},
    {"truncated chunked body, once",
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole"}},
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole", "success 2 whole"}}},
    {"truncated chunked body",
     {{nullptr, nullptr, nullptr, nullptr, "network 17 kept", "network 17 none"}},
     {{nullptr, nullptr, nullptr, nullptr, "network 17 kept", "network 17 none"}}},
    {"a part only (206), once",
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole"}},
     {{nullptr, nullptr, nullptr, nullptr, "success 2 whole"}}},
    {"a part only (206)",
     {{nullptr, nullptr, nullptr, nullptr, "server 17 kept"}},
     {{nullptr, nullptr, nullptr, nullptr, "server 17 kept"}}},
    {"garbage instead of HTTP",
     {{"server 1 old", "server 1 old", "server 1 old", nullptr, "server 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, "server 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 old"}}},
    {"garbage XML",
     {{nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 none"}},
     {{nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 none"}}},
    {"other XML",
     {{"server 17 old", nullptr, nullptr, nullptr, nullptr, "server 1 none"}},
     {{"server 17 old", nullptr, nullptr, nullptr, nullptr, "server 1 none"}},
     {{"server 17 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 17 old"}}},
    {"XML bomb",
     {{nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 none"}},
     {{nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 none"}}},
    {"XML bomb in UTF-16",
     {{nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 none"}},
     {{nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 none"}}},
    {"endless listing",
     {{nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 none"}},
     {{nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 none"}}},
    {"redirect to another host",
     {{"server 1 old", "server 1 old", "server 1 old", nullptr, "server 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, "server 1 kept", "server 1 none",
       "server 1 old"}},
     {{"server 1 old", nullptr, nullptr, nullptr, nullptr, nullptr, nullptr, "server 1 old"}}},
    {"certificate expired",
     {{"certificate 1 old", nullptr, nullptr, nullptr, "certificate 1 kept", "certificate 1 none",
       "certificate 1 old"}},
     {{"certificate 1 old", nullptr, nullptr, nullptr, "certificate 1 kept", "certificate 1 none",
       "certificate 1 old"}},
     {{"certificate 1 old"}}},
    {"certificate not valid yet",
     {{"certificate 1 old", nullptr, nullptr, nullptr, "certificate 1 kept", "certificate 1 none",
       "certificate 1 old"}},
     {{"certificate 1 old", nullptr, nullptr, nullptr, "certificate 1 kept", "certificate 1 none",
       "certificate 1 old"}},
     {{"certificate 1 old"}}},
    {"certificate of another host",
     {{"certificate 1 old", nullptr, nullptr, nullptr, "certificate 1 kept", "certificate 1 none",
       "certificate 1 old"}},
     {{"certificate 1 old", nullptr, nullptr, nullptr, "certificate 1 kept", "certificate 1 none",
       "certificate 1 old"}},
     {{"certificate 1 old"}}},
    {"certificate of an unknown authority",
     {{"certificate 1 old", nullptr, nullptr, nullptr, "certificate 1 kept", "certificate 1 none",
       "certificate 1 old"}},
     {{"certificate 1 old", nullptr, nullptr, nullptr, "certificate 1 kept", "certificate 1 none",
       "certificate 1 old"}},
     {{"certificate 1 old"}}},
    {"no TLS at a TLS port",
     {{"network 17 old", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "network 17 old"}},
     {{"network 17 old", nullptr, nullptr, nullptr, "network 17 kept", "network 17 none",
       "network 17 old"}},
     {{"network 17 old"}}},
    {"stalled in the TLS greeting",
     {{"network 3 old", nullptr, nullptr, nullptr, "network 5 kept", "network 5 none",
       "network 5 old"}},
     {{"network 5 old", nullptr, nullptr, nullptr, "network 5 kept", "network 5 none",
       "network 5 old"}},
     {{"network 3 old"}}},
};

struct Column {
  Step step;
  const char *title;
};
constexpr Column kColumns[] = {
    {Step::put, "upload"},        {Step::replace, "upload with a basis"},
    {Step::move, "its move"},     {Step::lock, "its lock"},
    {Step::unlock, "its unlock"}, {Step::get, "download"},
    {Step::list, "listing"},      {Step::remove, "deletion"},
};

}  // namespace

std::vector<FaultRow> fault_table(const std::string &elsewhere) {
  Table table;
  add_connection_faults(&table);
  add_statuses(&table);
  add_lies(&table, elsewhere);
  add_tls_faults(&table);
  for (FaultRow &row : table.rows) {
    for (const Cells &cells : kCells) {
      if (row.name != cells.name) continue;
      row.dav = cells.dav;
      row.s3 = cells.s3;
      row.in_place = cells.in_place;
    }
  }
  return table.rows;
}

std::string fault_document(Expected FaultRow::*cells) {
  const auto rows = fault_table("");
  std::vector<Column> columns;
  for (const Column &column : kColumns) {
    const auto is_used = [&](const FaultRow &row) {
      return (row.*cells).at(static_cast<std::size_t>(column.step)) != nullptr;
    };
    if (std::any_of(rows.begin(), rows.end(), is_used)) columns.push_back(column);
  }
  std::string text = "| fault |";
  std::string rule = "|---|";
  for (const Column &column : columns) {
    text += std::string(" ") + column.title + " |";
    rule += "---|";
  }
  text += "\n" + rule + "\n";
  for (const FaultRow &row : rows) {
    if (row.*cells == Expected{}) continue;
    text += "| " + row.name + " |";
    for (const Column &column : columns) {
      const char *cell = (row.*cells).at(static_cast<std::size_t>(column.step));
      text += std::string(" ") + (cell == nullptr ? "" : cell) + " |";
    }
    text += "\n";
  }
  return text;
}
