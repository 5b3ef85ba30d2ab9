/**
 * @file list_keys.h
 * @brief The members of an application list, apart from the two arrays of model_entries.h.
 */
#ifndef QUARN_D_BACKUP_LIST_KEYS_H
#define QUARN_D_BACKUP_LIST_KEYS_H

inline constexpr char kFormatVersion[] = "format_ver";
inline constexpr char kBackupInfo[] = "backup_info";
inline constexpr char kAppDataPath[] = "app_data_path";
inline constexpr char kTimestamp[] = "timestamp";
inline constexpr char kSerialNumber[] = "serial_number";
inline constexpr char kModelName[] = "model_name";
inline constexpr char kPkgId[] = "pkg_id";
inline constexpr char kVersion[] = "version";
inline constexpr char kCrc[] = "crc";

/** Of the format that is written, and the only one that is read. */
inline constexpr int kSupportedFormat = 1;

#endif
