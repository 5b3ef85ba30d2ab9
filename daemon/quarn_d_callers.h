/**
 * @file quarn_d_callers.h
 * @brief Who calls, and whether that caller may have what a method's row in quarn_d_methods.h says.
 *
 * Plain values in, a verdict out: nothing here asks the bus or keeps anything.
 * Any thread.
 */
#ifndef QUARN_D_CALLERS_H
#define QUARN_D_CALLERS_H

#include <sys/types.h>

#include <string>
#include <vector>

/** Who calls, as the bus tells it. */
struct quarn_caller {
  bool known = false; /**< the bus has told */
  uid_t uid = static_cast<uid_t>(-1);
  std::vector<gid_t> groups;
  std::string label; /**< security label; empty: none */
};

/** What callers are told apart into. */
enum class caller_kind {
  trusted,     /**< root, and the members of the clients' group */
  companion,   /**< the phone-transfer companion */
  application, /**< any other application, with its package's label */
  nobody
};

/** What a call asks for, as far as it matters who asks. */
struct quarn_subject {
  std::string interface_name;
  std::string member;
  std::string package;      /**< of the arguments; empty when there is none */
  int client = -1;          /**< a #quarn_client_kind that the arguments name, where it is one */
  bool switches_on = false; /**< of what they switch on or off */
};

struct caller_verdict {
  bool allowed;
  std::string reason; /**< why not; empty when allowed */
};

/** The name of the group whose members may do everything. */
extern const char kClientGroup[];
/** No group's number. */
inline constexpr gid_t kNoGroup = static_cast<gid_t>(-1);

/** @param client_group number of the clients' group; kNoGroup: the system has none */
[[nodiscard]] caller_kind kind_of_caller(const quarn_caller &caller, gid_t client_group);

/**
 * What kQuarnMethods says of who may call, applied to one call.
 * @param cloud_mode restore mode is on, and not the companion's
 */
[[nodiscard]] caller_verdict may_call(const quarn_caller &caller, gid_t client_group,
                                      const quarn_subject &subject, bool cloud_mode);

#endif
