/**
 * @file fault.h
 * @brief Failures of the device's services, on request.
 *
 * DIR/state/faults.ini makes a service function fail without doing anything:
 *
 *     [faults]
 *     security_server_perm_commit=-2
 *
 * Any thread.
 */
#ifndef QUARN_EMBEDDED_FAULT_H
#define QUARN_EMBEDDED_FAULT_H

#include <optional>

namespace embedded {

inline constexpr char kFaultsFile[] = "faults.ini";

/** The result that @p function is to fail with; none when it is to work. */
std::optional<int> fault_of(const char *function);

}  // namespace embedded

/** Leave a service function that is to fail. */
#define RETURN_FAULT()                                                  \
  do {                                                                  \
    if (const auto fault = embedded::fault_of(__func__)) return *fault; \
  } while (false)

#endif
