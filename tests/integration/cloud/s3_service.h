/**
 * @file s3_service.h
 * @brief A session with the S3 service of the process, in a place of its own.
 */
#ifndef CLOUD_S3_SERVICE_H
#define CLOUD_S3_SERVICE_H

#include <map>
#include <string>
#include <vector>

#include "harness.h"
#include "s3_server.h"

class S3ServiceTest : public ::testing::Test {
 protected:
  S3ServiceTest() : name_("case" + std::to_string(++count_)), cloud(config()) {}

  std::string config(const std::string &more = "", const std::string &bucket = S3Server::kBucket,
                     const std::string &host = "127.0.0.1") const {
    return "[cloud]\nurl=s3+http://" + host + ":" + std::to_string(server.port()) + "/" + bucket +
           "/" + name_ + credentials() + more;
  }
  std::string credentials() const {
    return "\nuser=" + server.user() + "\npassword=" + S3Server::kSecret + "\n";
  }
  std::map<std::string, std::string> content() const {
    return server.content(S3Server::kBucket, name_);
  }
  std::string complaint() {
    const harness::AnswerPtr answer = cloud.download("/a", cloud.place());
    EXPECT_TRUE(cloud.settle());
    return std::to_string(answer->code) + " " + answer->message;
  }
  // Everything there is to do.
  void expect_service(const std::string &folder) {
    EXPECT_EQ(cloud.put(folder + "/a", "content"), 0);
    EXPECT_EQ(cloud.get(folder + "/a"), "content");
    EXPECT_EQ(cloud.children(folder), (std::vector<harness::Child>{{folder + "/a", true, 7, 0}}));
    EXPECT_EQ(cloud.drop(folder), 0);
    EXPECT_EQ(cloud.get(folder + "/a"), "<12>");
  }

  inline static int count_ = 0;
  S3Server &server = the_s3_server();
  const std::string name_;
  harness::Cloud cloud;
};

#endif
