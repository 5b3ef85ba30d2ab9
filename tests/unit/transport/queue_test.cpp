// What many waiting uploads cost.
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "dav_front_store.h"
#include "http/http.h"
#include "resident_memory.h"
#include "session/session.h"

using namespace harness;
namespace fs = std::filesystem;

namespace {

constexpr int kUploads = 200;
constexpr std::size_t kUploadBytes = 1 << 20;
// The object's own size 64 times over would be a copy of every third one.
constexpr std::size_t kMostResidentBytes = 64 * kUploadBytes;
// A connection for each worker and both its ends, and what a thread opens for itself.
constexpr std::ptrdiff_t kSpareDescriptors = 32;

std::ptrdiff_t entries_of(const std::string &folder) {
  return std::distance(fs::directory_iterator(folder), fs::directory_iterator());
}

TEST(Queue, WaitingUploadsHoldADescriptorEachAndNothingElse) {
  DavFrontStore store;
  Cloud cloud(store.config());
  const std::string local = cloud.file(bytes(kUploadBytes));
  ASSERT_EQ(cloud.put("/first", "x"), 0);
  const auto no_workers = [] { return threads_named(transport::kWorkerName) == 0; };
  ASSERT_TRUE(run_until(no_workers));
  const std::ptrdiff_t descriptors = entries_of("/proc/self/fd");
  const std::ptrdiff_t threads = entries_of("/proc/self/task");
  const std::size_t resident = resident_bytes();
  store.hold();
  for (int i = 0; i < kUploads; ++i)
    ASSERT_EQ(cloud.upload(local, "/q/" + std::to_string(i))->accepted, 0);
  ASSERT_TRUE(run_until([] {
    return threads_named(transport::kWorkerName) == BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS;
  }));
  EXPECT_GE(entries_of("/proc/self/fd") - descriptors, kUploads);
  EXPECT_LE(entries_of("/proc/self/fd") - descriptors, kUploads + kSpareDescriptors);
  // The workers, and a thread of the server's for each of their connections.
  EXPECT_LE(entries_of("/proc/self/task") - threads, 2 * BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS);
  EXPECT_LT(resident_bytes(), resident + kMostResidentBytes);
  store.release();
  backup_trans_cancel_request(cloud.handle);
  ASSERT_TRUE(cloud.settle());
  EXPECT_TRUE(run_until(no_workers));
  // The server closes its ends on its own.
  EXPECT_TRUE(
      run_until([&] { return entries_of("/proc/self/fd") - descriptors <= kSpareDescriptors; }));
}

}  // namespace
