/**
 * @file session.h
 * @brief What tests reach of the session behind backup_transport.h.
 */
#ifndef BACKUP_TRANSPORT_SESSION_H
#define BACKUP_TRANSPORT_SESSION_H

#include <functional>
#include <memory>

#include "core/backend.h"
#include "core/config.h"
#include "core/retry.h"

namespace transport {

/** @return null, with @p problem, when the configuration names no store that can be */
using BackendMaker =
    std::function<std::shared_ptr<Backend>(const Config &config, std::string *problem)>;

/** Have other stores than the configured ones from the next init on; empty: the real ones. */
void set_backend_maker(BackendMaker maker);

/** Have another clock and other limits for the retries; null: the real ones. */
void set_retry_clock(RetryClock *clock, const RetryLimits &limits);

/** Name of the threads that run requests. */
constexpr char kWorkerName[] = "cloud-request";

}  // namespace transport

#endif
