#include "quarn_d_utils/write_text.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>

#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_bytes.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kPrivateFile = 0600;
constexpr int kReplaceAttempts = 16;

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

}  // namespace

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
  static_cast<void>(create_directory_of_file(path.c_str()));  // without it nothing can be written
  if (!replace_content(path.c_str(), data)) {
    LOGE("Writing to File %s Failed", path.c_str());
    return QUARN_REFUSED;
  }
  return QUARN_OK;
}
