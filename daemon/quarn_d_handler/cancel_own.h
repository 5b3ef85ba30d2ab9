/**
 * @file cancel_own.h
 * @brief Withdrawing what one client has asked for. Main thread only.
 */
#ifndef QUARN_D_HANDLER_CANCEL_OWN_H
#define QUARN_D_HANDLER_CANCEL_OWN_H

#include <cstdint>
#include <string>

/**
 * Withdraw the requests of one connection and of nobody else: manual backups,
 * queued or running, what waits for the cloud's session, another request's
 * archive or a transfer, and the restore mode that it switched on. Each ends
 * with its final callback, with #QUARN_CANCELLED, and with its reply. What is settled
 * already, and a restore that has its archive, end as they end.
 * @param sender the connection's unique bus name
 * @return how many were withdrawn
 */
std::uint32_t quarnd_cancel_own(const std::string &sender);

/**
 * Cancel the manual backups whose clients are being told that they are taken.
 * @param sender whose; null: everybody's
 * @return how many were cancelled
 */
std::uint32_t quarnd_cancel_starting_backups(const std::string *sender);

#endif
