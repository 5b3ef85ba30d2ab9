// What only S3 services can show, on a real one.
#include <algorithm>

#include "s3_service.h"

using namespace harness;

namespace {

using Names = std::vector<std::string>;

TEST_F(S3ServiceTest, SecretIsInNoLog) {
  expect_service("/f");
  EXPECT_EQ(server.logs().find(S3Server::kSecret), std::string::npos);
  EXPECT_FALSE(server.logs().empty());
}

TEST_F(S3ServiceTest, WrongKeysAreToldWithTheServicesCode) {
  const char *const secret =
      "10 download: the server answered 403 (SignatureDoesNotMatch: is the secret the right one?)";
  cloud.configure(config("password=wrong\n"));
  EXPECT_EQ(complaint(), secret);
  cloud.configure(config("user=stranger\n"));
  const std::string unknown = complaint();
  // Some say the same of both.
  EXPECT_TRUE(unknown == secret ||
              unknown ==
                  "10 download: the server answered 403 (InvalidAccessKeyId: the access key "
                  "is not known there)")
      << unknown;
}

TEST_F(S3ServiceTest, MissingBucketIsTold) {
  cloud.configure(config("", "nowhere"));
  EXPECT_EQ(complaint(),
            "16 download: the server answered 404 (NoSuchBucket: there is no such bucket)");
  EXPECT_EQ(cloud.put("/a", "x"), BACKUP_TRANS_ERROR_SERVER);
}

TEST_F(S3ServiceTest, WrongRegionIsPutRight) {
  cloud.configure(config("region=eu-west-9\n"));
  expect_service("/f");
}

TEST_F(S3ServiceTest, BucketCanBePartOfTheHost) {
  cloud.configure(config("addressing=virtual\n", S3Server::kBucket, "localhost"));
  expect_service("/f");
}

TEST_F(S3ServiceTest, ListingOfMoreThanAThousandGoesOn) {
  constexpr int kThreads = 4;
  constexpr int kEach = 251;
  // Some delete objects one by one.
  constexpr milliseconds kPatience{300000};
  server.put(S3Server::kBucket, name_ + "/last", "x");
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      for (int i = t * kEach; i < (t + 1) * kEach; ++i)
        server.put(S3Server::kBucket, name_ + "/many/" + std::to_string(1000 + i), "");
    });
  }
  for (std::thread &thread : threads) thread.join();
  const AnswerPtr end = cloud.list("/many", 990, 100);
  const AnswerPtr beyond = cloud.list("/many", kThreads * kEach, 1);
  ASSERT_TRUE(cloud.settle());
  ASSERT_EQ(end->children.size(), 14U);
  EXPECT_EQ(end->children.front().path, "/many/1990");
  EXPECT_EQ(end->children.back().path, "/many/2003");
  EXPECT_FALSE(end->more);
  EXPECT_TRUE(beyond->children.empty());
  const AnswerPtr removal = cloud.remove("/many");
  ASSERT_TRUE(cloud.settle(kPatience));
  EXPECT_EQ(removal->code, 0);
  EXPECT_EQ(content(), (std::map<std::string, std::string>{{"/last", "x"}}));
}

TEST_F(S3ServiceTest, ControlCharactersAreNamesToo) {
  const Names names = {"\x01\x1f", "new\nline", "re\rturn",     "t\tab",           "\x7f",
                       "  ",       "a+b c%20",  "\xef\xbf\xbe", "\xf4\x8f\xbf\xbd"};
  for (const std::string &name : names) EXPECT_EQ(cloud.put("/f/" + name, name), 0) << name;
  for (const std::string &name : names) EXPECT_EQ(cloud.get("/f/" + name), name);
  EXPECT_EQ(cloud.children("/f").size(), names.size());
  EXPECT_EQ(cloud.drop("/f"), 0);
  EXPECT_TRUE(cloud.children("/").empty());
}

TEST_F(S3ServiceTest, OneOfManyWritersWinsWhereThereAreConditions) {
  constexpr int kWriters = 8;
  std::vector<backup_trans_handle_h> handles;
  for (int i = 0; i < kWriters; ++i) {
    handles.push_back(backup_trans_create_handle());
    cloud.handle = handles.back();
    ASSERT_EQ(cloud.get("/list", BACKUP_TRANS_OPTION_BASIS), "<12>");
  }
  std::vector<AnswerPtr> answers;
  for (int i = 0; i < kWriters; ++i) {
    cloud.handle = handles[static_cast<std::size_t>(i)];
    answers.push_back(cloud.upload(cloud.file("writer " + std::to_string(i)), "/list"));
  }
  ASSERT_TRUE(cloud.settle());
  Names winners;
  for (std::size_t i = 0; i < answers.size(); ++i) {
    if (answers[i]->code == 0)
      winners.push_back("writer " + std::to_string(i));
    else
      EXPECT_EQ(answers[i]->code, BACKUP_TRANS_ERROR_CONFLICT);
  }
  if (server.has_conditions())
    EXPECT_EQ(winners.size(), 1U);
  else
    EXPECT_GE(winners.size(), 1U);
  const std::string kept = content().at("/list");
  EXPECT_NE(std::find(winners.begin(), winners.end(), kept), winners.end()) << kept;
}

TEST_F(S3ServiceTest, EverythingGoesOnWithoutOneOfThreeServers) {
  ASSERT_EQ(cloud.put("/before/x", "x"), 0);
  server.kill_nodes(1);
  const AnswerPtr up = cloud.upload(cloud.file("content"), "/f/a");
  const AnswerPtr down = cloud.download("/before/x", cloud.place());
  ASSERT_TRUE(cloud.settle(milliseconds(180000)));
  EXPECT_EQ(up->code, 0);
  EXPECT_EQ(down->code, 0);
  // What is new may be missing in listings until the servers have told each other of it.
  EXPECT_EQ(cloud.put("/g/a", "content"), 0);
  EXPECT_EQ(cloud.get("/g/a"), "content");
  server.restart_nodes();
  expect_service("/h");
}

}  // namespace
