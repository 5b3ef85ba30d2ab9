#include <unistd.h>

#include <atomic>

#include "conformance.h"
#include "session/session.h"

using namespace harness;

namespace {

int between(const Answer &answer, std::chrono::steady_clock::time_point start) {
  return static_cast<int>(std::chrono::duration_cast<milliseconds>(answer.when - start).count());
}

TEST_P(Conformance, CancelEndsEverythingOfTheHandleWithinASecond) {
  ASSERT_EQ(cloud.put("/kept", "old"), 0);
  store->hold();
  std::vector<AnswerPtr> answers;
  for (int i = 0; i < 6; ++i) {
    answers.push_back(cloud.upload(cloud.file(bytes(200000)), "/new/" + std::to_string(i)));
    answers.push_back(cloud.download("/kept", cloud.place()));
    answers.push_back(cloud.list("/"));
    answers.push_back(cloud.remove("/kept"));
  }
  ASSERT_TRUE(run_until([] { return threads_named(transport::kWorkerName) > 0; }));
  const auto start = std::chrono::steady_clock::now();
  backup_trans_cancel_request(cloud.handle);
  ASSERT_TRUE(cloud.settle());
  for (const AnswerPtr &answer : answers) {
    EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_CANCELLED);
    EXPECT_LT(between(*answer, start), 1000);
  }
  store->release();
  EXPECT_TRUE(run_until([] { return threads_named(transport::kWorkerName) == 0; }));
  EXPECT_EQ(store->content(), (std::map<std::string, std::string>{{"/kept", "old"}}));
  for (const auto &[name, content] : tree(cloud.dir().path())) {
    EXPECT_TRUE(name == "/cloud.conf" || name.rfind("/local-", 0) == 0) << name;
  }
}

