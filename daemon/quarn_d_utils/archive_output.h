/**
 * @file archive_output.h
 * @brief The file of an archive that is being made, as the library that makes it writes it.
 */
#ifndef QUARN_D_UTILS_ARCHIVE_OUTPUT_H
#define QUARN_D_UTILS_ARCHIVE_OUTPUT_H

#include <zip.h>

#include <cstddef>
#include <cstdint>
#include <memory>

/**
 * The archive file under minizip. It keeps the last bytes in memory, because the sizes of an entry
 * are written into its header after its data: most of those patches then cost no system call.
 * Written as root, whoever packs. One thread's; a failure is told to the library.
 */
class ArchiveOutput {
 public:
  /** @param fd borrowed; negative for none */
  explicit ArchiveOutput(int fd) : fd_(fd) {}
  ArchiveOutput(const ArchiveOutput &) = delete;
  ArchiveOutput &operator=(const ArchiveOutput &) = delete;

  bool is_open() const { return fd_ >= 0; }

  /** One more entry was written. */
  void count_entry() { ++entries_; }

  /** Let the next header fit into memory. @return false when the file cannot be written */
  [[nodiscard]] bool make_room(std::size_t name) {
    return !failed_ && (filled_ + name + kHeaderRoom <= kBuffer || flush());
  }

  /** What the library calls; valid as long as this. */
  zlib_filefunc64_def functions();

 private:
  static constexpr std::size_t kBuffer = 128U << 10;
  static constexpr std::size_t kHeaderRoom = 8U << 10;  // its fields, and a path of usual length

  static ArchiveOutput *of(voidpf self) { return static_cast<ArchiveOutput *>(self); }
  bool write(const char *data, std::size_t size);
  long seek(ZPOS64_T offset, int origin);
  bool flush();
  bool finish();
  bool add_zip64_end();
  bool write_at(const char *data, std::size_t size, ZPOS64_T offset);

  const int fd_;
  const std::unique_ptr<char[]> buffer_{new char[kBuffer]};  // the file's bytes from start_ on
  std::size_t filled_ = 0;
  ZPOS64_T start_ = 0;     // bytes before it are in the file
  ZPOS64_T position_ = 0;  // where the next write goes
  bool failed_ = false;
  std::uint64_t entries_ = 0;
};

#endif
