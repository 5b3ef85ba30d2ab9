/**
 * @file listing_pages.h
 * @brief A folder's listing, read from the store once for many pages.
 *
 * Every store has to read a whole listing for any page of it, so a folder of n pages would cost
 * the square of n. What follows a page is kept for the next one, which is asked for at once: at
 * most kAhead children, for a minute, until something is uploaded or deleted through this library.
 * The pages of one walk are then of one moment. Any thread.
 */
#ifndef BACKUP_TRANSPORT_LISTING_PAGES_H
#define BACKUP_TRANSPORT_LISTING_PAGES_H

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "core/backend.h"
#include "core/retry.h"
#include "thread_annotations.h"

namespace transport {

/** Which page. */
struct PageWanted {
  std::shared_ptr<Backend> store;
  std::string folder;
  int start; /**< children before it */
  int count; /**< most children of it */
};

class ListingPages {
 public:
  /** Children that are read at once. */
  static constexpr int kAhead = 10000;
  /** How long they may be kept. */
  static constexpr std::chrono::seconds kKept{60};
  /** Reads children from the store: (start, count, page). */
  using Fetch = std::function<Outcome(int, int, ListPage *)>;

  /** One page, from what is kept or by one call of @p fetch. */
  Outcome get(const PageWanted &wanted, RetryClock::Point now, const Fetch &fetch, ListPage *page);
  /** A store was changed: what is kept, or being read, is of another moment. */
  void forget();

 private:
  bool take(const PageWanted &wanted, RetryClock::Point now, ListPage *page) QUARN_REQUIRES(mutex_);
  void keep(const PageWanted &wanted, RetryClock::Point now, unsigned changes, ListPage *page)
      QUARN_REQUIRES(mutex_);

  Mutex mutex_;
  unsigned changes_ QUARN_GUARDED_BY(mutex_) = 0;  // of stores, so far
  std::weak_ptr<Backend> store_ QUARN_GUARDED_BY(mutex_);
  std::string folder_ QUARN_GUARDED_BY(mutex_);
  int next_ QUARN_GUARDED_BY(mutex_) = 0;  // where kept_ begins
  /** In reverse, so that a page is taken from its end. */
  std::vector<ObjectInfo> kept_ QUARN_GUARDED_BY(mutex_);
  bool more_ QUARN_GUARDED_BY(mutex_) = false;  // the store has more than what is kept
  RetryClock::Point read_at_ QUARN_GUARDED_BY(mutex_);
};

}  // namespace transport

#endif
