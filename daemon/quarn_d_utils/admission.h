/**
 * @file admission.h
 * @brief How many requests may wait, and whose they are.
 *
 * A request counts from its acceptance to its final callback.
 */
#ifndef QUARN_D_UTILS_ADMISSION_H
#define QUARN_D_UTILS_ADMISSION_H

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

inline constexpr std::size_t kMaxWaitingOfCaller = 64;
inline constexpr std::size_t kMaxWaiting = 512;
/** Of one user other than root over all its connections: half of all stays for others. */
inline constexpr std::size_t kMaxWaitingOfUser = 256;
/** Of one application, which a security label names, over all its connections. */
inline constexpr std::size_t kMaxWaitingOfLabel = 64;

/** Whose requests a connection's are besides; empty: nobody's that is bounded. */
struct waiting_parties {
  std::string user;
  std::string label;
};

/** True when another request of @p caller, a unique bus name, may be accepted. Any thread. */
bool may_wait(const std::string &caller, const waiting_parties &parties = {});

/**
 * Count a request that the running fiber, if it is one, works on.
 * @return it counts until this goes, on any thread
 */
std::shared_ptr<const void> count_waiting(const std::string &caller,
                                          const waiting_parties &parties = {});

/** Requests that count. Any thread. */
std::size_t waiting_requests();

/** The fibers, by number, that @p caller's requests were accepted on; some may have ended. */
std::vector<std::uint64_t> fibers_of_caller(const std::string &caller);

#endif
