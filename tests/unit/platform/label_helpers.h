/**
 * @file label_helpers.h
 * @brief What the kernel lets this process do with labels.
 */
#ifndef LABEL_HELPERS_H
#define LABEL_HELPERS_H

#include <linux/capability.h>
#include <sys/syscall.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <string>

constexpr char kKernelAttribute[] = "security.SMACK64";
constexpr char kUserAttribute[] = "user.quarn.SMACK64";

/** Takes CAP_SYS_ADMIN from the calling thread while it lives. */
class WithoutSysAdmin {
 public:
  WithoutSysAdmin() {
    syscall(SYS_capget, &header_, before_);
    __user_cap_data_struct without[2] = {before_[0], before_[1]};
    without[0].effective &= ~(1U << static_cast<unsigned int>(CAP_SYS_ADMIN));
    syscall(SYS_capset, &header_, without);
  }
  ~WithoutSysAdmin() { syscall(SYS_capset, &header_, before_); }
  WithoutSysAdmin(const WithoutSysAdmin &) = delete;
  WithoutSysAdmin &operator=(const WithoutSysAdmin &) = delete;

 private:
  __user_cap_header_struct header_{_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct before_[2]{};
};

/** The attribute itself, without following a link; empty when there is none. */
inline std::string attribute_of(const std::string &path, const char *name) {
  char value[256];
  const ssize_t length = lgetxattr(path.c_str(), name, value, sizeof value);
  return length < 0 ? std::string() : std::string(value, static_cast<size_t>(length));
}

/** True where this process may write the kernel's own attribute: not in every container. */
inline bool may_write_kernel_labels(const std::string &scratch) {
  return lsetxattr(scratch.c_str(), kKernelAttribute, "x", 1, 0) == 0;
}

#endif
