/**
 * @file device_info.h
 * @brief The device: its model, its serial number, its clock.
 *
 * Every function logs its failures and reports them by its result only.
 * Any thread.
 */
#ifndef QUARN_D_UTILS_DEVICE_INFO_H
#define QUARN_D_UTILS_DEVICE_INFO_H

#include <cstdint>

/** Model name and serial number (IMEI), malloc'd; null where unknown. */
void get_device_info(char **model, char **serial);
/** Milliseconds since the Unix epoch. */
[[nodiscard]] std::int64_t _get_current_timestamp();

#endif
