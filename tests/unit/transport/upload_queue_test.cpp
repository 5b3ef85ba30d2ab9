#include "http/upload_queue.h"

#include <gtest/gtest.h>

#include <vector>

using transport::UploadQueue;

namespace {

// What each look tells, one character each.
std::string looks(UploadQueue *queue, const std::vector<int> &held) {
  std::string told;
  for (const int bytes : held) told += queue->look(bytes) ? '+' : '-';
  return told;
}

TEST(UploadQueueTest, AQueueThatBecomesLessMoves) {
  UploadQueue queue;
  EXPECT_EQ(looks(&queue, {3000, 2000, 2000, 1, 0, 0}), "-+-++-");
}

TEST(UploadQueueTest, AQueueThatGrowsIsAnotherExchanges) {
  UploadQueue queue;
  EXPECT_EQ(looks(&queue, {100, 200, 300}), "---");
}

TEST(UploadQueueTest, NothingOfItsOwnIsLeftOnceTheQueueWasEmpty) {
  UploadQueue queue;
  EXPECT_EQ(looks(&queue, {100, 0, 500, 400, 0, 500, 300}), "-+-----");
}

TEST(UploadQueueTest, NothingOfItsOwnIsLeftWhenAsMuchWasTakenFromAQueueThatIsNeverEmpty) {
  UploadQueue queue;
  EXPECT_EQ(looks(&queue, {100, 60, 200, 150, 140, 300, 200, 100}), "-+-++---");
}

TEST(UploadQueueTest, BeginsAnewWhenTheExchangeItselfMoved) {
  UploadQueue queue;
  EXPECT_FALSE(queue.is_known());
  EXPECT_EQ(looks(&queue, {100, 0}), "-+");
  EXPECT_TRUE(queue.is_known());
  queue.restart();
  EXPECT_FALSE(queue.is_known());
  EXPECT_EQ(looks(&queue, {500, 400}), "-+");
}

}  // namespace
