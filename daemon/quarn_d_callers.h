/**
 * @file quarn_d_callers.h
 * @brief Who may ask the daemon for what.
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
  bool switches_on = false; /**< of restore_enable */
};

struct caller_verdict {
  bool allowed;
  std::string reason; /**< why not; empty when allowed */
};

/** The name of the group whose members may do everything. */
extern const char kClientGroup[];

/** @param client_group number of the clients' group; -1: the system has none */
caller_kind kind_of_caller(const quarn_caller &caller, gid_t client_group);

/**
 * The one table of rights.
 * @param cloud_mode restore mode is on, and not the companion's
 */
caller_verdict may_call(const quarn_caller &caller, gid_t client_group,
                        const quarn_subject &subject, bool cloud_mode);

#endif
