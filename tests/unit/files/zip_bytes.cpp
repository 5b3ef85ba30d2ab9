#include "zip_bytes.h"

#include <gtest/gtest.h>
#include <zlib.h>

namespace {

constexpr std::uint32_t kLocalHeader = 0x04034b50;
constexpr std::uint32_t kCentralHeader = 0x02014b50;
constexpr std::uint32_t kEndRecord = 0x06054b50;
constexpr std::uint32_t kZip64EndRecord = 0x06064b50;
constexpr std::uint32_t kZip64Locator = 0x07064b50;
constexpr std::size_t kLocalSize = 30;
constexpr std::size_t kCentralSize = 46;
constexpr std::size_t kEndSize = 22;
constexpr unsigned int kVersion = 20;
constexpr unsigned int kZip64Version = 45;
constexpr unsigned int kZip64Field = 1;
constexpr std::uint32_t kInZip64 = 0xffffffff;
constexpr int kRawWindow = -15;

void put(std::string *bytes, std::uint64_t value, int count) {
  for (int i = 0; i < count; ++i) *bytes += static_cast<char>(value >> (8 * i));
}

std::uint64_t get(const std::string &bytes, std::size_t at, int count) {
  std::uint64_t value = 0;
  for (int i = 0; i < count; ++i) {
    value |= static_cast<std::uint64_t>(static_cast<unsigned char>(bytes.at(at + i))) << (8 * i);
  }
  return value;
}

std::string zip64_field(const ZipEntry &entry) {
  std::string field;
  if (!entry.zip64) return field;
  put(&field, kZip64Field, 2);
  put(&field, 16, 2);
  put(&field, entry.size, 8);
  put(&field, entry.packed_size, 8);
  return field;
}

/** The fields that both headers have, from the version on. */
void put_common(std::string *bytes, const ZipEntry &entry, std::size_t extra) {
  put(bytes, entry.zip64 ? kZip64Version : kVersion, 2);
  put(bytes, entry.flags, 2);
  put(bytes, entry.method, 2);
  put(bytes, 0, 4);  // time and date
  put(bytes, entry.crc, 4);
  put(bytes, entry.zip64 ? kInZip64 : entry.packed_size, 4);
  put(bytes, entry.zip64 ? kInZip64 : entry.size, 4);
  put(bytes, entry.name.size(), 2);
  put(bytes, extra, 2);
}

struct Directory {
  std::string archive;
  std::size_t at = 0;
  std::size_t size = 0;
};

Directory put_entries(const std::vector<ZipEntry> &entries) {
  Directory result;
  std::string central;
  for (const ZipEntry &entry : entries) {
    const std::size_t offset = result.archive.size();
    const std::string extra = zip64_field(entry);
    put(&result.archive, kLocalHeader, 4);
    put_common(&result.archive, entry, extra.size());
    result.archive += entry.name + extra + entry.data;
    put(&central, kCentralHeader, 4);
    put(&central, kVersion, 2);
    put_common(&central, entry, extra.size());
    put(&central, 0, 2);  // comment
    put(&central, 0, 8);  // disk and attributes
    put(&central, offset, 4);
    central += entry.name + extra;
  }
  result.at = result.archive.size();
  result.size = central.size();
  result.archive += central;
  return result;
}

void put_end(std::string *bytes, std::uint64_t entries, std::uint64_t size, std::uint64_t at) {
  put(bytes, kEndRecord, 4);
  put(bytes, 0, 4);  // disks
  put(bytes, entries, 2);
  put(bytes, entries, 2);
  put(bytes, size, 4);
  put(bytes, at, 4);
  put(bytes, 0, 2);  // comment
}

}  // namespace

std::string deflate_text(const std::string &text) {
  z_stream stream = {};
  EXPECT_EQ(deflateInit2(&stream, Z_DEFAULT_COMPRESSION, Z_DEFLATED, kRawWindow, MAX_MEM_LEVEL,
                         Z_DEFAULT_STRATEGY),
            Z_OK);
  std::string deflated(deflateBound(&stream, text.size()), '\0');
  stream.next_in = const_cast<Bytef *>(reinterpret_cast<const Bytef *>(text.data()));
  stream.avail_in = static_cast<uInt>(text.size());
  stream.next_out = reinterpret_cast<Bytef *>(deflated.data());
  stream.avail_out = static_cast<uInt>(deflated.size());
  EXPECT_EQ(deflate(&stream, Z_FINISH), Z_STREAM_END);
  deflated.resize(stream.total_out);
  deflateEnd(&stream);
  return deflated;
}

