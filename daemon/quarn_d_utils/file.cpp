#include "quarn_d_utils/file.h"

#include <fcntl.h>
#include <glib.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/statfs.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "files/safe_path.h"
#include "glib_handles.h"
#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/file_at.h"
#include "quarn_d_utils/file_bytes.h"
#include "quarn_d_utils/file_crc.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

namespace {

constexpr std::size_t kChecksumChunk = 65536;
constexpr std::size_t kCopyChunk = 102400;
constexpr std::size_t kKernelCopyChunk = 1U << 30;
constexpr mode_t kPrivateFile = 0600;
constexpr mode_t kDirectory = 0755;

using Buffer = Handle<unsigned char, &std::free>;

Buffer make_buffer(std::size_t size) {
  return Buffer(static_cast<unsigned char *>(std::calloc(size, 1)));
}

bool is_regular_at(int dir, const char *name) {
  struct stat status = {};
  return fstatat(dir, name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(status.st_mode);
}

/** Let the file system share or copy the blocks. @return false when it does not do that */
bool copy_in_kernel(int from, int to, bool *copied) {
  if (ioctl(to, FICLONE, from) == 0) {
    *copied = true;
    return true;
  }
  bool any = false;
  for (;;) {
    const ssize_t count = copy_file_range(from, nullptr, to, nullptr, kKernelCopyChunk, 0);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) {
      *copied = false;
      return any || errno == ENOSPC || errno == EIO || errno == EDQUOT;
    }
    if (count == 0) {
      *copied = any;
      return any;  // nothing at all: an empty file, or one that only read() can read
    }
    any = true;
  }
}

bool copy_by_hand(int from, int to) {
  char buffer[kCopyChunk];
  for (;;) {
    const ssize_t count = read_some(from, buffer, sizeof(buffer));
    if (count < 0) {
      LOGE("read error.");
      return false;
    }
    if (count == 0) return true;
    if (!write_all(to, buffer, static_cast<std::size_t>(count))) {
      LOGE("write error.");
      return false;
    }
  }
}

}  // namespace

bool delete_file_at(int dir, const char *name) {
  if (!is_regular_at(dir, name)) {
    LOGE("file is not exist");
    return false;
  }
  if (unlinkat(dir, name, 0) == -1) {
    LOGE("file was not deleted");
    return false;
  }
  if (is_regular_at(dir, name)) {
    LOGE("file is exist");
    return false;
  }
  return true;
}

bool file_exist(const char *path) {
  struct stat status = {};
  return safe_lstat(path, &status) == 0 && S_ISREG(status.st_mode);
}

bool is_directory(const char *path) {
  struct stat status = {};
  return safe_lstat(path, &status) == 0 && S_ISDIR(status.st_mode);
}

int get_file_size(const char *path) {
  if (!file_exist(path)) {
    LOGE("[%s] is not exist", path);
    return -1;
  }
  struct stat status = {};
  const int result = safe_lstat(path, &status);
  if (result != 0) {
    LOGE("lstat() was failed err : %d", result);
    return -1;
  }
  return static_cast<int>(std::min<off_t>(status.st_size, INT_MAX));
}

bool read_data_from_file(const char *path, char **buffer) {
  if (!file_exist(path)) {
    LOGE("[%s] is not exist", path);
    return false;
  }
  struct stat status = {};
  if (safe_lstat(path, &status) != 0) {
    LOGE("lstat() was failed");
    return false;
  }
  const auto size = static_cast<std::size_t>(status.st_size);
  CString data(static_cast<char *>(std::calloc(size + 1, 1)));
  if (data == nullptr) {
    LOGE("calloc() was failed, dataBuffer is NULL");
    return false;
  }
  const UniqueFd fd = open_regular(path, &status);
  if (!fd) {
    LOGE("fopen() was failed, fp is NULL");
    return false;
  }
  std::size_t done = 0;
  while (done < size) {
    const ssize_t count = read_some(fd.get(), data.get() + done, size - done);
    if (count < 0) {
      LOGE("fread() was failed, readFileSize < 0");
      return false;
    }
    if (count == 0) break;
    done += static_cast<std::size_t>(count);
  }
  *buffer = data.release();
  return true;
}

std::uint32_t get_file_crc(const char *path) {
  struct stat status = {};
  const UniqueFd fd = open_regular(path, &status);
  if (!fd) {
    LOGE("fopen() failed, file is NULL");
    return 0;
  }
  return get_open_file_crc(fd.get());
}

std::uint32_t get_open_file_crc(int fd) {
  const Buffer buffer = make_buffer(kChecksumChunk);
  if (buffer == nullptr) {
    LOGE("calloc() failed, buf is NULL");
    return 0;
  }
  std::uint32_t crc = 0;
  if (lseek(fd, 0, SEEK_SET) != 0) return crc;
  for (;;) {
    const ssize_t count = read_some(fd, buffer.get(), kChecksumChunk);
    if (count < 1) return crc;
    crc = codec_crc32(crc, buffer.get(), static_cast<std::size_t>(count));
  }
}

bool delete_file(const char *path) {
  if (path == nullptr) {
    LOGE("file_path is NULL");
    return false;
  }
  std::string name;
  const UniqueFd dir = safe_open_parent(path, &name);
  if (!dir) {
    LOGE("file is not exist");
    return false;
  }
  return delete_file_at(dir.get(), name.c_str());
}

std::uint64_t get_dir_available_size(const char *path) {
  const UniqueFd fd = safe_open(path, O_PATH);
  struct statfs status = {};
  if (!fd || fstatfs(fd.get(), &status) != 0) {
    LOGE("statfs error");
    return 0;
  }
  return static_cast<std::uint64_t>(status.f_bfree) * static_cast<std::uint64_t>(status.f_bsize);
}

bool create_directory_of_file(const char *file) {
  if (file == nullptr) {
    LOGE("file_name is NULL");
    return false;
  }
  const GText parent(g_path_get_dirname(file));
  if (parent == nullptr) {
    LOGE("g_path_get_dirname is fail");
    return false;
  }
  if (is_directory(parent.get())) return true;
  if (safe_mkdir_with_parents(parent.get(), kDirectory) == -1) {
    LOGE("directory create was failed, dir = [%s]", parent.get());
    return false;
  }
  if (!is_directory(parent.get())) {
    LOGE("directory create was failed, directory is not exist.");
    return false;
  }
  return true;
}

bool copy_file(const char *src, const char *dst) {
  if (src == nullptr || dst == nullptr) {
    LOGE("Invalid Parameter...");
    return false;
  }
  if (is_directory(src)) {
    LOGE("Requested source instance '%s' is not a file", src);
    return false;
  }
  if (!file_exist(src)) {
    LOGE("Requested source instance '%s' does not exist", src);
    return false;
  }
  if (file_exist(dst) && !delete_file(dst)) {
    LOGE("Requested dest instance '%s' exist, can not delete it", dst);
    return false;
  }
  struct stat status = {};
  const UniqueFd from = open_regular(src, &status);
  if (!from) {
    LOGE("file fSrc open error.");
    return false;
  }
  UniqueFd to = safe_open(dst, O_WRONLY | O_CREAT | O_EXCL, kPrivateFile);
  if (!to) {
    LOGE("file fDes open error.");
    return false;
  }
  bool copied = false;
  if (!copy_in_kernel(from.get(), to.get(), &copied)) {
    if (!copy_by_hand(from.get(), to.get())) return false;
  } else if (!copied) {
    LOGE("write error.");
    return false;
  }
  if (close(to.release()) != 0) {
    LOGE("write error.");
    return false;
  }
  return true;
}