TEST_P(Conformance, HandleServesAgainAfterACancel) {
  store->hold();
  const AnswerPtr doomed = cloud.upload(cloud.file("x"), "/a");
  backup_trans_cancel_request(cloud.handle);
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(doomed->code, BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_FALSE(doomed->has_info);
  store->release();
  EXPECT_EQ(cloud.put("/a", "y"), 0);
  EXPECT_EQ(cloud.get("/a"), "y");
}

TEST_P(Conformance, CancelOfOneHandleLeavesTheOthersAlone) {
  store->hold();
  backup_trans_handle_h first = cloud.handle;
  const AnswerPtr doomed = cloud.upload(cloud.file("x"), "/doomed");
  cloud.handle = backup_trans_create_handle();
  const AnswerPtr spared = cloud.upload(cloud.file("y"), "/spared");
  backup_trans_cancel_request(first);
  backup_trans_cancel_request(nullptr);
  ASSERT_TRUE(run_until([&] { return doomed->calls == 1; }));
  EXPECT_EQ(doomed->code, BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_EQ(spared->calls, 0);
  store->release();
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(spared->code, 0);
  EXPECT_EQ(store->content(), (std::map<std::string, std::string>{{"/spared", "y"}}));
}

TEST_P(Conformance, CancelInTheMiddleLeavesTheObjectWholeOrAbsent) {
  const std::string old_content = bytes(1 << 20, 1);
  const std::string new_content = bytes(16 << 20, 2);
  ASSERT_EQ(cloud.put("/big", old_content), 0);
  const std::string local = cloud.file(new_content);
  const std::string place = cloud.file("local before");
  for (int round = 0; round < 5; ++round) {
    const AnswerPtr up = cloud.upload(local, "/big");
    const AnswerPtr down = cloud.download("/big", place);
    run_until([] { return threads_named(transport::kWorkerName) > 0; });
    backup_trans_cancel_request(cloud.handle);
    ASSERT_TRUE(cloud.settle());
    const auto stored = store->content();
    ASSERT_EQ(stored.size(), 1U);
    EXPECT_TRUE(stored.at("/big") == old_content || stored.at("/big") == new_content);
    if (up->code == 0) {
      EXPECT_TRUE(stored.at("/big") == new_content);
    }
    const std::string received = read_file(place);
    if (down->code != 0 && round == 0) {
      EXPECT_EQ(received, "local before");
    }
    EXPECT_TRUE(received == "local before" || received == old_content || received == new_content);
  }
}

TEST_P(Conformance, EndOfTheLibraryCancelsAndStillAnswers) {
  store->hold();
  std::vector<AnswerPtr> answers;
  for (int i = 0; i < 8; ++i)
    answers.push_back(cloud.upload(cloud.file("x"), "/" + std::to_string(i)));
  backup_trans_deinit();
  ASSERT_TRUE(cloud.settle());
  for (const AnswerPtr &answer : answers) EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_CANCELLED);
  store->release();
  EXPECT_TRUE(run_until([] { return threads_named(transport::kWorkerName) == 0; }));
  EXPECT_TRUE(store->content().empty());
}

TEST_P(Conformance, SynchronousDownloadIsCancelledFromAnotherThread) {
  ASSERT_EQ(cloud.put("/a", "x"), 0);
  // The thread that runs from here on is the download's own.
  ASSERT_TRUE(run_until([] { return threads_named(transport::kWorkerName) == 0; }));
  store->hold();
  const std::string place = cloud.place();
  std::atomic<int> code{-1};
  std::thread waiter(
      [&] { code = backup_trans_download_file_ors(cloud.handle, "/a", place.c_str(), 0); });
  ASSERT_TRUE(run_until([] { return threads_named(transport::kWorkerName) > 0; }));
  const auto start = std::chrono::steady_clock::now();
  backup_trans_cancel_request(cloud.handle);
  waiter.join();
  EXPECT_LT(std::chrono::steady_clock::now() - start, milliseconds(1000));
  EXPECT_EQ(code, BACKUP_TRANS_ERROR_CANCELLED);
  EXPECT_EQ(read_file(place), "<absent>");
  store->release();
}

TEST_P(Conformance, FourTransfersRunAndTheRestWaitsInOrder) {
  store->hold();
  for (int i = 0; i < 12; ++i) cloud.upload(cloud.file("x"), "/o/" + std::to_string(i));
  ASSERT_TRUE(run_until([] {
    return threads_named(transport::kWorkerName) == BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS;
  }));
  const auto end = std::chrono::steady_clock::now() + milliseconds(100);
  run_until([&] {
    EXPECT_LE(threads_named(transport::kWorkerName), BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS);
    return std::chrono::steady_clock::now() > end;
  });
  store->release();
  ASSERT_TRUE(cloud.settle());
  EXPECT_EQ(store->content().size(), 12U);
  EXPECT_TRUE(run_until([] { return threads_named(transport::kWorkerName) == 0; }));
}

// Leaves with everything in flight: CONFIG-PATH LOCAL.
int exit_role(int argc, char **argv) {
  if (argc != 2) return 125;
  setenv("QUARN_CLOUD_CONFIG", argv[0], 1);
  int code = -1;
  backup_trans_init(
      &code, [](backup_trans_error_code error, void *out) { *static_cast<int *>(out) = error; });
  run_until([&] { return code >= 0; });
  backup_trans_handle_h handle = backup_trans_create_handle();
  for (int i = 0; i < 20; ++i) {
    const std::string remote = "/exit/" + std::to_string(i);
    const int accepted = backup_trans_upload_file_ors_async(
        handle, argv[1], remote.c_str(),
        [](backup_trans_error_code, void *, const backup_trans_file_info_s *) {}, 1, 0, nullptr,
        nullptr);
    if (accepted != 0) return 124;
  }
  return 0;
}
const bool added = add_role("exit", exit_role);

TEST_P(Conformance, ProcessMayExitWithRequestsInFlight) {
  const std::string content = bytes(3 << 20);
  const std::string local = cloud.file(content);
  for (int round = 0; round < 5; ++round)
    EXPECT_EQ(run_role({"exit", cloud.config_path(), local}), 0);
  for (const Child &child : cloud.children("/exit")) EXPECT_EQ(child.size, content.size());
  ASSERT_EQ(cloud.put("/exit/last", "x"), 0);
  for (const auto &[path, stored] : store->content())
    EXPECT_TRUE(stored == content || path == "/exit/last") << path;
}

}  // namespace
