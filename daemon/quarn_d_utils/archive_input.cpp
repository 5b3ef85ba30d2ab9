#include "quarn_d_utils/archive_input.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>

#include "files/safe_path.h"

zlib_filefunc64_def ArchiveInput::functions() {
  zlib_filefunc64_def table = {};
  table.zopen64_file = [](voidpf self, const void *, int) { return self; };
  table.zread_file = [](voidpf, voidpf self, void *data, uLong size) -> uLong {
    return of(self)->read(static_cast<unsigned char *>(data), size);
  };
  table.zwrite_file = [](voidpf, voidpf, const void *, uLong) -> uLong { return 0; };
  table.ztell64_file = [](voidpf, voidpf self) -> ZPOS64_T { return of(self)->position_; };
  table.zseek64_file = [](voidpf, voidpf self, ZPOS64_T offset, int origin) -> long {
    ArchiveInput *file = of(self);
    file->position_ = offset + (origin == ZLIB_FILEFUNC_SEEK_CUR   ? file->position_
                                : origin == ZLIB_FILEFUNC_SEEK_END ? file->size_
                                                                   : 0);
    return 0;
  };
  table.zclose_file = [](voidpf, voidpf) -> int { return 0; };
  table.zerror_file = [](voidpf, voidpf self) -> int { return of(self)->failed_ ? 1 : 0; };
  table.opaque = this;
  return table;
}

long ArchiveInput::read_at(std::uint64_t offset, unsigned char *data, std::size_t size) {
  for (Piece &piece : pieces_) {
    if (offset - piece.start < piece.size) return copy(&piece, offset, data, size);
  }
  if (size >= kPiece) return fetch(offset, data, size);
  Piece &piece = pieces_[last_used_ == &pieces_[0] ? 1 : 0];
  piece.size = 0;
  // from a whole multiple on: minizip looks for the end record step by step backwards
  piece.start = offset - offset % kPiece;
  const long count = fetch(piece.start, piece.data, kPiece);
  if (count < 0) return count;
  piece.size = static_cast<std::size_t>(count);
  return offset - piece.start < piece.size ? copy(&piece, offset, data, size) : 0;
}

std::size_t ArchiveInput::read(unsigned char *data, std::size_t size) {
  std::size_t done = 0;
  while (done < size) {
    const long count = read_at(position_, data + done, size - done);
    if (count <= 0) break;
    done += static_cast<std::size_t>(count);
    position_ += static_cast<std::uint64_t>(count);
  }
  return done;
}

long ArchiveInput::copy(Piece *piece, std::uint64_t offset, unsigned char *data, std::size_t size) {
  last_used_ = piece;
  const auto at = static_cast<std::size_t>(offset - piece->start);
  const std::size_t count = std::min(size, piece->size - at);
  std::memcpy(data, piece->data + at, count);
  return static_cast<long>(count);
}

long ArchiveInput::fetch(std::uint64_t offset, unsigned char *data, std::size_t size) {
  if (offset >= size_) return 0;
  const ssize_t count =
      TEMP_FAILURE_RETRY(pread(fd_.get(), data, size, static_cast<off_t>(offset)));
  if (count < 0) failed_ = true;
  return count;
}

OpenArchive open_archive(const char *zip_path) {
  UniqueFd fd = safe_open(zip_path, O_RDONLY | O_NONBLOCK);
  struct stat status {};
  if (!fd || fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) return {};
  OpenArchive archive;
  archive.file =
      std::make_unique<ArchiveInput>(std::move(fd), static_cast<std::uint64_t>(status.st_size));
  zlib_filefunc64_def functions = archive.file->functions();
  archive.handle.reset(unzOpen2_64(zip_path, &functions));
  return archive;
}
