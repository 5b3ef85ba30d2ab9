// What a server may send, how much of it is taken, and who ends it.
#include <gtest/gtest.h>

#include <fstream>

#include "fault_world.h"
#include "network_kinds.h"
#include "session/session.h"
#include "this_process.h"

using namespace harness;
using front::Fault;
using front::Spoil;

namespace {

constexpr uint64_t kLimit = 100000;
constexpr char kTooLarge[] = "the object is larger than it may be";

struct Case {
  const char *name;
  std::unique_ptr<NetworkStore> (*make)();
};

std::ostream &operator<<(std::ostream &out, const Case &one) { return out << one.name; }

class Limits : public ::testing::TestWithParam<Case> {
 protected:
  Limits() {
    transport::set_retry_clock(&clock_, {});
    transport::set_http_clock(&clock_);
    front_.set_time([this](milliseconds passed) { clock_.pass(passed); });
    cloud_ = std::make_unique<Cloud>(
        "[cloud]\n" + store_->config("http://127.0.0.1:" + std::to_string(front_.port())));
  }
  ~Limits() override {
    cloud_.reset();
    EXPECT_TRUE(run_until([] { return threads_named(transport::kWorkerName) == 0; }));
    transport::set_retry_clock(nullptr, {});
    transport::set_http_clock(nullptr);
  }

  void have(std::size_t size) { store_->put(NetworkStore::kObject, bytes(size)); }
  void spoil(Spoil how, std::size_t at, std::function<void(front::Response *)> edit = {}) {
    front::Rule rule = store_->requests_of(Step::get);
    rule.fault.spoil = how;
    rule.fault.at = at;
    rule.fault.edit = std::move(edit);
    rule.takes_effect = true;
    front_.set_rules({rule});
  }
  AnswerPtr get(uint64_t most = kLimit) {
    local_ = cloud_->file("before");
    AnswerPtr answer = cloud_->download_limited(NetworkStore::kObject, local_, most);
    EXPECT_TRUE(cloud_->settle());
    return answer;
  }

  VirtualClock clock_;
  std::unique_ptr<NetworkStore> store_ = GetParam().make();
  front::Front front_{store_->service()};
  std::unique_ptr<Cloud> cloud_;
  std::string local_;
};

INSTANTIATE_TEST_SUITE_P(Store, Limits,
                         ::testing::Values(Case{"Dav", make_dav_network_store},
                                           Case{"S3", make_s3_network_store}),
                         [](const auto &info) { return info.param.name; });

TEST_P(Limits, AnObjectOfTheLimitIsTaken) {
  have(kLimit);
  EXPECT_EQ(get()->code, BACKUP_TRANS_ERROR_NONE);
  EXPECT_EQ(read_file(local_).size(), kLimit);
  have(kLimit + 1);
  EXPECT_EQ(get(0)->code, BACKUP_TRANS_ERROR_NONE) << "0 is no limit";
  EXPECT_EQ(read_file(local_).size(), kLimit + 1);
}

TEST_P(Limits, ALargerOneIsRefusedOnceAndForAll) {
  have(kLimit + 1);
  const AnswerPtr answer = get();
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_TOO_LARGE);
  EXPECT_EQ(answer->message, kTooLarge);
  EXPECT_EQ(read_file(local_), "before");
  EXPECT_EQ(front_.log().size(), 1U);
  EXPECT_EQ(backup_trans_last_cause(), BACKUP_TRANS_CAUSE_SERVER);
}

TEST_P(Limits, ABodyWithoutAnEndIsCutOffAndKeptNowhere) {
  have(10);
  const std::size_t before = peak_resident_bytes();
  spoil(Spoil::endless, std::numeric_limits<std::size_t>::max(), [](front::Response *response) {
    response->headers["Transfer-Encoding"] = "chunked";
    response->body = "fffffffffffffff\r\nx";
  });
  EXPECT_EQ(get()->message, kTooLarge);
  EXPECT_EQ(read_file(local_), "before");
  EXPECT_LT(peak_resident_bytes(), before + (8U << 20));
}

TEST_P(Limits, ALengthThatIsToldIsNotWaitedFor) {
  have(10);
  spoil(Spoil::edit, 0, [](front::Response *response) {
    response->headers["Content-Length"] = "4294967296";
    response->body = "x";
  });
  EXPECT_EQ(get()->message, kTooLarge);
}

