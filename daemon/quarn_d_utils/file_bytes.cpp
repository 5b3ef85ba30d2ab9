#include "quarn_d_utils/file_bytes.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include "files/safe_path.h"

UniqueFd open_regular(const char *path, struct stat *status) {
  UniqueFd fd = safe_open(path, O_RDONLY | O_NONBLOCK | O_NOCTTY);
  if (!fd || fstat(fd.get(), status) != 0 || !S_ISREG(status->st_mode)) return {};
  return fd;
}

ssize_t read_some(int fd, void *data, std::size_t size) {
  ssize_t count = 0;
  do {
    count = read(fd, data, size);
  } while (count < 0 && errno == EINTR);
  return count;
}

bool write_all(int fd, const void *data, std::size_t size) {
  const auto *at = static_cast<const char *>(data);
  while (size > 0) {
    const ssize_t count = write(fd, at, size);
    if (count < 0 && errno == EINTR) continue;
    if (count <= 0) return false;
    at += count;
    size -= static_cast<std::size_t>(count);
  }
  return true;
}
