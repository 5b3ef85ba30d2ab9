#include "quarn_d_restore/copy_bytes.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

namespace {

constexpr std::size_t kSmallFile = 64 << 10;

/** Copy the bytes from @p at on and before @p end. @return where the file or the copying ended */
off_t copy_piece(int from, int to, off_t at, off_t end) {
  while (at < end) {
    off_t in = at;
    off_t out = at;
    const ssize_t count =
        copy_file_range(from, &in, to, &out, static_cast<std::size_t>(end - at), 0);
    if (count <= 0) break;
    at += count;
  }
  char buffer[kSmallFile];
  while (at < end) {
    const auto wanted = static_cast<std::size_t>(std::min<off_t>(end - at, sizeof(buffer)));
    const ssize_t count = TEMP_FAILURE_RETRY(pread(from, buffer, wanted, at));
    if (count <= 0 || pwrite(to, buffer, static_cast<std::size_t>(count), at) != count) break;
    at += count;
  }
  return at;
}

/** Copy what is no hole: an application may have holes of any size, and a copy's take no room. */
bool copy_data(int from, int to, off_t at, off_t end) {
  while (at < end) {
    off_t data = lseek(from, at, SEEK_DATA);
    if (data < 0 && errno == ENXIO) return true;  // nothing but holes follows
    if (data < 0) data = at;                      // the file system does not tell
    off_t hole = lseek(from, data, SEEK_HOLE);
    if (hole <= data) hole = end;
    at = std::min(hole, end);
    struct stat now = {};
    if (data < at && copy_piece(from, to, data, at) < at &&
        (fstat(from, &now) != 0 || now.st_size >= at)) {
      return false;  // and the file has not become shorter
    }
  }
  return true;
}

}  // namespace

bool copy_bytes(int from, int to, off_t size) {
  struct stat now = {};
  off_t copied = 0;
  if (size <= static_cast<off_t>(kSmallFile)) {
    // small ones through memory, which costs less than a set-up
    char buffer[kSmallFile];
    const ssize_t count = read(from, buffer, sizeof(buffer));
    if (count < 0 || write(to, buffer, static_cast<std::size_t>(count)) != count) return false;
    if (count == size) return true;
    copied = count;
  }
  if (fstat(from, &now) != 0) return false;
  const off_t end = now.st_size;
  if (!copy_data(from, to, copied, end) || fstat(from, &now) != 0) return false;
  // its last hole, or what it has lost meanwhile
  return ftruncate(to, std::min(end, now.st_size)) == 0;
}
