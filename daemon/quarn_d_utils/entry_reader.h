/**
 * @file entry_reader.h
 * @brief The bytes of one entry of an archive, as they lie in it.
 */
#ifndef QUARN_D_UTILS_ENTRY_READER_H
#define QUARN_D_UTILS_ENTRY_READER_H

#include <unzip.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>

#include "quarn_d_utils/archive_input.h"
#include "quarn_d_utils/codec.h"

/** The raw bytes of the archive's current entry. */
class EntrySource : public ByteSource {
 public:
  EntrySource(ArchiveInput *file, unzFile archive, std::uint64_t size)
      : file_(file), offset_(unzGetCurrentFileZStreamPos64(archive)), left_(size) {}
  long read(unsigned char *data, std::size_t size, bool *end) override {
    const long count = file_->read_at(offset_, data, std::min<std::uint64_t>(size, left_));
    if (count < 0) return -1;
    offset_ += static_cast<std::uint64_t>(count);
    left_ -= static_cast<std::uint64_t>(count);
    *end = left_ == 0 || count == 0;
    return count;
  }

 private:
  ArchiveInput *file_;
  std::uint64_t offset_;
  std::uint64_t left_;
};

/** The same through minizip, which counts their checksum: for an archive that somebody else opened.
 */
class LibrarySource : public ByteSource {
 public:
  explicit LibrarySource(unzFile archive) : archive_(archive) {}
  long read(unsigned char *data, std::size_t size, bool *end) override {
    const int count = unzReadCurrentFile(archive_, data, static_cast<unsigned int>(size));
    *end = count <= 0;
    return count;
  }

 private:
  unzFile archive_;
};

/** Opens an entry so that the library gives its bytes as they lie there. */
inline constexpr int kRawEntry = 1;

/** What is wrong with an entry whatever its name is; null: nothing. */
[[nodiscard]] const char *form_refusal(const unz_file_info64 &info);

/** True for an entry whose bytes are those of its file. */
[[nodiscard]] bool is_stored(const unz_file_info64 &info);
/** What the codec does with the others: such an entry's bytes as they are. */
[[nodiscard]] CodecResult copy_stored(ByteSource *source, ByteSink *sink, CodecTotals *totals);

#endif
