#include "quarn_d_utils/admission.h"

#include <map>
#include <set>

#include "quarn_d_utils/fiber.h"
#include "thread_annotations.h"

namespace {

struct waiting_table {
  Mutex mutex;
  std::size_t count QUARN_GUARDED_BY(mutex) = 0;
  /** By caller, the numbers of the fibers; 0 for a request that came without one. */
  std::map<std::string, std::multiset<std::uint64_t>> callers QUARN_GUARDED_BY(mutex);
  /** Of all but root, over all connections of a caller. */
  std::map<std::string, std::size_t> parties QUARN_GUARDED_BY(mutex);
  std::size_t others QUARN_GUARDED_BY(mutex) = 0;
  std::size_t applications QUARN_GUARDED_BY(mutex) = 0;
};

waiting_table &table() {
  // never destroyed: the worker may outlive main()
  static auto *made = new waiting_table;
  return *made;
}

class counted_request {
 public:
  counted_request(const std::string &caller, const waiting_parties &parties)
      : caller_(caller), parties_(parties), fiber_(fiber_id(current_fiber())) {
    const MutexLock lock(table().mutex);
    table().callers[caller_].insert(fiber_);
    ++table().count;
    if (parties_.caller.empty()) return;
    ++table().parties[parties_.caller];
    ++table().others;
    if (parties_.is_application) ++table().applications;
  }
  ~counted_request() {
    const MutexLock lock(table().mutex);
    const auto entry = table().callers.find(caller_);
    entry->second.erase(entry->second.find(fiber_));
    if (entry->second.empty()) table().callers.erase(entry);
    --table().count;
    if (parties_.caller.empty()) return;
    const auto party = table().parties.find(parties_.caller);
    if (--party->second == 0) table().parties.erase(party);
    --table().others;
    if (parties_.is_application) --table().applications;
  }
  counted_request(const counted_request &) = delete;
  counted_request &operator=(const counted_request &) = delete;

 private:
  const std::string caller_;
  const waiting_parties parties_;
  const std::uint64_t fiber_;
};

}  // namespace

bool may_wait(const std::string &caller, const waiting_parties &parties) {
  const MutexLock lock(table().mutex);
  const auto entry = table().callers.find(caller);
  const std::size_t own = entry == table().callers.end() ? 0 : entry->second.size();
  if (own >= kMaxWaitingOfCaller || table().count >= kMaxWaiting) return false;
  if (parties.caller.empty()) return true;
  const auto party = table().parties.find(parties.caller);
  const std::size_t of_party = party == table().parties.end() ? 0 : party->second;
  return of_party < kMaxWaitingOfCaller && table().others < kMaxWaitingOfOthers &&
         (!parties.is_application || table().applications < kMaxWaitingOfApplications);
}

std::shared_ptr<const void> count_waiting(const std::string &caller,
                                          const waiting_parties &parties) {
  return std::make_shared<counted_request>(caller, parties);
}

std::size_t waiting_requests() {
  const MutexLock lock(table().mutex);
  return table().count;
}

std::vector<std::uint64_t> fibers_of_caller(const std::string &caller) {
  const MutexLock lock(table().mutex);
  const auto entry = table().callers.find(caller);
  if (entry == table().callers.end()) return {};
  return {entry->second.begin(), entry->second.end()};
}
