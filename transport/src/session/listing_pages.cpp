#include "session/listing_pages.h"

#include <algorithm>
#include <iterator>

namespace transport {

Outcome ListingPages::get(const PageWanted &wanted, RetryClock::Point now, const Fetch &fetch,
                          ListPage *page) {
  unsigned changes = 0;
  {
    const MutexLock lock(mutex_);
    if (take(wanted, now, page)) return success();
    changes = changes_;
  }
  const Outcome outcome = fetch(wanted.start, std::max(wanted.count, kAhead), page);
  if (!outcome.ok()) return outcome;
  const MutexLock lock(mutex_);
  keep(wanted, now, changes, page);
  return outcome;
}

void ListingPages::forget() {
  const MutexLock lock(mutex_);
  ++changes_;
  kept_ = {};
}

bool ListingPages::take(const PageWanted &wanted, RetryClock::Point now, ListPage *page) {
  if (kept_.empty() || wanted.start != next_ || wanted.folder != folder_ ||
      store_.lock() != wanted.store || now - read_at_ > kKept) {
    return false;
  }
  const auto count = static_cast<std::size_t>(wanted.count);
  // Only the last page is shorter than what was asked for.
  if (kept_.size() < count && more_) return false;
  const std::size_t taken = std::min(count, kept_.size());
  page->children.assign(std::make_move_iterator(kept_.rbegin()),
                        std::make_move_iterator(kept_.rbegin() + static_cast<long>(taken)));
  kept_.resize(kept_.size() - taken);
  next_ += static_cast<int>(taken);
  page->more = more_ || !kept_.empty();
  if (kept_.empty()) kept_ = {};
  return true;
}

void ListingPages::keep(const PageWanted &wanted, RetryClock::Point now, unsigned changes,
                        ListPage *page) {
  const auto count = static_cast<std::size_t>(wanted.count);
  if (page->children.size() <= count) return;
  const auto rest = page->children.begin() + static_cast<long>(count);
  if (changes == changes_) {
    kept_.assign(std::make_move_iterator(page->children.rbegin()),
                 std::make_move_iterator(std::make_reverse_iterator(rest)));
    store_ = wanted.store;
    folder_ = wanted.folder;
    next_ = wanted.start + wanted.count;
    more_ = page->more;
    read_at_ = now;
  }
  page->children.erase(rest, page->children.end());
  page->more = true;
}

}  // namespace transport
