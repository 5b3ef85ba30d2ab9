// What many waiting uploads cost.
#include "dav_front_store.h"
#include "http/http.h"
#include "session/session.h"
#include "this_process.h"

using namespace harness;

namespace {

constexpr int kUploads = 200;
constexpr std::size_t kUploadBytes = 1 << 20;
// The object's own size 64 times over would be a copy of every third one.
constexpr std::size_t kMostResidentBytes = 64 * kUploadBytes;
// A connection for each worker and both its ends, and what a thread opens for itself.
constexpr int kSpareDescriptors = 32;

TEST(Queue, WaitingUploadsHoldADescriptorEachAndNothingElse) {
  DavFrontStore store;
  Cloud cloud(store.config());
  const std::string local = cloud.file(bytes(kUploadBytes));
  ASSERT_EQ(cloud.put("/first", "x"), 0);
  const auto no_workers = [] { return threads_named(transport::kWorkerName) == 0; };
  ASSERT_TRUE(run_until(no_workers));
  const int descriptors = descriptors_in_use();
  const int threads = threads_in_use();
  const std::size_t resident = resident_bytes();
  store.hold();
  for (int i = 0; i < kUploads; ++i)
    ASSERT_EQ(cloud.upload(local, "/q/" + std::to_string(i))->accepted, 0);
  ASSERT_TRUE(run_until([] {
    return threads_named(transport::kWorkerName) == BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS;
  }));
  EXPECT_GE(descriptors_in_use() - descriptors, kUploads);
  EXPECT_LE(descriptors_in_use() - descriptors, kUploads + kSpareDescriptors);
  // The workers, and a thread of the server's for each of their connections.
  EXPECT_LE(threads_in_use() - threads, 2 * BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS);
  EXPECT_LT(resident_bytes(), resident + kMostResidentBytes);
  store.release();
  backup_trans_cancel_request(cloud.handle);
  ASSERT_TRUE(cloud.settle());
  EXPECT_TRUE(run_until(no_workers));
  // The server closes its ends on its own.
  EXPECT_TRUE(run_until([&] { return descriptors_in_use() - descriptors <= kSpareDescriptors; }));
}

}  // namespace