TEST_P(Limits, HeadersAndErrorsWithoutAnEndAreCutOff) {
  have(10);
  std::string headers = "HTTP/1.1 200 OK\r\n";
  for (int i = 0; i < 20000; ++i) headers += "X-" + std::to_string(i) + ": more and more\r\n";
  std::string informed;
  for (int i = 0; i < 20000; ++i) informed += "HTTP/1.1 103 Early Hints\r\nX: more\r\n\r\n";
  for (const std::string &text : {headers, informed}) {
    spoil(Spoil::edit, 0, [text](front::Response *response) { response->raw = text; });
    const AnswerPtr answer = get();
    EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_SERVER);
    EXPECT_EQ(answer->message, "the server's answer is too long");
  }
  spoil(Spoil::edit, 0, [](front::Response *response) {
    response->status = 400;
    response->body = std::string(17U << 20, 'x');
  });
  EXPECT_EQ(get()->message, "the server's answer is too long");
  // a page that says at length that there is nothing
  spoil(Spoil::edit, 0, [](front::Response *response) {
    response->status = 404;
    response->headers.erase("Content-Length");
    response->body = std::string(1U << 20, 'x');
  });
  EXPECT_EQ(get()->code, BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
}

TEST_P(Limits, AByteNowAndThenIsTooSlow) {
  have(kLimit);
  spoil(Spoil::trickle, 60000);
  const AnswerPtr answer = get();
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_NETWORK);
  EXPECT_EQ(answer->message, "the server is too slow");
  // the first minute of each brought its share, and two take two minutes from the first failure on
  EXPECT_EQ(front_.count(0), 2);
  EXPECT_EQ(read_file(local_), "before");
}

TEST_P(Limits, AKilobyteASecondIsSlowAndNoFault) {
  have(kLimit);
  spoil(Spoil::slow, 0);
  EXPECT_EQ(get()->code, BACKUP_TRANS_ERROR_NONE);
  EXPECT_EQ(front_.count(0), 1);
}

TEST_P(Limits, OneRequestIsAbortedAndNoOther) {
  have(kLimit);
  front_.hold();
  const std::string first = cloud_->file("before");
  const std::string second = cloud_->file("before");
  const AnswerPtr wanted = cloud_->download_limited(NetworkStore::kObject, first, kLimit);
  void *const wanted_data = cloud_->latest();
  const AnswerPtr unwanted = cloud_->download_limited(NetworkStore::kObject, second, kLimit);
  void *const unwanted_data = cloud_->latest();
  const auto start = std::chrono::steady_clock::now();
  EXPECT_EQ(backup_trans_abort_request(cloud_->handle, unwanted_data), BACKUP_TRANS_ERROR_NONE);
  EXPECT_EQ(backup_trans_abort_request(cloud_->handle, nullptr), BACKUP_TRANS_ERROR_ARGUMENT);
  EXPECT_EQ(backup_trans_abort_request(nullptr, wanted_data), BACKUP_TRANS_ERROR_ARGUMENT);
  ASSERT_TRUE(run_until([&] { return unwanted->calls > 0; }));
  EXPECT_LT(unwanted->when - start, milliseconds(1000));
  EXPECT_EQ(unwanted->code, BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_EQ(wanted->calls, 0);
  front_.release();
  ASSERT_TRUE(cloud_->settle());
  EXPECT_EQ(wanted->code, BACKUP_TRANS_ERROR_NONE);
  EXPECT_EQ(read_file(second), "before");
  EXPECT_EQ(backup_trans_abort_request(cloud_->handle, wanted_data), BACKUP_TRANS_ERROR_ARGUMENT);
}

TEST_P(Limits, ARequestThatStillWaitsInLineIsAbortedToo) {
  have(10);
  front_.hold();
  for (int i = 0; i < BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS; ++i)
    cloud_->download(NetworkStore::kObject, cloud_->place());
  const AnswerPtr last = cloud_->download_limited(NetworkStore::kObject, cloud_->place(), kLimit);
  EXPECT_EQ(backup_trans_abort_request(cloud_->handle, cloud_->latest()), BACKUP_TRANS_ERROR_NONE);
  ASSERT_TRUE(run_until([&] { return last->calls > 0; }));
  EXPECT_EQ(last->code, BACKUP_TRANS_ERROR_CANCELLED);
  front_.release();
  ASSERT_TRUE(cloud_->settle());
}

TEST(FolderLimits, AFolderStoreHoldsThemAsWell) {
  const TempDir store;
  Cloud cloud("[cloud]\nurl=file://" + store.path() + "\n");
  ASSERT_EQ(cloud.put("/f/o", bytes(kLimit)), 0);
  const std::string local = cloud.file("before");
  AnswerPtr answer = cloud.download_limited("/f/o", local, kLimit - 1);
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_TOO_LARGE);
  EXPECT_EQ(answer->message, kTooLarge);
  EXPECT_EQ(read_file(local), "before");
  answer = cloud.download_limited("/f/o", local, kLimit);
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_NONE);
  EXPECT_EQ(read_file(local).size(), kLimit);
  EXPECT_EQ(backup_trans_download_limited_ors(cloud.handle, "/f/o", local.c_str(),
                                              BACKUP_TRANS_OPTION_NONE, kLimit - 1),
            BACKUP_TRANS_ERROR_TOO_LARGE);
}

}  // namespace
