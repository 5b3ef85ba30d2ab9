/**
 * @file file_crc.h
 * @brief The checksum of a file that is open.
 */
#ifndef QUARN_D_UTILS_FILE_CRC_H
#define QUARN_D_UTILS_FILE_CRC_H

#include <cstdint>

/**
 * CRC-32 (IEEE 802.3) of everything that @p fd can read, from the beginning of the file;
 * 0 when there is no memory for it. Any thread.
 */
[[nodiscard]] std::uint32_t get_open_file_crc(int fd);

#endif
