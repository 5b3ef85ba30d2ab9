/**
 * @file staged_file.h
 * @brief A file that is nowhere until it is complete.
 */
#ifndef BACKUP_TRANSPORT_STAGED_FILE_H
#define BACKUP_TRANSPORT_STAGED_FILE_H

#include <string>

#include "unique_fd.h"

namespace transport {

/**
 * Has no name at all where the file system can do that, else a temporary one
 * (see make_temporary_name()) with a flock on the file while its writer lives,
 * so that another process can tell a leftover. Functions set errno.
 */
class StagedFile {
 public:
  StagedFile() = default;
  StagedFile(const StagedFile &) = delete;
  StagedFile &operator=(const StagedFile &) = delete;
  /** Unpublished content is given up. */
  ~StagedFile();

  /** Mode 0600, in @p folder, which must stay open as long as this object. */
  [[nodiscard]] bool create(int folder);

  int fd() const { return fd_.get(); }

  /** Give it the name @p name in @p target_folder of the same file system, over what has it. */
  [[nodiscard]] bool publish(int target_folder, const std::string &name);

  /** For tests: behave as on a file system without nameless files. */
  static void set_nameless_allowed(bool allowed);

 private:
  [[nodiscard]] bool link_as(int target_folder, const std::string &name) const;

  int folder_ = -1;
  std::string temporary_name_;  // empty while the file has no name
  UniqueFd fd_;
};

}  // namespace transport

#endif
