/**
 * @file zip_bytes.h
 * @brief Zip archives byte by byte: what a writer made, and what no writer would make.
 *
 * Constants and layouts are those of APPNOTE.TXT, the format's description.
 */
#ifndef ZIP_BYTES_H
#define ZIP_BYTES_H

#include <cstdint>
#include <string>
#include <vector>

inline constexpr unsigned int kZipStored = 0;
inline constexpr unsigned int kZipDeflated = 8;
inline constexpr unsigned int kZipBzip2 = 12;
inline constexpr unsigned int kZipEncrypted = 1U << 0;
inline constexpr unsigned int kZipDescriptor = 1U << 3;
inline constexpr unsigned int kZipUtf8 = 1U << 11;

/** One entry as an archive holds it. */
struct ZipEntry {
  std::string name;
  std::string data; /**< as it lies in the archive */
  unsigned int method = kZipDeflated;
  unsigned int flags = 0;
  std::uint32_t crc = 0;
  std::uint64_t packed_size = 0;
  std::uint64_t size = 0;
  bool zip64 = false;    /**< the sizes lie in the zip64 field */
  unsigned int date = 0; /**< read only, as are the following */
  unsigned int extra_size = 0;
  unsigned int comment_size = 0;
  std::uint32_t attributes = 0;
};

/** Raw deflate of a text, by zlib. */
std::string deflate_text(const std::string &text);
/** Its reverse; a text that ends with "(corrupt)" when that fails. */
std::string inflate_text(const std::string &deflated);
std::uint32_t crc_of_text(const std::string &text);

/** An honest entry. */
ZipEntry deflated_entry(const std::string &name, const std::string &text);
ZipEntry stored_entry(const std::string &name, const std::string &text);

/**
 * An archive of these entries as they are told.
 * @param announced number of entries that the end record announces; all by default
 */
std::string zip_bytes(const std::vector<ZipEntry> &entries, long announced = -1);
/** The same with a zip64 end record, as more than 65,535 entries need it. */
std::string zip64_bytes(const std::vector<ZipEntry> &entries);

/** The entries of an archive in the order of its directory; each local header must agree. */
std::vector<ZipEntry> parse_zip(const std::string &archive);

#endif
