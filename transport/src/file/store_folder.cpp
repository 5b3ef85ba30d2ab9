#include "file/store_folder.h"

#include <glib.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <optional>
#include <utility>

#include "core/remote_path.h"

namespace transport {
namespace {

constexpr mode_t kFolderMode = 0700;

// None for what is neither, which the store does not have.
std::optional<EntryKind> kind_of(int folder, const struct dirent &entry) {
  if (entry.d_type == DT_REG) return EntryKind::object;
  if (entry.d_type == DT_DIR) return EntryKind::folder;
  if (entry.d_type != DT_UNKNOWN) return std::nullopt;
  struct stat status {};
  if (fstatat(folder, entry.d_name, &status, AT_SYMLINK_NOFOLLOW) != 0) return std::nullopt;
  if (S_ISREG(status.st_mode)) return EntryKind::object;
  if (S_ISDIR(status.st_mode)) return EntryKind::folder;
  return std::nullopt;
}

bool is_dots(const char *name) {
  return std::strcmp(name, ".") == 0 || std::strcmp(name, "..") == 0;
}

}  // namespace

Directory open_directory(int fd) {
  UniqueFd own(openat(fd, ".", kFolderFlags));
  if (!own) return nullptr;
  Directory directory(fdopendir(own.get()));
  if (directory) own.release();
  return directory;
}

// Makes missing parents with the mode of the store's own folders.
UniqueFd open_root(const std::string &root, bool create) {
  UniqueFd fd(open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (fd || errno != ENOENT || !create) return fd;
  if (g_mkdir_with_parents(root.c_str(), kFolderMode) != 0) return {};
  return UniqueFd(open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
}

bool for_each_entry(int folder,
                    const std::function<bool(const char *name, EntryKind kind)> &visit) {
  const Directory directory = open_directory(folder);
  if (!directory) return false;
  for (;;) {
    errno = 0;
    const struct dirent *entry = readdir(directory.get());
    if (entry == nullptr) return errno == 0;
    if (is_dots(entry->d_name) || is_temporary_name(entry->d_name)) continue;
    const std::optional<EntryKind> kind = kind_of(folder, *entry);
    if (kind && !visit(static_cast<const char *>(entry->d_name), *kind)) return true;
  }
}

bool holds_object(int parent, const char *name) {
  const UniqueFd folder(openat(parent, name, kFolderFlags));
  if (!folder) return false;
  bool found = false;
  const bool read = for_each_entry(folder.get(), [&](const char *child, EntryKind kind) {
    found = kind == EntryKind::object || holds_object(folder.get(), child);
    return !found;
  });
  return read && found;
}

void remove_tree(int parent, const char *name) {
  if (unlinkat(parent, name, 0) == 0) return;
  {
    const UniqueFd folder(openat(parent, name, kFolderFlags));
    if (!folder) return;
    const Directory directory = open_directory(folder.get());
    if (!directory) return;
    while (const struct dirent *entry = readdir(directory.get())) {
      if (!is_dots(entry->d_name)) remove_tree(folder.get(), entry->d_name);
    }
  }
  unlinkat(parent, name, AT_REMOVEDIR);
}

FolderChain::FolderChain(int root) { folders_.push_back({"", UniqueFd(dup(root))}); }

bool FolderChain::enter(const std::vector<std::string> &components, std::size_t count,
                        bool create) {
  for (std::size_t i = 0; i < count; ++i) {
    const std::string &name = components[i];
    UniqueFd next(openat(innermost(), name.c_str(), kFolderFlags));
    if (!next && errno == ENOENT && create) {
      if (mkdirat(innermost(), name.c_str(), kFolderMode) != 0 && errno != EEXIST) return false;
      next.reset(openat(innermost(), name.c_str(), kFolderFlags));
      if (first_new_ == 0) first_new_ = folders_.size();
    }
    if (!next) return false;
    folders_.push_back({name, std::move(next)});
  }
  return true;
}

void FolderChain::prune() {
  while (folders_.size() > 1) {
    const std::string name = std::move(folders_.back().name);
    folders_.pop_back();
    if (unlinkat(innermost(), name.c_str(), AT_REMOVEDIR) != 0) return;
  }
}

void FolderChain::sync() {
  const std::size_t oldest = first_new_ == 0 ? folders_.size() : first_new_;
  for (std::size_t i = folders_.size(); i >= oldest && i > 0; --i) fsync(folders_[i - 1].fd.get());
}

}  // namespace transport
