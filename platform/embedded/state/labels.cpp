#include "state/labels.h"

#include <fcntl.h>
#include <limits.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "state/packages.h"
#include "state/state_file.h"

namespace embedded {
namespace {

constexpr char kOwnDescriptors[] = "/proc/self/fd/";

struct Attribute {
  const char *kernel;
  const char *user;
};

Attribute attribute_of(LabelKind kind) {
  switch (kind) {
    case LabelKind::kExec:
      return {"security.SMACK64EXEC", "user.quarn.SMACK64EXEC"};
    case LabelKind::kMmap:
      return {"security.SMACK64MMAP", "user.quarn.SMACK64MMAP"};
    case LabelKind::kAccess:
      break;
  }
  return {"security.SMACK64", "user.quarn.SMACK64"};
}

/** The descriptor of this process that @p path is the name of in /proc, or negative. */
int descriptor_of(const char *path) {
  const std::size_t start = std::strlen(kOwnDescriptors);
  if (std::strncmp(path, kOwnDescriptors, start) != 0) return -1;
  char *end = nullptr;
  const long fd = std::strtol(path + start, &end, 10);
  return end == path + start || *end != '\0' ? -1 : static_cast<int>(fd);
}

/** A call on what is open is spared the walk to it; an O_PATH descriptor does not allow one. */
template <typename Call, typename ByPath>
ssize_t by_descriptor(const char *path, Call call, ByPath by_path) {
  const int fd = descriptor_of(path);
  const ssize_t result = fd < 0 ? -1 : call(fd);
  return fd < 0 || (result < 0 && errno == EBADF) ? by_path() : result;
}

int read_attribute(const char *path, Links links, const char *name, std::string *label) {
  char value[kMaxLabel + 1];
  const ssize_t length =
      links == Links::kFollow
          ? by_descriptor(
                path, [&](int fd) { return fgetxattr(fd, name, value, sizeof value); },
                [&] { return getxattr(path, name, value, sizeof value); })
          : lgetxattr(path, name, value, sizeof value);
  if (length < 0) return -1;
  label->assign(value, static_cast<size_t>(length));
  label->resize(std::min(label->find('\0'), label->size()));
  return 0;
}

int write_attribute(const char *path, Links links, const char *name, const std::string &label) {
  if (links == Links::kKeep) return lsetxattr(path, name, label.data(), label.size(), 0);
  return static_cast<int>(by_descriptor(
      path, [&](int fd) { return fsetxattr(fd, name, label.data(), label.size(), 0); },
      [&] { return setxattr(path, name, label.data(), label.size(), 0); }));
}

/** Which of the two an object may have. */
struct Present {
  bool kernel = true;
  bool user = true;
};

/** False once an object had no label of the kernel's: of the next ones it is asked first. */
std::atomic<bool> expect_kernel_label{true};

bool lists(const char *names, ssize_t size, const char *name) {
  for (const char *at = names; at < names + size; at += std::strlen(at) + 1) {
    if (std::strcmp(at, name) == 0) return true;
  }
  return false;
}

/** One call tells what several that fail would: objects of a device are labelled alike. */
Present attributes_present(const char *path, Links links, const Attribute &attribute) {
  char names[512];
  const ssize_t size = links == Links::kFollow
                           ? by_descriptor(
                                 path, [&](int fd) { return flistxattr(fd, names, sizeof names); },
                                 [&] { return listxattr(path, names, sizeof names); })
                           : llistxattr(path, names, sizeof names);
  if (size < 0) return {};
  return {lists(names, size, attribute.kernel), lists(names, size, attribute.user)};
}

/** An attribute that nothing has: taking it away tells who may write its like. */
constexpr char kProbe[] = "security.quarn.probe";

/** The package below whose root a place lies, empty where it is none's. */
std::string package_around(const std::string &place) {
  const std::string apps = package_root("");
  for (const std::string &top : {apps, current_device() + "/root" + apps}) {
    if (place.compare(0, top.size(), top) != 0) continue;
    const std::size_t end = place.find('/', top.size());
    if (end != std::string::npos) return place.substr(top.size(), end - top.size());
  }
  return "";
}

/** Where an object lies, whichever way @p path leads to it, and what it is. */
bool find_object(const char *path, Links links, std::string *place, struct stat *status) {
  const int given = links == Links::kFollow ? descriptor_of(path) : -1;
  const int fd = given >= 0
                     ? given
                     : open(path, O_PATH | O_CLOEXEC | (links == Links::kFollow ? 0 : O_NOFOLLOW));
  if (fd < 0) return false;
  char name[PATH_MAX];
  const ssize_t length =
      readlink((kOwnDescriptors + std::to_string(fd)).c_str(), name, sizeof name);
  const bool found = length > 0 && fstat(fd, status) == 0;
  if (given < 0) close(fd);
  if (found) place->assign(name, static_cast<std::size_t>(length));
  return found;
}

/** What an object without the attribute is labelled with: with labels, its maker's. */
std::string label_without_attribute(const char *path, Links links) {
  std::string place;
  struct stat status {};
  if (!find_object(path, links, &place, &status)) return kFloorLabel;
  const std::string package = package_around(place);
  if (!is_label(package)) return kFloorLabel;
  if (S_ISREG(status.st_mode) || S_ISDIR(status.st_mode)) return package;
  // Where labels are user attributes, links and special files cannot have one.
  const int removed =
      links == Links::kFollow ? removexattr(path, kProbe) : lremovexattr(path, kProbe);
  return removed != 0 && errno == EPERM ? kFloorLabel : package;
}

bool has_no_attribute() { return errno == ENODATA || errno == ENOTSUP || errno == EPERM; }

}  // namespace

bool is_label(const std::string &label) {
  return !label.empty() && label.size() <= kMaxLabel && label.front() != '-' &&
         std::all_of(label.begin(), label.end(), [](char c) {
           return c > ' ' && c <= '~' && c != '/' && c != '"' && c != '\'' && c != '\\';
         });
}

int read_label(const char *path, Links links, LabelKind kind, std::string *label) {
  const Attribute attribute = attribute_of(kind);
  const Present present =
      expect_kernel_label ? Present{} : attributes_present(path, links, attribute);
  const bool found = present.kernel && read_attribute(path, links, attribute.kernel, label) == 0;
  if (!found && present.kernel && !has_no_attribute()) return -1;
  expect_kernel_label = found;
  if (found) return 0;
  if (present.user) {
    if (read_attribute(path, links, attribute.user, label) == 0) return 0;
    if (!has_no_attribute()) return -1;
  }
  if (kind != LabelKind::kAccess) {
    errno = ENODATA;
    return -1;
  }
  *label = label_without_attribute(path, links);
  return 0;
}

int write_label(const char *path, Links links, LabelKind kind, const std::string &label) {
  if (!is_label(label)) {
    errno = EINVAL;
    return -1;
  }
  const Attribute attribute = attribute_of(kind);
  if (write_attribute(path, links, attribute.kernel, label) == 0) return 0;
  if (errno != EPERM && errno != ENOTSUP) return -1;

  std::string present;
  if (read_attribute(path, links, attribute.kernel, &present) == 0) {
    // A label that the kernel guards would hide the one written beside it.
    if (present == label) return 0;
    errno = EPERM;
    return -1;
  }
  if (write_attribute(path, links, attribute.user, label) == 0) return 0;
  // What cannot have the attribute has the floor label, and may be given that one.
  if (errno == EPERM && kind == LabelKind::kAccess && label == kFloorLabel) return 0;
  return -1;
}

}  // namespace embedded
