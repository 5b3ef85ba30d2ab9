/**
 * @file archive_input.h
 * @brief An archive that is read: its file, and the library's handle over it.
 */
#ifndef QUARN_D_UTILS_ARCHIVE_INPUT_H
#define QUARN_D_UTILS_ARCHIVE_INPUT_H

#include <unzip.h>

#include <cstddef>
#include <cstdint>
#include <memory>
#include <utility>

#include "quarn_d_utils/handles.h"

/**
 * The archive file under minizip. Two pieces of it are in memory: one of the entries and one of
 * the directory behind them, between which minizip goes to and fro. One thread's.
 */
class ArchiveInput {
 public:
  ArchiveInput(UniqueFd fd, std::uint64_t size) : fd_(std::move(fd)), size_(size) {}
  ArchiveInput(const ArchiveInput &) = delete;
  ArchiveInput &operator=(const ArchiveInput &) = delete;

  /** Bytes, as they were when it was opened. */
  std::uint64_t size() const { return size_; }

  /** The file for minizip, which never writes or closes it; valid as long as this. */
  zlib_filefunc64_def functions();

  /** At most @p size bytes from @p offset: 0 at the end, -1 on failure. */
  [[nodiscard]] long read_at(std::uint64_t offset, unsigned char *data, std::size_t size);

 private:
  static constexpr std::size_t kPiece = 64U << 10;
  struct Piece {
    std::uint64_t start = 0;
    std::size_t size = 0;
    unsigned char data[kPiece];
  };

  static ArchiveInput *of(voidpf self) { return static_cast<ArchiveInput *>(self); }
  std::size_t read(unsigned char *data, std::size_t size);
  long copy(Piece *piece, std::uint64_t offset, unsigned char *data, std::size_t size);
  long fetch(std::uint64_t offset, unsigned char *data, std::size_t size);

  UniqueFd fd_;
  std::uint64_t size_;
  std::uint64_t position_ = 0;
  bool failed_ = false;
  Piece *last_used_ = nullptr;
  Piece pieces_[2];
};

struct CloseArchive {
  void operator()(void *archive) const { unzClose(archive); }
};

struct OpenArchive {
  std::unique_ptr<ArchiveInput> file;
  std::unique_ptr<void, CloseArchive> handle;  // reads the file to its end
};

/** A regular file that the library takes for an archive; without a handle for anything else. */
[[nodiscard]] OpenArchive open_archive(const char *zip_path);

#endif
