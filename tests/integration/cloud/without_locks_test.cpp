// A WebDAV server without locks: what an entity tag holds.
#include <atomic>

#include "dav_server.h"
#include "forwarder.h"
#include "http/http.h"

using namespace harness;

namespace {

constexpr char kList[] = "/app_list/app_list.txt";

class WithoutLocks : public ::testing::Test {
 protected:
  WithoutLocks() : cloud(config()) {}

  std::string config() const {
    return "[cloud]\nurl=webdav+http://127.0.0.1:" + std::to_string(between.port()) +
           "/dav/store\nuser=device\npassword=right\n";
  }
  int put_directly(const std::string &content) const {
    transport::Ticket ticket;
    transport::HttpRequest request;
    request.method = "PUT";
    request.url = "http://127.0.0.1:" + std::to_string(server.port()) + "/dav/store" + kList;
    request.user = "device";
    request.password = "right";
    request.has_body = true;
    request.body = content;
    return transport::http_perform(ticket, request).status;
  }

  DavServer server{"apache", {"NO_LOCKS"}};
  Forwarder between{server.port()};
  Cloud cloud;
};

TEST_F(WithoutLocks, MoveIsMadeOnTheConditionOfTheTag) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  std::string condition;
  between.before("MOVE", [&](const front::Request &request) { condition = request.header("if"); });
  EXPECT_EQ(cloud.put(kList, "two"), 0);
  EXPECT_EQ(cloud.get(kList), "two");
  EXPECT_NE(condition.find("/dav/store/app_list/app_list.txt> ([\""), std::string::npos)
      << condition;
}

TEST_F(WithoutLocks, ListThatAnotherDeviceWroteAfterTheComparisonStays) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  between.before("MOVE", [&](const front::Request &) { EXPECT_EQ(put_directly("other"), 204); });
  EXPECT_EQ(cloud.put(kList, "two"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(cloud.get(kList), "other");
}

TEST_F(WithoutLocks, ListThatAnotherDeviceMadeAfterTheComparisonStays) {
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "<12>");
  between.before("MOVE", [&](const front::Request &) { EXPECT_EQ(put_directly("other"), 201); });
  EXPECT_EQ(cloud.put(kList, "two"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(cloud.get(kList), "other");
}

}  // namespace
