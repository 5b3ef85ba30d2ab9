// What only the S3 store can meet, from a service that is told to behave so.
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>

#include "harness.h"
#include "http_front.h"
#include "s3_model.h"
#include "session/session.h"

using namespace harness;
using front::Fault;
using front::kForEver;
using front::Response;
using front::Rule;
using front::Spoil;

namespace {

using Content = std::map<std::string, std::string>;
using Names = std::vector<std::string>;

constexpr char kSecret[] = "hunter2-and-nobody-else";

class NoPauseClock : public transport::RetryClock {
 public:
  Point now() override { return Point{}; }
  bool pause(transport::Ticket &ticket, milliseconds) override { return !ticket.cancelled(); }
  double random() override { return 0; }
};

Response error(int status, const std::string &code, const std::string &more = "") {
  return {status, {}, "<Error><Code>" + code + "</Code>" + more + "</Error>"};
}

Rule answering(const std::string &method, const Response &answer, int last = kForEver) {
  Rule rule{method, ""};
  rule.last = last;
  rule.fault.spoil = Spoil::answer;
  rule.fault.answer = answer;
  return rule;
}

Rule editing(const std::string &method, std::function<void(Response *)> edit, int last = kForEver) {
  Rule rule{method, ""};
  rule.last = last;
  rule.fault.spoil = Spoil::edit;
  rule.fault.edit = std::move(edit);
  return rule;
}

Rule after_effect(Rule rule) {
  rule.takes_effect = true;
  return rule;
}

Rule losing_answer(const std::string &method) {
  Rule rule{method, ""};
  rule.last = 1;
  rule.takes_effect = true;
  rule.fault.spoil = Spoil::cut_response;
  return rule;
}

// Keeps what reaches the service.
class Recording : public front::Service {
 public:
  explicit Recording(front::Service &service) : service_(service) {}
  Response serve(const front::Request &request) override {
    {
      const std::lock_guard<std::mutex> guard(mutex_);
      requests_.push_back(request);
    }
    return service_.serve(request);
  }
  std::vector<front::Request> requests() const {
    const std::lock_guard<std::mutex> guard(mutex_);
    return requests_;
  }

 private:
  front::Service &service_;
  mutable std::mutex mutex_;
  std::vector<front::Request> requests_;
};

// Answers the first few uploads only when all of them are there.
class Gathering : public front::Service {
 public:
  Gathering(front::Service &service, int wanted) : service_(service), wanted_(wanted) {}
  Response serve(const front::Request &request) override {
    if (request.method == "PUT") {
      std::unique_lock<std::mutex> lock(mutex_);
      ++here_;
      changed_.notify_all();
      changed_.wait_for(lock, std::chrono::seconds(30), [this] { return here_ >= wanted_; });
    }
    return service_.serve(request);
  }

 private:
  front::Service &service_;
  const int wanted_;
  std::mutex mutex_;
  std::condition_variable changed_;
  int here_ = 0;
};

class S3BackendTest : public ::testing::Test {
 protected:
  S3BackendTest() {
    model.set_secret(kSecret);
    transport::set_retry_clock(&clock, {});
    cloud = std::make_unique<Cloud>(config());
  }
  ~S3BackendTest() override {
    cloud.reset();
    EXPECT_TRUE(run_until([] { return threads_named(transport::kWorkerName) == 0; }));
    transport::set_retry_clock(nullptr, {});
  }

  std::string config(const std::string &more = "", const std::string &host = "127.0.0.1",
                     const std::string &bucket = "devices") const {
    return "[cloud]\nurl=s3+http://" + host + ":" + std::to_string(service.port()) + "/" + bucket +
           "/p\nuser=key\npassword=" + kSecret + "\n" + more;
  }

  // What a download that fails says.
  std::string complaint(const std::string &path = "/a") {
    const AnswerPtr answer = cloud->download(path, cloud->place());
    EXPECT_TRUE(cloud->settle());
    EXPECT_EQ(answer->message.find(kSecret), std::string::npos);
    return std::to_string(answer->code) + " " + answer->message;
  }

  Names methods() const {
    Names names;
    for (const std::string &line : service.log()) names.push_back(line.substr(0, line.find(' ')));
    return names;
  }

