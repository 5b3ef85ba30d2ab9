/**
 * @file check.h
 * @brief Whether a store can be used, tried out with one small object.
 *
 * Thread: a worker of the session; see backend.h.
 */
#ifndef BACKUP_TRANSPORT_CHECK_H
#define BACKUP_TRANSPORT_CHECK_H

#include "core/backend.h"

namespace transport {

/**
 * List the store, put an object of a few bytes into a folder of its own, read
 * it back and remove it. Each step is one attempt: what counts is how the store
 * is now. Nothing is left behind where the store lets it be removed.
 */
Outcome check_store(Ticket &ticket, Backend &backend);

/** What a person should look at. */
backup_trans_cause cause_of(const Outcome &outcome);

}  // namespace transport

#endif
