/**
 * @file withdrawal.h
 * @brief The end of transfers that nobody waits for any more. Main thread.
 */
#ifndef QUARN_D_RESTORE_WITHDRAWAL_H
#define QUARN_D_RESTORE_WITHDRAWAL_H

#include <cstdint>
#include <string>

struct pkg_restore_context;

/** Leave a requested restore to the engine, which ends its download and deletes @p ctx. */
void abandon_restore(pkg_restore_context *ctx);
/** End the downloads of installed packages: restore mode was withdrawn. */
void abort_monitored_downloads();
/** Answer @p sender's requests for the cloud's list as cancelled. @return how many */
std::uint32_t withdraw_app_lists(const std::string &sender);

#endif