  NoPauseClock clock;
  S3Model model;
  Recording recording{model};
  front::Front service{recording};
  std::unique_ptr<Cloud> cloud;
};

TEST_F(S3BackendTest, WriterWhoIsOvertakenHasAConflict) {
  model.put("p/list", "one");
  ASSERT_EQ(cloud->get("/list", BACKUP_TRANS_OPTION_BASIS), "one");
  service.set_rules({editing(
      "PUT",
      [this](Response *answer) {
        model.put("p/list", "of another device");
        *answer = error(409, "BrokenMPU");
      },
      1)});
  EXPECT_EQ(cloud->put("/list", "two"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(cloud->get("/list"), "of another device");
}

TEST_F(S3BackendTest, SecretNeverTravels) {
  EXPECT_EQ(cloud->put("/a/b", "x"), 0);
  EXPECT_EQ(cloud->get("/a/b"), "x");
  EXPECT_EQ(cloud->children("/a").size(), 1U);
  EXPECT_EQ(cloud->drop("/a"), 0);
  const std::vector<front::Request> requests = recording.requests();
  EXPECT_EQ(requests.size(), 5U);
  for (const front::Request &request : requests) {
    EXPECT_EQ(request.header("authorization").rfind("AWS4-HMAC-SHA256 Credential=key/", 0), 0U);
    EXPECT_EQ(request.target.find(kSecret), std::string::npos);
    EXPECT_EQ(request.body.find(kSecret), std::string::npos);
    for (const auto &[name, value] : request.headers)
      EXPECT_EQ(value.find(kSecret), std::string::npos) << name;
  }
}

TEST_F(S3BackendTest, EachOperationIsOneRequest) {
  EXPECT_EQ(cloud->put("/a/b", "x"), 0);
  EXPECT_EQ(cloud->get("/a/b"), "x");
  EXPECT_EQ(cloud->children("/a").size(), 1U);
  EXPECT_EQ(service.log(),
            (Names{"PUT /devices/p/a/b", "GET /devices/p/a/b",
                   "GET /devices?delimiter=%2F&encoding-type=url&list-type=2&max-keys=1000&"
                   "prefix=p%2Fa%2F"}));
}

TEST_F(S3BackendTest, ObjectIsKeptWithItsTimeTypeAndChecksum) {
  const AnswerPtr answer =
      cloud->upload(cloud->file("hello"), "/a", 1700000000023, "application/zip");
  ASSERT_TRUE(cloud->settle());
  EXPECT_EQ(answer->code, 0);
  EXPECT_EQ(model.header("p/a", "x-amz-meta-mtime"), "1700000000.023");
  EXPECT_EQ(model.header("p/a", "x-amz-meta-md5"), "5d41402abc4b2a76b9719d911017c592");
  EXPECT_EQ(model.header("p/a", "content-type"), "application/zip");
}

TEST_F(S3BackendTest, RefusalsCarryTheServicesCodeAndAHint) {
  model.set_secret("another");
  EXPECT_EQ(complaint(),
            "10 download: the server answered 403 (SignatureDoesNotMatch: is the secret the right "
            "one?)");
  model.set_secret(kSecret);
  cloud->configure(config("user=stranger\n"));
  EXPECT_EQ(complaint(),
            "10 download: the server answered 403 (InvalidAccessKeyId: the access key is not known "
            "there)");
  cloud->configure(config("", "127.0.0.1", "nowhere"));
  EXPECT_EQ(complaint(),
            "16 download: the server answered 404 (NoSuchBucket: there is no such bucket)");
  EXPECT_EQ(cloud->put("/a", "x"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(cloud->drop("/a"), BACKUP_TRANS_ERROR_SERVER);
  const AnswerPtr list = cloud->list("/");
  ASSERT_TRUE(cloud->settle());
  EXPECT_EQ(list->code, BACKUP_TRANS_ERROR_SERVER);
  cloud->configure(config());
  const struct {
    int status;
    const char *code;
    const char *expected;
  } refusals[] = {
      {403, "RequestTimeTooSkewed",
       "10 download: the server answered 403 (RequestTimeTooSkewed: the device's clock differs too "
       "much from the server's)"},
      {400, "AuthorizationHeaderMalformed",
       "10 download: the server answered 400 (AuthorizationHeaderMalformed: is the region the "
       "right one?)"},
      {403, "AccessDenied", "10 download: the server answered 403 (AccessDenied)"},
      {400, "ExpiredToken", "10 download: the server answered 400 (ExpiredToken)"},
      {301, "PermanentRedirect",
       "16 download: the server answered 301 (PermanentRedirect: the bucket is at another "
       "endpoint)"},
      {400, "SomethingElse", "16 download: the server answered 400 (SomethingElse)"},
      {403, "no name <>", "10 download: the server answered 403"},
  };
  for (const auto &refusal : refusals) {
    service.set_rules({answering("", error(refusal.status, refusal.code))});
    EXPECT_EQ(complaint(), refusal.expected);
    EXPECT_EQ(service.count(0), 1) << refusal.code;
  }
}

TEST_F(S3BackendTest, TransientCodesAreRepeated) {
  model.put("p/a", "x");
  const std::pair<int, const char *> answers[] = {
      {400, "RequestTimeout"},     {503, "SlowDown"},         {500, "InternalError"},
      {503, "ServiceUnavailable"}, {409, "OperationAborted"}, {400, "IncompleteBody"},
      {409, "BrokenMPU"}};
  for (const auto &[status, code] : answers) {
    service.set_rules({answering("GET", error(status, code), 2)});
    EXPECT_EQ(cloud->get("/a"), "x") << code;
    EXPECT_EQ(service.count(0), 3) << code;
  }
}

TEST_F(S3BackendTest, RegionThatTheServiceNamesIsUsedFromThenOn) {
  model.settings.region = "eu-central-1";
  EXPECT_EQ(cloud->put("/a", "x"), 0);
  EXPECT_EQ(methods(), (Names{"PUT", "PUT"}));
  EXPECT_EQ(cloud->get("/a"), "x");
  EXPECT_EQ(methods().size(), 3U);
  cloud->configure(config("region=eu-west-1\n"));
  EXPECT_EQ(cloud->get("/a"), "x");
  EXPECT_EQ(methods().size(), 5U);
  cloud->configure(config("region=eu-central-1\n"));
  EXPECT_EQ(cloud->get("/a"), "x");
  EXPECT_EQ(cloud->drop("/a"), BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
  EXPECT_EQ(methods().size(), 7U);
}

TEST_F(S3BackendTest, RegionIsTakenFromAHeaderToo) {
  model.put("p/a", "x");
  model.settings.region = "eu-central-1";
  service.set_rules({answering("GET", {301, {{"x-amz-bucket-region", "eu-central-1"}}, ""}, 1)});
  EXPECT_EQ(cloud->get("/a"), "x");
  EXPECT_EQ(service.count(0), 2);
}

TEST_F(S3BackendTest, ServiceThatNamesARegionForEverIsNotAskedForEver) {
  int named = 0;
  service.set_rules({editing("", [&](Response *response) {
    *response = error(400, "AuthorizationHeaderMalformed",
                      "<Region>r-" + std::to_string(++named) + "</Region>");
  })});
  EXPECT_EQ(cloud->get("/a"), "<10>");
  EXPECT_EQ(named, 2);
  EXPECT_EQ(cloud->put("/a", "x"), BACKUP_TRANS_ERROR_AUTHENTICATION);
  EXPECT_EQ(named, 4);
}

TEST_F(S3BackendTest, RegionThatIsNoNameIsNotSigned) {
  service.set_rules({answering(
      "", error(400, "AuthorizationHeaderMalformed", "<Region>eu:s3\r\nX-Evil: 1</Region>"))});
  EXPECT_EQ(cloud->get("/a"), "<10>");
  EXPECT_EQ(service.count(0), 1);
}

TEST_F(S3BackendTest, VirtualAddressingPutsTheBucketBeforeTheHost) {
  model.settings.host = "localhost:" + std::to_string(service.port());
  cloud->configure(config("addressing=virtual\n", "localhost"));
  EXPECT_EQ(cloud->put("/a/b", "x"), 0);
  EXPECT_EQ(cloud->get("/a/b"), "x");
  EXPECT_EQ(cloud->children("/").size(), 1U);
  EXPECT_EQ(cloud->drop("/a"), 0);
  EXPECT_EQ(service.log().front(), "PUT /p/a/b");
  EXPECT_EQ(service.log().back(), "POST /?delete=");
}

TEST_F(S3BackendTest, WholeBucketCanBeTheStore) {
  cloud->configure("[cloud]\nurl=s3+http://127.0.0.1:" + std::to_string(service.port()) +
                   "/devices\nuser=key\npassword=" + kSecret + "\n");
  EXPECT_EQ(cloud->put("/a/b", "x"), 0);
  EXPECT_EQ(model.content(), (Content{{"a/b", "x"}}));
  EXPECT_EQ(cloud->children("/").size(), 1U);
  EXPECT_EQ(cloud->children("/a").size(), 1U);
  EXPECT_EQ(cloud->drop("/a"), 0);
  EXPECT_TRUE(model.content().empty());
}

// Uploads.

TEST_F(S3BackendTest, PutThatTookEffectInSpiteOfItsAnswerIsNotRepeated) {
  service.set_rules({after_effect(answering("PUT", error(503, "ServiceUnavailable"), 1))});
  EXPECT_EQ(cloud->put("/a", "x"), 0);
  EXPECT_EQ(methods(), (Names{"PUT", "HEAD"}));
  service.set_rules({losing_answer("PUT")});
  EXPECT_EQ(cloud->put("/b", "y"), 0);
  EXPECT_EQ(service.count(0), 1);
  EXPECT_EQ(model.content("p"), (Content{{"/a", "x"}, {"/b", "y"}}));
}

TEST_F(S3BackendTest, PutThatTookNoEffectIsRepeated) {
  model.put("p/a", "old");
  service.set_rules({answering("PUT", error(503, "ServiceUnavailable"), 2)});
  EXPECT_EQ(cloud->put("/a", "new"), 0);
  EXPECT_EQ(methods(), (Names{"PUT", "HEAD", "PUT", "HEAD", "PUT"}));
  EXPECT_EQ(model.content("p"), (Content{{"/a", "new"}}));
}

TEST_F(S3BackendTest, LookThatFailsAfterAPutDecidesTheAttempt) {
  service.set_rules(
      {answering("PUT", error(503, "ServiceUnavailable"), 1), answering("HEAD", 503, 1)});
  EXPECT_EQ(cloud->put("/a", "x"), 0);
  EXPECT_EQ(methods(), (Names{"PUT", "HEAD", "HEAD", "PUT"}));
  service.set_rules(
      {answering("PUT", error(503, "ServiceUnavailable"), 1), answering("HEAD", 403)});
  EXPECT_EQ(cloud->put("/a", "y"), BACKUP_TRANS_ERROR_AUTHENTICATION);
  EXPECT_EQ(model.content("p"), (Content{{"/a", "x"}}));
}

TEST_F(S3BackendTest, BodyThatCameDamagedIsSentAgain) {
  service.set_rules({answering("PUT", error(400, "BadDigest"), 1)});
  EXPECT_EQ(cloud->put("/a", "x"), 0);
  service.set_rules({answering("PUT", error(400, "XAmzContentSHA256Mismatch"), 1)});
  EXPECT_EQ(cloud->put("/b", "x"), 0);
  EXPECT_EQ(service.count(0), 2);
}

TEST_F(S3BackendTest, LocalFileThatChangedWhileItWasSentIsTold) {
  const std::string local = cloud->file("before");
  service.set_rules({editing("PUT", [&](Response *response) {
    write_file(local, "after, and longer");
    *response = error(400, "BadDigest");
  })});
  const AnswerPtr answer = cloud->upload(local, "/a");
  ASSERT_TRUE(cloud->settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_LOCAL_FILE);
  EXPECT_EQ(service.count(0), 1);
}

TEST_F(S3BackendTest, LocalFileThatShrankBeforeItWasReadIsTold) {
  service.hold();
  for (int i = 0; i < BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS; ++i) cloud->list("/");
  ASSERT_TRUE(run_until([] {
    return threads_named(transport::kWorkerName) == BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS;
  }));
  const std::string local = cloud->file("a long content");
  const AnswerPtr answer = cloud->upload(local, "/a");
  ASSERT_EQ(truncate(local.c_str(), 3), 0);
  service.release();
  ASSERT_TRUE(cloud->settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_LOCAL_FILE);
  EXPECT_TRUE(model.content().empty());
}

TEST_F(S3BackendTest, TagThatIsNoChecksumHasTheObjectLookedUp) {
  model.settings.tags_are_md5 = false;
  EXPECT_EQ(cloud->put("/a", "x"), 0);
  EXPECT_EQ(methods(), (Names{"PUT", "HEAD"}));
  EXPECT_EQ(cloud->get("/a"), "x");
}

TEST_F(S3BackendTest, ObjectThatIsNotThereAfterwardsIsSentAgain) {
  model.settings.tags_are_md5 = false;
  service.set_rules({answering("HEAD", 404, 1)});
  EXPECT_EQ(cloud->put("/a", "x"), 0);
  EXPECT_EQ(methods(), (Names{"PUT", "HEAD", "HEAD"}));
  service.set_rules({editing(
      "HEAD", [](Response *response) { response->headers["Content-Length"] = "5"; }, 2)});
  EXPECT_EQ(cloud->put("/b", "x"), 0);
  // Not whole, still not whole, sent again and whole.
  EXPECT_EQ(service.count(0), 3);
  service.set_rules({answering("HEAD", 403)});
  EXPECT_EQ(cloud->put("/c", "x"), BACKUP_TRANS_ERROR_AUTHENTICATION);
}

TEST_F(S3BackendTest, FullServicesAreTold) {
  const std::pair<int, const char *> answers[] = {
      {403, "QuotaExceeded"}, {400, "EntityTooLarge"}, {507, "Whatever"}, {413, "Whatever"}};
  for (const auto &[status, code] : answers) {
    service.set_rules({answering("PUT", error(status, code))});
    EXPECT_EQ(cloud->put("/a", "x"), BACKUP_TRANS_ERROR_QUOTA) << code;
    EXPECT_EQ(service.count(0), 1) << code;
  }
}

// Uploads with a basis.

class S3BasisTest : public S3BackendTest {
 protected:
  // With the object as it is being the basis.
  int put_on_basis(const std::string &content) {
    cloud->get("/list", BACKUP_TRANS_OPTION_BASIS);
    return cloud->put("/list", content);
  }
  // Of the last PUT that reached the service.
  std::string condition() const {
    std::string found;
    for (const front::Request &request : recording.requests()) {
      if (request.method != "PUT") continue;
      found = request.header("if-none-match").empty() ? "" : "If-None-Match: ";
      found += request.header("if-none-match");
      if (!request.header("if-match").empty()) found = "If-Match: " + request.header("if-match");
    }
    return found;
  }
};

constexpr char kOneTag[] = "f97c5d29941bfb1b2fdab0874906ab82";  // MD5 of "one"

TEST_F(S3BasisTest, ConditionIsSentAlong) {
  EXPECT_EQ(put_on_basis("one"), 0);
  EXPECT_EQ(condition(), "If-None-Match: *");
  EXPECT_EQ(put_on_basis("two"), 0);
  EXPECT_EQ(condition(), std::string("If-Match: \"") + kOneTag + "\"");
  EXPECT_EQ(methods(), (Names{"GET", "HEAD", "PUT", "GET", "HEAD", "PUT"}));
}

TEST_F(S3BasisTest, ServiceThatComparesBareTagsIsNoticedOnce) {
  model.settings.conditions = S3Model::Conditions::bare_tags_only;
  model.put("p/list", "one");
  EXPECT_EQ(put_on_basis("two"), 0);
  EXPECT_EQ(methods(), (Names{"GET", "HEAD", "PUT", "HEAD", "PUT"}));
  EXPECT_EQ(condition(), std::string("If-Match: ") + kOneTag);
  EXPECT_EQ(put_on_basis("three"), 0);
  EXPECT_EQ(methods().size(), 8U);
  EXPECT_EQ(model.content("p"), (Content{{"/list", "three"}}));
}

TEST_F(S3BasisTest, ServiceWithoutConditionsIsNoticedOnce) {
  model.settings.conditions = S3Model::Conditions::refused;
  EXPECT_EQ(put_on_basis("one"), 0);
  EXPECT_EQ(methods(), (Names{"GET", "HEAD", "PUT", "PUT"}));
  EXPECT_EQ(put_on_basis("two"), 0);
  EXPECT_EQ(methods().size(), 7U);
  EXPECT_EQ(condition(), "");
  cloud->get("/list", BACKUP_TRANS_OPTION_BASIS);
  model.put("p/list", "of another");
  EXPECT_EQ(cloud->put("/list", "mine"), BACKUP_TRANS_ERROR_CONFLICT);
}

TEST_F(S3BasisTest, ServiceThatIgnoresConditionsIsLookedAtFirst) {
  model.settings.conditions = S3Model::Conditions::ignored;
  model.put("p/list", "one");
  cloud->get("/list", BACKUP_TRANS_OPTION_BASIS);
  model.put("p/list", "of another");
  EXPECT_EQ(cloud->put("/list", "mine"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(methods(), (Names{"GET", "HEAD"}));
}

TEST_F(S3BasisTest, ChangeBetweenTheLookAndThePutConflicts) {
  model.put("p/list", "one");
  service.set_rules({editing(
      "HEAD", [&](Response *) { model.put("p/list", "of another"); }, 1)});
  EXPECT_EQ(put_on_basis("mine"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(methods(), (Names{"GET", "HEAD", "PUT", "HEAD"}));
  service.set_rules({editing(
      "HEAD", [&](Response *) { model.erase("p/list"); }, 1)});
  EXPECT_EQ(put_on_basis("mine"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_TRUE(model.content().empty());
  service.set_rules({editing(
      "HEAD", [&](Response *) { model.put("p/list", "of another"); }, 1)});
  EXPECT_EQ(put_on_basis("mine"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(model.content("p"), (Content{{"/list", "of another"}}));
}

TEST_F(S3BasisTest, OwnPutWhoseAnswerWasLostIsNoConflict) {
  model.put("p/list", "one");
  service.set_rules({after_effect(answering("PUT", error(503, "ServiceUnavailable"), 1))});
  EXPECT_EQ(put_on_basis("two"), 0);
  service.set_rules({losing_answer("PUT")});
  EXPECT_EQ(put_on_basis("three"), 0);
  // Repeated by the library itself.
  service.set_rules({after_effect(answering("PUT", error(412, "PreconditionFailed"), 1))});
  EXPECT_EQ(put_on_basis("four"), 0);
  EXPECT_EQ(model.content("p"), (Content{{"/list", "four"}}));
}

TEST_F(S3BasisTest, PutThatTookNoEffectIsComparedAgain) {
  model.put("p/list", "one");
  service.set_rules({editing(
      "PUT",
      [&](Response *response) {
        model.put("p/list", "of another");
        *response = error(503, "ServiceUnavailable");
      },
      1)});
  EXPECT_EQ(put_on_basis("mine"), BACKUP_TRANS_ERROR_CONFLICT);
  EXPECT_EQ(model.content("p"), (Content{{"/list", "of another"}}));
}

TEST_F(S3BasisTest, ConcurrentConditionsAreRepeated) {
  service.set_rules({answering("PUT", error(409, "ConditionalRequestConflict"), 1)});
  EXPECT_EQ(put_on_basis("one"), 0);
  EXPECT_EQ(service.count(0), 2);
}

TEST_F(S3BasisTest, LookThatFailsStoresNothing) {
  cloud->get("/list", BACKUP_TRANS_OPTION_BASIS);
  service.set_rules({answering("HEAD", 403)});
  EXPECT_EQ(cloud->put("/list", "one"), BACKUP_TRANS_ERROR_AUTHENTICATION);
  cloud->get("/list", BACKUP_TRANS_OPTION_BASIS);
  Rule second = answering("HEAD", 403);
  second.first = 2;
  service.set_rules({second, answering("PUT", error(412, "PreconditionFailed"))});
  EXPECT_EQ(cloud->put("/list", "one"), BACKUP_TRANS_ERROR_AUTHENTICATION);
  EXPECT_TRUE(model.content().empty());
}

// Downloads.

TEST_F(S3BackendTest, DamagedDownloadIsRepeatedAndNeverShown) {
  ASSERT_EQ(cloud->put("/a", "content"), 0);
  const std::string place = cloud->file("before");
  service.set_rules({editing(
      "GET",
      [&](Response *response) {
        EXPECT_EQ(read_file(place), "before");
        response->body = "cOntent";
      },
      2)});
  const AnswerPtr answer = cloud->download("/a", place);
  ASSERT_TRUE(cloud->settle());
  EXPECT_EQ(answer->code, 0);
  EXPECT_EQ(read_file(place), "content");
  EXPECT_EQ(service.count(0), 3);
  // Stored by somebody else: the tag is all there is.
  model.put("p/b", "content");
  service.set_rules({editing(
      "GET", [](Response *response) { response->body = "x"; }, 1)});
  EXPECT_EQ(cloud->get("/b"), "content");
  EXPECT_EQ(service.count(0), 2);
}

TEST_F(S3BackendTest, TagOfAnEncryptedObjectIsNoChecksum) {
  const std::string tag = "\"" + std::string(32, '0') + "\"";
  for (const char *header :
       {"x-amz-server-side-encryption", "x-amz-server-side-encryption-customer-algorithm"}) {
    model.put("p/a", "x");
    model.set_header("p/a", header, "aws:kms");
    service.set_rules(
        {editing("GET", [&](Response *response) { response->headers["ETag"] = tag; })});
    EXPECT_EQ(cloud->get("/a"), "x") << header;
  }
  model.put("p/a", "x");
  model.set_header("p/a", "x-amz-server-side-encryption", "AES256");
  service.set_rules({editing(
      "GET", [&](Response *response) { response->headers["ETag"] = tag; }, 1)});
  EXPECT_EQ(cloud->get("/a"), "x");
  EXPECT_EQ(service.count(0), 2);
}

TEST_F(S3BackendTest, AnswerWithoutATagWillDo) {
  model.put("p/a", "x");
  const auto drop_tag = [](Response *response) { response->headers.erase("ETag"); };
  service.set_rules(
      {editing("GET", drop_tag), editing("HEAD", drop_tag), editing("PUT", drop_tag)});
  EXPECT_EQ(cloud->get("/a"), "x");
  EXPECT_EQ(cloud->put("/a", "y"), 0);
}

TEST_F(S3BackendTest, PartOfAnObjectIsNotTheObject) {
  model.put("p/a", "x");
  service.set_rules({editing(
      "GET", [](Response *response) { response->status = 206; }, 1)});
  EXPECT_EQ(cloud->get("/a"), "x");
  EXPECT_EQ(service.count(0), 2);
}

// What one upload finds out about the service the others find out as well.
TEST_F(S3BackendTest, WhatAServiceLacksIsNoticedByAllUploadsThatRun) {
  constexpr int kUploads = 8;
  for (const bool with_conditions : {true, false}) {
    S3Model odd;
    odd.set_secret(kSecret);
    odd.settings.region = "elsewhere";
    odd.settings.conditions =
        with_conditions ? S3Model::Conditions::bare_tags_only : S3Model::Conditions::refused;
    for (int i = 0; i < kUploads; ++i) odd.put("p/" + std::to_string(i), "old");
    Gathering gathering(odd, kUploads);
    front::Front front(gathering);
    Cloud fresh("[cloud]\nurl=s3+http://127.0.0.1:" + std::to_string(front.port()) +
                "/devices/p\nuser=key\npassword=" + kSecret + "\nregion=elsewhere\n");
    std::vector<AnswerPtr> answers;
    for (int i = 0; i < kUploads; ++i)
      ASSERT_EQ(fresh.get("/" + std::to_string(i), BACKUP_TRANS_OPTION_BASIS), "old");
    for (int i = 0; i < kUploads; ++i)
      answers.push_back(fresh.upload(fresh.file("new"), "/" + std::to_string(i)));
    ASSERT_TRUE(fresh.settle());
    for (const AnswerPtr &answer : answers) EXPECT_EQ(answer->code, 0) << with_conditions;
  }
}

TEST_F(S3BackendTest, AnotherRegionIsTakenByAllUploadsThatRun) {
  constexpr int kUploads = 8;
  S3Model odd;
  odd.set_secret(kSecret);
  Gathering gathering(odd, kUploads);
  front::Front front(gathering);
  Cloud fresh("[cloud]\nurl=s3+http://127.0.0.1:" + std::to_string(front.port()) +
              "/devices/p\nuser=key\npassword=" + kSecret + "\n");
  // The first answer tells that every upload needs a connection of its own.
  EXPECT_EQ(fresh.get("/none"), "<12>");
  odd.settings.region = "elsewhere";
  std::vector<AnswerPtr> answers;
  for (int i = 0; i < kUploads; ++i)
    answers.push_back(fresh.upload(fresh.file("new"), "/" + std::to_string(i)));
  ASSERT_TRUE(fresh.settle());
  for (const AnswerPtr &answer : answers) EXPECT_EQ(answer->code, 0);
}

// Listings.

TEST_F(S3BackendTest, ListingsGoOnWhereTheyEnded) {
  model.settings.page = 2;
  for (const char *key : {"p/f/a-", "p/f/a.txt", "p/f/a/1", "p/f/a/2", "p/f/b", "p/f/c d/1"})
    model.put(key, "x");
  const std::vector<Child> expected = {{"/f/a", false, 0, 0},
                                       {"/f/a-", true, 1, 0},
                                       {"/f/a.txt", true, 1, 0},
                                       {"/f/b", true, 1, 0},
                                       {"/f/c d", false, 0, 0}};
  EXPECT_EQ(cloud->children("/f"), expected);
  EXPECT_EQ(methods().size(), 3U);
  const AnswerPtr first = cloud->list("/f", 0, 1);
  const AnswerPtr last = cloud->list("/f", 4, 1);
  ASSERT_TRUE(cloud->settle());
  EXPECT_EQ(first->children, (std::vector<Child>{expected[0]}));
  EXPECT_TRUE(first->more);
  EXPECT_EQ(last->children, (std::vector<Child>{expected[4]}));
  EXPECT_FALSE(last->more);
}

TEST_F(S3BackendTest, ListingsThatAreNoneAreErrors) {
  const Response answers[] = {
      {200, {}, "garbage"},
      {200, {}, ""},
      {200, {}, "<!DOCTYPE x [<!ENTITY a \"aaaa\">]><ListBucketResult/>"},
      {200, {}, "<ListBucketResult><IsTruncated>true</IsTruncated></ListBucketResult>"},
      {200,
       {},
       "<ListBucketResult><IsTruncated>true</IsTruncated><NextContinuationToken>t"
       "</NextContinuationToken></ListBucketResult>"}};
  for (const Response &answer : answers) {
    service.set_rules({answering("GET", answer)});
    const AnswerPtr list = cloud->list("/f");
    ASSERT_TRUE(cloud->settle());
    EXPECT_EQ(list->code, BACKUP_TRANS_ERROR_SERVER) << answer.body;
    EXPECT_LE(service.count(0), 2);
  }
}

TEST_F(S3BackendTest, ListingsThatLeadInCirclesOrNeverEndAreErrors) {
  for (const int tokens : {1, 2, 7, 1000000}) {
    std::atomic<int> given{0};
    service.set_rules({editing("GET", [&, tokens](Response *response) {
      response->body = "<ListBucketResult><IsTruncated>true</IsTruncated><NextContinuationToken>" +
                       std::to_string(given++ % tokens) +
                       "</NextContinuationToken></ListBucketResult>";
    })});
    const AnswerPtr list = cloud->list("/f");
    const AnswerPtr removal = cloud->remove("/f");
    ASSERT_TRUE(cloud->settle());
    EXPECT_EQ(list->code, BACKUP_TRANS_ERROR_SERVER) << tokens;
    EXPECT_EQ(removal->code, BACKUP_TRANS_ERROR_SERVER) << tokens;
    EXPECT_LE(service.count(0), 2 * std::min(8 * tokens, 1001)) << tokens;
  }
}

TEST_F(S3BackendTest, NamesThatAreNoneHereAreNotShown) {
  for (const char *key : {"p/f/", "p/f//x", "p/f/./x", "p/f/../x", "p/f/.", "p/f/good",
                          "p/f/.quarn-part-0123456789abcdef01234567"})
    model.put(key, "x");
  model.put("p/f/" + std::string(256, 'n'), "x");
  EXPECT_EQ(cloud->children("/f"), (std::vector<Child>{{"/f/good", true, 1, 0}}));
}

TEST_F(S3BackendTest, WhatIsOutsideTheFolderIsNeitherShownNorDeleted) {
  model.put("p/f/x", "x");
  model.put("p/other", "x");
  model.put("q", "x");
  service.set_rules({answering(
      "GET",
      {200,
       {},
       "<ListBucketResult><Contents><Key>p/f/x</Key></Contents><Contents><Key>p/other</Key>"
       "</Contents><Contents><Key>q</Key></Contents><Contents><Key></Key></Contents>"
       "<CommonPrefixes><Prefix>p/</Prefix></CommonPrefixes><CommonPrefixes><Prefix>p/f/</Prefix>"
       "</CommonPrefixes></ListBucketResult>"})});
  EXPECT_EQ(cloud->children("/f"), (std::vector<Child>{{"/f/x", true, 0, 0}}));
  EXPECT_EQ(cloud->drop("/f"), 0);
  EXPECT_EQ(model.content(), (Content{{"p/other", "x"}, {"q", "x"}}));
}

TEST_F(S3BackendTest, ObjectAndFolderOfOneNameAreBothReached) {
  model.put("p/a", "object");
  model.put("p/a/x", "in the folder");
  model.put("p/a-", "x");
  EXPECT_EQ(cloud->children("/"), (std::vector<Child>{{"/a", false, 0, 0}, {"/a-", true, 1, 0}}));
  EXPECT_EQ(cloud->get("/a"), "object");
  EXPECT_EQ(cloud->drop("/a"), 0);
  EXPECT_EQ(model.content("p"), (Content{{"/a", "object"}, {"/a-", "x"}}));
}

// Deletions.

TEST_F(S3BackendTest, FolderIsDeletedPageByPage) {
  model.settings.page = 3;
  for (int i = 0; i < 8; ++i) model.put("p/f/" + std::to_string(i), "x");
  EXPECT_EQ(cloud->drop("/f"), 0);
  EXPECT_EQ(methods(), (Names{"GET", "POST", "GET", "POST", "GET", "POST"}));
  EXPECT_TRUE(model.content().empty());
}

TEST_F(S3BackendTest, KeysThatXmlCannotCarryAreDeletedOneByOne) {
  for (const char *name : {"\x01", "plain", "new\nline", "re\rturn", "t\tab"})
    ASSERT_EQ(cloud->put(std::string("/f/") + name, name), 0);
  for (const char *name : {"\x01", "plain", "new\nline", "re\rturn", "t\tab"})
    EXPECT_EQ(cloud->get(std::string("/f/") + name), name);
  EXPECT_EQ(cloud->children("/f").size(), 5U);
  EXPECT_EQ(cloud->drop("/f"), 0);
  const Names all = methods();
  EXPECT_EQ(std::count(all.begin(), all.end(), "POST"), 1);
  EXPECT_EQ(std::count(all.begin(), all.end(), "DELETE"), 1);
  EXPECT_TRUE(model.content().empty());
}

TEST_F(S3BackendTest, ServiceThatDeletesOneByOneIsNoticedOnce) {
  for (const int status : {501, 405}) {
    for (const char *key : {"p/f/1", "p/f/2", "p/g/1"}) model.put(key, "x");
    cloud->configure(config("region=" + std::to_string(status) + "\n"));
    model.settings.region = std::to_string(status);
    service.set_rules({answering("POST", error(status, "NotImplemented"))});
    EXPECT_EQ(cloud->drop("/f"), 0);
    EXPECT_EQ(cloud->drop("/g"), 0);
    EXPECT_EQ(service.count(0), 1) << status;
    EXPECT_TRUE(model.content().empty());
  }
}

TEST_F(S3BackendTest, SingleDeletionsAreLookedAt) {
  model.settings.deletes_many = false;
  model.put("p/f/1", "x");
  service.set_rules({answering("DELETE", error(403, "AccessDenied"))});
  EXPECT_EQ(cloud->drop("/f"), BACKUP_TRANS_ERROR_AUTHENTICATION);
  service.set_rules({answering("DELETE", error(404, "NoSuchKey"))});
  EXPECT_EQ(cloud->drop("/f"), 0);
  service.set_rules({answering("DELETE", error(503, "SlowDown"), 1)});
  EXPECT_EQ(cloud->drop("/f"), 0);
  EXPECT_TRUE(model.content().empty());
}

TEST_F(S3BackendTest, ObjectThatIsKeptIsAnError) {
  model.put("p/f/1", "x");
  model.put("p/f/2", "x");
  model.settings.sticking = {"p/f/2"};
  EXPECT_EQ(cloud->drop("/f"), BACKUP_TRANS_ERROR_AUTHENTICATION);
  model.settings.sticking_code = "Unheard";
  EXPECT_EQ(cloud->drop("/f"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(model.content("p"), (Content{{"/f/2", "x"}}));
  model.settings.sticking.clear();
  service.set_rules({editing(
      "POST",
      [&](Response *response) {
        model.put("p/f/2", "x");
        response->body =
            "<DeleteResult><Error><Key>p/f/2</Key><Code>InternalError</Code></Error>"
            "</DeleteResult>";
      },
      1)});
  EXPECT_EQ(cloud->drop("/f"), 0);
  EXPECT_TRUE(model.content().empty());
}

TEST_F(S3BackendTest, DeletionThatTookEffectInSpiteOfItsAnswerIsOne) {
  model.put("p/f/1", "x");
  service.set_rules({after_effect(answering("POST", error(503, "ServiceUnavailable"), 1))});
  EXPECT_EQ(cloud->drop("/f"), 0);
  EXPECT_EQ(methods(), (Names{"GET", "POST", "GET"}));
  model.put("p/f/1", "x");
  service.set_rules({losing_answer("POST")});
  EXPECT_EQ(cloud->drop("/f"), 0);
}

TEST_F(S3BackendTest, FolderThatWasNeverSeenIsAbsentAfterAFailureToo) {
  service.set_rules({answering("GET", error(503, "ServiceUnavailable"), 1)});
  EXPECT_EQ(cloud->drop("/f"), BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
}

TEST_F(S3BackendTest, DeletionsThatTellNothingAreErrors) {
  model.put("p/f/1", "x");
  service.set_rules({answering("POST", {200, {}, "garbage"})});
  EXPECT_EQ(cloud->drop("/f"), BACKUP_TRANS_ERROR_SERVER);
  service.set_rules({answering("POST", error(403, "AccessDenied"))});
  EXPECT_EQ(cloud->drop("/f"), BACKUP_TRANS_ERROR_AUTHENTICATION);
}

TEST_F(S3BackendTest, MarkersOfOtherProgramsGoWithTheirFolderButMakeNone) {
  model.put("p/f/", "");
  EXPECT_EQ(cloud->drop("/f"), BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
  EXPECT_TRUE(model.content().empty());
  model.put("p/f/", "");
  model.put("p/f/x", "x");
  EXPECT_EQ(cloud->drop("/f"), 0);
  EXPECT_TRUE(model.content().empty());
}

}  // namespace
