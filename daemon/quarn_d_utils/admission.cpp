#include "quarn_d_utils/admission.h"

#include <map>
#include <mutex>
#include <set>

#include "quarn_d_utils/fiber.h"

namespace {

struct waiting_table {
  std::mutex mutex;
  std::size_t count = 0;
  /** By caller, the numbers of the fibers; 0 for a request that came without one. */
  std::map<std::string, std::multiset<std::uint64_t>> callers;
  std::map<std::string, std::size_t> users;
  std::map<std::string, std::size_t> labels;
};

using counts = std::map<std::string, std::size_t>;

void count_up(counts &of, const std::string &party) {
  if (!party.empty()) ++of[party];
}

void count_down(counts &of, const std::string &party) {
  const auto entry = of.find(party);
  if (entry != of.end() && --entry->second == 0) of.erase(entry);
}

bool is_below(const counts &of, const std::string &party, std::size_t bound) {
  const auto entry = of.find(party);
  return entry == of.end() || entry->second < bound;
}

waiting_table &table() {
  // never destroyed: the worker may outlive main()
  static auto *made = new waiting_table;
  return *made;
}

class counted_request {
 public:
  counted_request(const std::string &caller, const waiting_parties &parties)
      : caller_(caller), parties_(parties), fiber_(fiber_id(current_fiber())) {
    const std::lock_guard<std::mutex> lock(table().mutex);
    table().callers[caller_].insert(fiber_);
    count_up(table().users, parties_.user);
    count_up(table().labels, parties_.label);
    ++table().count;
  }
  ~counted_request() {
    const std::lock_guard<std::mutex> lock(table().mutex);
    const auto entry = table().callers.find(caller_);
    entry->second.erase(entry->second.find(fiber_));
    if (entry->second.empty()) table().callers.erase(entry);
    count_down(table().users, parties_.user);
    count_down(table().labels, parties_.label);
    --table().count;
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
  const std::lock_guard<std::mutex> lock(table().mutex);
  const auto entry = table().callers.find(caller);
  const std::size_t own = entry == table().callers.end() ? 0 : entry->second.size();
  return own < kMaxWaitingOfCaller && table().count < kMaxWaiting &&
         is_below(table().users, parties.user, kMaxWaitingOfUser) &&
         is_below(table().labels, parties.label, kMaxWaitingOfLabel);
}

std::shared_ptr<const void> count_waiting(const std::string &caller,
                                          const waiting_parties &parties) {
  return std::make_shared<counted_request>(caller, parties);
}

std::size_t waiting_requests() {
  const std::lock_guard<std::mutex> lock(table().mutex);
  return table().count;
}

std::vector<std::uint64_t> fibers_of_caller(const std::string &caller) {
  const std::lock_guard<std::mutex> lock(table().mutex);
  const auto entry = table().callers.find(caller);
  if (entry == table().callers.end()) return {};
  return {entry->second.begin(), entry->second.end()};
}
