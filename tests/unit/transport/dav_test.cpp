#include "dav_test.h"

#include <algorithm>

#include "session/session.h"

using namespace harness;
using front::Fault;
using front::Response;
using front::Rule;
using front::Spoil;
using transport::kWorkerName;

DavTest::DavTest() : cloud(config()) {
  transport::set_retry_clock(&clock, {});
  transport::set_http_clock(&clock);
}

DavTest::~DavTest() {
  EXPECT_TRUE(run_until([] { return threads_named(kWorkerName) == 0; }));
  transport::set_retry_clock(nullptr, {});
  transport::set_http_clock(nullptr);
}

std::string DavTest::config() const {
  return "[cloud]\nurl=webdav+http://127.0.0.1:" + std::to_string(server.port()) +
         "/dav\nuser=device\npassword=right\n";
}

int DavTest::requests(const std::string &method, const std::string &target) const {
  const std::vector<std::string> log = server.log();
  return static_cast<int>(std::count_if(log.begin(), log.end(), [&](const std::string &line) {
    return line.rfind(method + " ", 0) == 0 && line.find(target) != std::string::npos;
  }));
}

Rule DavTest::after(const char *method, int nth, std::function<void(Response *)> change) {
  Fault fault;
  fault.spoil = Spoil::edit;
  fault.edit = std::move(change);
  return {method, kObject, "", "", nth, nth, false, fault};
}

Rule DavTest::refusal(const char *method, const char *target, int status, int last) {
  Fault fault;
  fault.spoil = Spoil::answer;
  fault.answer = status;
  return {method, target, "", "", 1, last, false, fault};
}

void DavTest::read_as_basis(const std::string &content) {
  model.put(kObject, content);
  ASSERT_TRUE(cloud.get(kObject, BACKUP_TRANS_OPTION_BASIS) == content);
}
