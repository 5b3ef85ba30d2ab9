#include "quarn_d_utils/archive_output.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <string>

#include "quarn_d_utils/package_identity.h"

namespace {

// of the format's end records
constexpr std::uint64_t kNotInEnd = 0xffff;
constexpr std::size_t kEndSize = 22;
constexpr std::size_t kEndDirectorySize = 12;
constexpr std::size_t kEndDirectory = 16;
constexpr std::uint32_t kZip64EndRecord = 0x06064b50;
constexpr std::uint32_t kZip64Locator = 0x07064b50;
constexpr std::uint64_t kZip64EndSize = 44;
constexpr std::uint64_t kZip64Version = 45;

void put(std::string *bytes, std::uint64_t value, int count) {
  for (int i = 0; i < count; ++i) *bytes += static_cast<char>(value >> (8 * i));
}

std::uint32_t number(const char *bytes) {
  std::uint32_t value = 0;
  for (int i = 3; i >= 0; --i) value = value << 8 | static_cast<unsigned char>(bytes[i]);
  return value;
}

}  // namespace

zlib_filefunc64_def ArchiveOutput::functions() {
  zlib_filefunc64_def table = {};
  table.zopen64_file = [](voidpf self, const void *, int) { return self; };
  table.zread_file = [](voidpf, voidpf, void *, uLong) -> uLong { return 0; };
  table.zwrite_file = [](voidpf, voidpf self, const void *data, uLong size) -> uLong {
    return of(self)->write(static_cast<const char *>(data), size) ? size : 0;
  };
  table.ztell64_file = [](voidpf, voidpf self) -> ZPOS64_T { return of(self)->position_; };
  table.zseek64_file = [](voidpf, voidpf self, ZPOS64_T offset, int origin) -> long {
    return of(self)->seek(offset, origin);
  };
  table.zclose_file = [](voidpf, voidpf self) -> int { return of(self)->finish() ? 0 : EOF; };
  table.zerror_file = [](voidpf, voidpf self) -> int { return of(self)->failed_ ? 1 : 0; };
  table.opaque = this;
  return table;
}

bool ArchiveOutput::write(const char *data, std::size_t size) {
  if (failed_) return false;
  while (size > 0) {
    std::size_t taken = 0;
    if (position_ < start_) {
      // behind what is in memory already: a header patch far back
      taken = static_cast<std::size_t>(std::min<ZPOS64_T>(size, start_ - position_));
      if (!write_at(data, taken, position_)) return false;
    } else {
      const std::size_t at = static_cast<std::size_t>(position_ - start_);
      if (at >= kBuffer) {
        if (!flush()) return false;
        continue;
      }
      taken = std::min(size, kBuffer - at);
      std::memcpy(buffer_.get() + at, data, taken);
      filled_ = std::max(filled_, at + taken);
    }
    position_ += taken;
    data += taken;
    size -= taken;
  }
  return true;
}

long ArchiveOutput::seek(ZPOS64_T offset, int origin) {
  const ZPOS64_T end = start_ + filled_;
  const ZPOS64_T base = origin == ZLIB_FILEFUNC_SEEK_SET   ? 0
                        : origin == ZLIB_FILEFUNC_SEEK_CUR ? position_
                                                           : end;
  if (base + offset > end) return -1;
  position_ = base + offset;
  return 0;
}

bool ArchiveOutput::flush() {
  if (!write_at(buffer_.get(), filled_, start_)) return false;
  start_ += filled_;
  filled_ = 0;
  return true;
}

bool ArchiveOutput::finish() {
  const bool written = flush() && (entries_ < kNotInEnd || add_zip64_end());
  // some file systems tell only here that there was no room
  return close(fcntl(fd_, F_DUPFD_CLOEXEC, 0)) == 0 && written;
}

/**
 * minizip counts no more than 65,534 entries unless the archive is larger than 4 GiB, and other
 * programs then look for as many as its end record tells. What has to stand before that is added.
 */
bool ArchiveOutput::add_zip64_end() {
  char end[kEndSize];
  if (start_ < sizeof end) return false;
  const ZPOS64_T at = start_ - sizeof end;
  const ssize_t count = TEMP_FAILURE_RETRY(pread(fd_, end, sizeof end, static_cast<off_t>(at)));
  if (count != static_cast<ssize_t>(sizeof end)) return false;
  const std::uint64_t directory_size = number(end + kEndDirectorySize);
  const std::uint64_t directory = number(end + kEndDirectory);
  if (directory == UINT32_MAX) return true;  // it is there already
  std::string record;
  put(&record, kZip64EndRecord, 4);
  put(&record, kZip64EndSize, 8);
  put(&record, kZip64Version, 2);
  put(&record, kZip64Version, 2);
  put(&record, 0, 8);  // disks
  put(&record, entries_, 8);
  put(&record, entries_, 8);
  put(&record, directory_size, 8);
  put(&record, directory, 8);
  put(&record, kZip64Locator, 4);
  put(&record, 0, 4);  // disk
  put(&record, at, 8);
  put(&record, 1, 4);  // disks
  record.append(end, sizeof end);
  return write_at(record.data(), record.size(), at);
}

bool ArchiveOutput::write_at(const char *data, std::size_t size, ZPOS64_T offset) {
  // the archive is the daemon's own, and so is the room that it takes
  const ActAsRoot root;
  while (size > 0) {
    const ssize_t count = TEMP_FAILURE_RETRY(pwrite(fd_, data, size, static_cast<off_t>(offset)));
    if (count <= 0) {
      failed_ = true;
      return false;
    }
    data += count;
    offset += static_cast<ZPOS64_T>(count);
    size -= static_cast<std::size_t>(count);
  }
  return true;
}
