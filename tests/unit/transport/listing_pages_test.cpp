#include "session/listing_pages.h"

#include <gtest/gtest.h>

#include <utility>

namespace transport {
namespace {

using std::chrono::seconds;
using Calls = std::vector<std::pair<int, int>>;

/** Only its address matters. */
class NoBackend : public Backend {
 public:
  Outcome download(Attempt &, const std::string &, LocalTarget &, Version *) override { return {}; }
  Outcome upload(Attempt &, const Upload &, ObjectInfo *) override { return {}; }
  Outcome list(Attempt &, const std::string &, int, int, ListPage *) override { return {}; }
  Outcome remove_folder(Attempt &, const std::string &) override { return {}; }
};

class Pages : public ::testing::Test {
 protected:
  Outcome fetch(int start, int count, ListPage *page) {
    calls_.emplace_back(start, count);
    for (int i = start; i < std::min(start + count, children_); ++i) {
      ObjectInfo child;
      child.path = "/" + std::to_string(i);
      page->children.push_back(child);
    }
    page->more = start + count < children_;
    if (on_fetch_) on_fetch_();
    return outcome_;
  }

  /** The page's first and last child and their number, and whether there are more. */
  std::string page(int start, int count = 100, const std::string &folder = "/folder") {
    ListPage page;
    const Outcome outcome = pages_.get(
        {store_, folder, start, count}, now_,
        [this](int from, int most, ListPage *read) { return fetch(from, most, read); }, &page);
    if (!outcome.ok()) return "failed";
    std::string text = std::to_string(page.children.size());
    if (!page.children.empty())
      text += ": " + page.children.front().path + " to " + page.children.back().path;
    return text + (page.more ? ", more" : "");
  }

  ListingPages pages_;
  std::shared_ptr<Backend> store_ = std::make_shared<NoBackend>();
  RetryClock::Point now_{std::chrono::hours(1)};
  int children_ = 250;
  Outcome outcome_;
  std::function<void()> on_fetch_;
  Calls calls_;
};

TEST_F(Pages, OfOneFolderAreReadOnce) {
  EXPECT_EQ(page(0), "100: /0 to /99, more");
  children_ = 0;
  EXPECT_EQ(page(100), "100: /100 to /199, more");
  EXPECT_EQ(page(200), "50: /200 to /249");
  EXPECT_EQ(calls_, (Calls{{0, ListingPages::kAhead}}));
}

TEST_F(Pages, ThatTheStoreEndsWithAreTheLast) {
  children_ = 200;
  EXPECT_EQ(page(0), "100: /0 to /99, more");
  EXPECT_EQ(page(100), "100: /100 to /199");
  EXPECT_EQ(page(200), "0");
  EXPECT_EQ(calls_.size(), 2U);
}

TEST_F(Pages, MayHaveDifferentSizes) {
  EXPECT_EQ(page(0, 10), "10: /0 to /9, more");
  EXPECT_EQ(page(10, 200), "200: /10 to /209, more");
  EXPECT_EQ(page(210, 100), "40: /210 to /249");
  EXPECT_EQ(calls_.size(), 1U);
}

TEST_F(Pages, OfALongFolderAreReadInParts) {
  children_ = ListingPages::kAhead * 2 + 50;
  for (int start = 0; start < children_; start += 100) {
    const int last = std::min(start + 100, children_);
    EXPECT_EQ(page(start), std::to_string(last - start) + ": /" + std::to_string(start) + " to /" +
                               std::to_string(last - 1) + (last < children_ ? ", more" : ""));
  }
  EXPECT_EQ(calls_, (Calls{{0, ListingPages::kAhead},
                           {ListingPages::kAhead, ListingPages::kAhead},
                           {ListingPages::kAhead * 2, ListingPages::kAhead}}));
}

TEST_F(Pages, AreFullWhereWhatIsKeptIsNot) {
  children_ = ListingPages::kAhead + 200;
  EXPECT_EQ(page(0, 70), "70: /0 to /69, more");
  for (int start = 70; start + 100 <= ListingPages::kAhead; start += 100) page(start);
  EXPECT_EQ(calls_.size(), 1U);
  EXPECT_EQ(page(9970), "100: /9970 to /10069, more");
  EXPECT_EQ(calls_.size(), 2U);
}

TEST_F(Pages, OfAnotherPlaceAreReadAnew) {
  page(0);
  EXPECT_EQ(page(50), "100: /50 to /149, more");
  page(0);
  EXPECT_EQ(page(100, 100, "/other"), "100: /100 to /199, more");
  page(0);
  store_ = std::make_shared<NoBackend>();
  EXPECT_EQ(page(100), "100: /100 to /199, more");
  EXPECT_EQ(calls_.size(), 6U);
}

TEST_F(Pages, FromTheFirstOnAreAlwaysReadAnew) {
  page(0);
  children_ = 3;
  EXPECT_EQ(page(0), "3: /0 to /2");
}

TEST_F(Pages, AreReadAnewAfterAChange) {
  page(0);
  pages_.forget();
  children_ = 120;
  EXPECT_EQ(page(100), "20: /100 to /119");
}

TEST_F(Pages, AreNotKeptWhenAChangeCameBetween) {
  on_fetch_ = [this] { pages_.forget(); };
  EXPECT_EQ(page(0), "100: /0 to /99, more");
  on_fetch_ = nullptr;
  children_ = 120;
  EXPECT_EQ(page(100), "20: /100 to /119");
}

TEST_F(Pages, AreReadAnewAfterAMinute) {
  page(0);
  now_ += ListingPages::kKept;
  page(100, 10);
  EXPECT_EQ(calls_.size(), 1U);
  now_ += seconds(1);
  page(110);
  EXPECT_EQ(calls_.size(), 2U);
}

TEST_F(Pages, ThatCannotBeReadAreNotKept) {
  outcome_ = failure(BACKUP_TRANS_ERROR_SERVER, "no");
  EXPECT_EQ(page(0), "failed");
  outcome_ = {};
  EXPECT_EQ(page(100), "100: /100 to /199, more");
}

}  // namespace
}  // namespace transport
