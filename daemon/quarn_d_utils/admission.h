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

/** Of one connection, and of one caller but root over all its connections. */
inline constexpr std::size_t kMaxWaitingOfCaller = 64;
inline constexpr std::size_t kMaxWaiting = 512;
/** Of all applications together, which are one user: the rest stays for the users that are trusted.
 */
inline constexpr std::size_t kMaxWaitingOfApplications = 256;
/** Of all but root: what one caller may have stays for it, whoever else asks. */
inline constexpr std::size_t kMaxWaitingOfOthers = kMaxWaiting - kMaxWaitingOfCaller;

/** Whose requests a connection's are besides. */
struct waiting_parties {
  std::string
      caller; /**< the same for all its connections; empty: root, whose are as many callers */
  bool is_application = false;
};

/** True when another request of @p caller, a unique bus name, may be accepted. Any thread. */
[[nodiscard]] bool may_wait(const std::string &caller, const waiting_parties &parties = {});

/**
 * Count a request that the running fiber, if it is one, works on.
 * @return it counts until this goes, on any thread
 */
[[nodiscard]] std::shared_ptr<const void> count_waiting(const std::string &caller,
                                                        const waiting_parties &parties = {});

/** Requests that count. Any thread. No part of the daemon asks: for tests, and for who adds to it.
 */
[[nodiscard]] std::size_t waiting_requests();

/** The fibers, by number, that @p caller's requests were accepted on; some may have ended. */
[[nodiscard]] std::vector<std::uint64_t> fibers_of_caller(const std::string &caller);

#endif
