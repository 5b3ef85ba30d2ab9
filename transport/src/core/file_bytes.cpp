#include "core/file_bytes.h"

#include <unistd.h>

#include <cerrno>

namespace transport {

ssize_t read_at(int fd, char *buffer, std::size_t size, off_t offset) {
  ssize_t got = 0;
  do {
    got = pread(fd, buffer, size, offset);
  } while (got < 0 && errno == EINTR);
  return got;
}

bool write_all(int fd, const char *data, std::size_t size) {
  while (size > 0) {
    const ssize_t written = write(fd, data, size);
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) return false;
    data += written;
    size -= static_cast<std::size_t>(written);
  }
  return true;
}

}  // namespace transport
