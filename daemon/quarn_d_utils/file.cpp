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
#include <cstring>
#include <string>
#include <vector>

#include "files/safe_path.h"
#include "log_scope.h"
#include "quarn_common.h"
#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_crc.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/tree_place.h"
#include "quarn_d_utils/write_text.h"
#include "quarn_log.h"

namespace {

constexpr std::size_t kChecksumChunk = 65536;
constexpr std::size_t kCopyChunk = 102400;
constexpr std::size_t kKernelCopyChunk = 1U << 30;
constexpr mode_t kPrivateFile = 0600;
constexpr mode_t kDirectory = 0755;
constexpr int kReplaceAttempts = 16;

using Buffer = Handle<unsigned char, &std::free>;

Buffer make_buffer(std::size_t size) {
  return Buffer(static_cast<unsigned char *>(std::calloc(size, 1)));
}

/** Open a regular file for reading; never blocks on anything else. */
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

/** Looks through one directory of a search; the folders in it follow. */
bool search_folder(int dir, const std::string &path, std::vector<std::string> *folders) {
  bool found = false;
  std::vector<TreeEntry> entries;
  list_tree_entries(dir, &entries);
  for (TreeEntry &entry : entries) {
    const std::string below = path + "/" + entry.name;
    struct stat status = {};
    const int result = fstatat(dir, entry.name.c_str(), &status, AT_SYMLINK_NOFOLLOW);
    if (result != 0) {
      LOGE("error : lstat for %d %s", result, below.c_str());
    } else if (S_ISDIR(status.st_mode)) {
      folders->push_back(std::move(entry.name));
    } else if (S_ISREG(status.st_mode)) {
      found = true;
    } else {
      LOGE("this is unexpected type : %s", below.c_str());
    }
  }
  return found;
}

/** True when a regular file lies anywhere below the open directory, whose path is @p path. */
bool search_for_files(UniqueFd dir, std::string path) {
  const LogScope scope(path);
  TreePlace place(std::move(dir));
  std::vector<std::vector<std::string>> pending(1);
  bool found = search_folder(place.fd(), path, &pending.back());
  while (true) {
    if (pending.back().empty()) {
      pending.pop_back();
      if (pending.empty() || !place.up()) return found;
      path.resize(path.rfind('/'));
      continue;
    }
    const std::string name = std::move(pending.back().back());
    pending.back().pop_back();
    const std::string below = path + "/" + name;
    if (!place.down(name.c_str())) {
      LOGE("error : cannot open this path %s", below.c_str());
      continue;
    }
    path = below;
    pending.emplace_back();
    if (search_folder(place.fd(), path, &pending.back())) found = true;
  }
}

bool is_regular_at(int dir, const char *name) {
  struct stat status = {};
  return fstatat(dir, name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISREG(status.st_mode);
}

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

/** Empty a directory but for the entry whose full path is @p keep (null: nothing is kept). */
bool empty_directory(const char *path_text, const char *keep) {
  const LogScope scope(path_text);
  const DirPtr dir = safe_opendir(path_text);
  if (dir == nullptr) {
    LOGE("error : cannot open this path %s", path_text);
    return false;
  }
  bool emptied = true;
  std::string path = path_text;
  while (const dirent *entry = readdir(dir.get())) {
    if (is_dot_entry(entry->d_name)) continue;
    const PathStep step(&path, entry->d_name);
    if (keep != nullptr && path == keep) continue;
    struct stat status = {};
    const int result = fstatat(dirfd(dir.get()), entry->d_name, &status, AT_SYMLINK_NOFOLLOW);
    if (result != 0) {
      LOGE("error : lstat for %d %s", result, path.c_str());
    } else if (S_ISDIR(status.st_mode)) {
      if (!delete_tree_at(dirfd(dir.get()), entry->d_name, path)) {
        LOGE("fail to delete dir : %s", path.c_str());
        emptied = false;
      }
    } else if (S_ISREG(status.st_mode)) {
      if (!delete_file_at(dirfd(dir.get()), entry->d_name)) {
        LOGE("fail to delete file : %s", path.c_str());
        emptied = false;
      }
    } else {
      LOGE("this is unexpected type : %s", path.c_str());
    }
  }
  return emptied;
}

/** Give a nameless file its name, in place of a file or link that may lie there. */
bool link_into_place(int fd, int dir, const char *name) {
  const std::string source = "/proc/self/fd/" + std::to_string(fd);
  for (int attempt = 0; attempt < kReplaceAttempts; ++attempt) {
    if (unlinkat(dir, name, 0) != 0 && errno != ENOENT) return false;
    if (linkat(AT_FDCWD, source.c_str(), dir, name, AT_SYMLINK_FOLLOW) == 0) return true;
    if (errno != EEXIST) return false;
  }
  return false;
}

/** Create a file that was not there, in place of a file or link that may lie there. */
UniqueFd create_in_place(int dir, const char *name) {
  for (int attempt = 0; attempt < kReplaceAttempts; ++attempt) {
    if (unlinkat(dir, name, 0) != 0 && errno != ENOENT) return {};
    UniqueFd fd(
        openat(dir, name, O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, kPrivateFile));
    if (fd || errno != EEXIST) return fd;
  }
  return {};
}

/** Write the whole file under no name first, so that nobody ever sees a half of it. */
bool replace_content(const char *path, std::string_view data) {
  std::string name;
  const UniqueFd dir = safe_open_parent(path, &name);
  if (!dir) return false;
  const UniqueFd nameless(openat(dir.get(), ".", O_WRONLY | O_TMPFILE | O_CLOEXEC, kPrivateFile));
  if (nameless) {
    if (!write_all(nameless.get(), data.data(), data.size())) return false;
    if (link_into_place(nameless.get(), dir.get(), name.c_str())) return true;
  }
  // a file system without nameless files
  UniqueFd file = create_in_place(dir.get(), name.c_str());
  if (!file || !write_all(file.get(), data.data(), data.size())) return false;
  return close(file.release()) == 0;
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

}  // namespace

bool file_exist(const char *path) {
  struct stat status = {};
  return safe_lstat(path, &status) == 0 && S_ISREG(status.st_mode);
}

bool is_directory(const char *path) {
  struct stat status = {};
  return safe_lstat(path, &status) == 0 && S_ISDIR(status.st_mode);
}

bool file_exist_in_directory(const char *dir_path) {
  UniqueFd dir = safe_open(dir_path, O_RDONLY | O_DIRECTORY | O_NONBLOCK);
  if (!dir) {
    LOGE("error : cannot open this path %s", dir_path);
    return false;
  }
  return search_for_files(std::move(dir), dir_path);
}

bool is_empty_directory(const char *dir) { return !file_exist_in_directory(dir); }

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

bool delete_directory_util(const char *dir_path) {
  if (dir_path == nullptr) {
    LOGE("directory_path is NULL");
    return false;
  }
  std::string name;
  const UniqueFd parent = safe_open_parent(dir_path, &name);
  struct stat status = {};
  if (!parent || fstatat(parent.get(), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0 ||
      !S_ISDIR(status.st_mode)) {
    LOGE("directory_path is not directory");
    return false;
  }
  return delete_tree_at(parent.get(), name.c_str(), dir_path);
}

bool clear_directory(const char *dir, bool remove_directory) {
  if (!is_directory(dir)) return true;
  if (remove_directory) return delete_directory_util(dir);
  return empty_directory(dir, nullptr);
}

bool clear_shared_data_dir_except_temp_backup(const char *dir, const char *keep) {
  return empty_directory(dir, keep);
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
  const GString_ parent(g_path_get_dirname(file));
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

// By value, as the interface has it.
// NOLINTNEXTLINE(performance-unnecessary-value-param)
int write_string_to_file(std::string data, std::string path) {
  return write_text_to_file(data, path);
}

int write_text_to_file(std::string_view data, const std::string &path) {
  if (data.empty()) {
    LOGE("Invalid Data");
    return QUARN_BAD_ARGUMENT;
  }
  if (path.empty()) {
    LOGE("Invalid File Name");
    return QUARN_BAD_ARGUMENT;
  }
  create_directory_of_file(path.c_str());
  if (!replace_content(path.c_str(), data)) {
    LOGE("Writing to File %s Failed", path.c_str());
    return QUARN_REFUSED;
  }
  return QUARN_OK;
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
  if (copy_in_kernel(from.get(), to.get(), &copied)) {
    if (!copied) {
      LOGE("write error.");
      return false;
    }
  } else {
    char buffer[kCopyChunk];
    for (;;) {
      const ssize_t count = read_some(from.get(), buffer, sizeof(buffer));
      if (count < 0) {
        LOGE("read error.");
        return false;
      }
      if (count == 0) break;
      if (!write_all(to.get(), buffer, static_cast<std::size_t>(count))) {
        LOGE("write error.");
        return false;
      }
    }
  }
  if (close(to.release()) != 0) {
    LOGE("write error.");
    return false;
  }
  return true;
}