std::string inflate_text(const std::string &deflated) {
  z_stream stream = {};
  EXPECT_EQ(inflateInit2(&stream, kRawWindow), Z_OK);
  stream.next_in = const_cast<Bytef *>(reinterpret_cast<const Bytef *>(deflated.data()));
  stream.avail_in = static_cast<uInt>(deflated.size());
  std::string text;
  int result = Z_OK;
  while (result == Z_OK) {
    char chunk[65536];
    stream.next_out = reinterpret_cast<Bytef *>(chunk);
    stream.avail_out = sizeof chunk;
    result = inflate(&stream, Z_NO_FLUSH);
    text.append(chunk, sizeof chunk - stream.avail_out);
  }
  const bool whole = result == Z_STREAM_END && stream.avail_in == 0;
  inflateEnd(&stream);
  return whole ? text : text + "(corrupt)";
}

std::uint32_t crc_of_text(const std::string &text) {
  return static_cast<std::uint32_t>(
      crc32_z(0, reinterpret_cast<const Bytef *>(text.data()), text.size()));
}

ZipEntry deflated_entry(const std::string &name, const std::string &text) {
  ZipEntry entry;
  entry.name = name;
  entry.data = deflate_text(text);
  entry.crc = crc_of_text(text);
  entry.packed_size = entry.data.size();
  entry.size = text.size();
  return entry;
}

ZipEntry stored_entry(const std::string &name, const std::string &text) {
  ZipEntry entry = deflated_entry(name, text);
  entry.method = kZipStored;
  entry.data = text;
  entry.packed_size = text.size();
  return entry;
}

std::string zip_bytes(const std::vector<ZipEntry> &entries, long announced) {
  Directory made = put_entries(entries);
  put_end(&made.archive, announced < 0 ? entries.size() : static_cast<std::uint64_t>(announced),
          made.size, made.at);
  return made.archive;
}

std::string zip64_bytes(const std::vector<ZipEntry> &entries) {
  Directory made = put_entries(entries);
  const std::size_t record = made.archive.size();
  put(&made.archive, kZip64EndRecord, 4);
  put(&made.archive, 44, 8);  // bytes that follow
  put(&made.archive, kZip64Version, 2);
  put(&made.archive, kZip64Version, 2);
  put(&made.archive, 0, 8);  // disks
  put(&made.archive, entries.size(), 8);
  put(&made.archive, entries.size(), 8);
  put(&made.archive, made.size, 8);
  put(&made.archive, made.at, 8);
  put(&made.archive, kZip64Locator, 4);
  put(&made.archive, 0, 4);  // disk
  put(&made.archive, record, 8);
  put(&made.archive, 1, 4);  // disks
  put_end(&made.archive, 0xffff, kInZip64, kInZip64);
  return made.archive;
}

std::vector<ZipEntry> parse_zip(const std::string &archive) {
  std::vector<ZipEntry> entries;
  if (archive.size() < kEndSize) {
    ADD_FAILURE() << "no archive";
    return entries;
  }
  const std::size_t end = archive.size() - kEndSize;
  EXPECT_EQ(get(archive, end, 4), kEndRecord) << "an archive has no comment";
  EXPECT_EQ(get(archive, end + 20, 2), 0U);
  const std::size_t count = get(archive, end + 10, 2);
  std::size_t at = get(archive, end + 16, 4);
  EXPECT_EQ(at + get(archive, end + 12, 4), end);
  for (std::size_t i = 0; i < count; ++i) {
    EXPECT_EQ(get(archive, at, 4), kCentralHeader);
    ZipEntry entry;
    entry.flags = static_cast<unsigned int>(get(archive, at + 8, 2));
    entry.method = static_cast<unsigned int>(get(archive, at + 10, 2));
    entry.date = static_cast<unsigned int>(get(archive, at + 12, 4));
    entry.crc = static_cast<std::uint32_t>(get(archive, at + 16, 4));
    entry.packed_size = get(archive, at + 20, 4);
    entry.size = get(archive, at + 24, 4);
    const std::size_t name_size = get(archive, at + 28, 2);
    entry.extra_size = static_cast<unsigned int>(get(archive, at + 30, 2));
    entry.comment_size = static_cast<unsigned int>(get(archive, at + 32, 2));
    entry.attributes = static_cast<std::uint32_t>(get(archive, at + 38, 4));
    entry.name = archive.substr(at + kCentralSize, name_size);
    const std::size_t local = get(archive, at + 42, 4);
    EXPECT_EQ(get(archive, local, 4), kLocalHeader) << entry.name;
    // version, flags, method, time, checksum, sizes and the name's length
    EXPECT_EQ(archive.substr(local + 4, 24), archive.substr(at + 6, 24)) << entry.name;
    EXPECT_EQ(archive.substr(local + kLocalSize, name_size), entry.name);
    const std::size_t local_extra = get(archive, local + 28, 2);
    EXPECT_EQ(local_extra, entry.extra_size) << entry.name;
    entry.data = archive.substr(local + kLocalSize + name_size + local_extra, entry.packed_size);
    at += kCentralSize + name_size + entry.extra_size + entry.comment_size;
    entries.push_back(entry);
  }
  return entries;
}
