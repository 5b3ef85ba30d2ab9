// The collection that a WebDAV store is, and those that it lies in.
#include <gtest/gtest.h>

#include "dav_model.h"
#include "harness.h"
#include "session/check.h"
#include "session/session.h"

using namespace harness;
using front::Rule;
using front::Spoil;

namespace {

class DavTopTest : public ::testing::Test {
 protected:
  std::string config(const std::string &path) const {
    return "[cloud]\nurl=webdav+http://127.0.0.1:" + std::to_string(front_.port()) + path +
           "\nuser=device\npassword=right\n";
  }
  std::vector<std::string> requests(const std::string &method) const {
    std::vector<std::string> all;
    for (const std::string &line : front_.log()) {
      if (line.compare(0, method.size() + 1, method + " ") == 0)
        all.push_back(line.substr(method.size() + 1));
    }
    return all;
  }

  DavModel model_;
  front::Front front_{model_};
};

TEST_F(DavTopTest, IsMadeWithThoseThatItLiesIn) {
  Cloud cloud(config("/dav/my%20devices/one"));
  EXPECT_EQ(cloud.put("/a", "x"), 0);
  EXPECT_EQ(cloud.get("/a"), "x");
  EXPECT_EQ(model_.content().count("/my devices/one/a"), 1U);
  EXPECT_EQ(requests("MKCOL"),
            (std::vector<std::string>{"/dav/my%20devices/one/", "/dav/my%20devices/",
                                      "/dav/my%20devices/one/"}));
}

TEST_F(DavTopTest, NothingIsAskedForAboveWhatIsThere) {
  model_.put("/here/x", "x");
  Cloud cloud(config("/dav/here/one"));
  EXPECT_EQ(cloud.put("/a", "x"), 0);
  EXPECT_EQ(requests("MKCOL"), std::vector<std::string>{"/dav/here/one/"});
}

// A wrong path does not become right by waiting.
TEST_F(DavTopTest, IsTheWrongAddressWhereItCannotBeMade) {
  Rule rule{"MKCOL", ""};
  rule.fault.spoil = Spoil::answer;
  for (const int status : {404, 409}) {
    rule.fault.answer = status;
    front_.set_rules({rule});
    Cloud cloud(config("/dav/no/such/place"));
    const AnswerPtr up = cloud.upload(cloud.file("x"), "/a");
    ASSERT_TRUE(cloud.settle());
    EXPECT_EQ(up->code, BACKUP_TRANS_ERROR_SERVER) << status;
    EXPECT_EQ(backup_trans_last_cause(), BACKUP_TRANS_CAUSE_ADDRESS) << status;
    EXPECT_EQ(front_.count(0), 4) << status;
  }
  EXPECT_TRUE(model_.content().empty());
}

}  // namespace
