/**
 * @file local_file.h
 * @brief The files on the device that a transfer reads or writes.
 *
 * Local paths lie below the roots of applications. A symbolic link in one is
 * followed only when root owns both the link and the directory it lies in, and
 * nobody else may write that directory; any other link could be an
 * application's, put there to have the device's secrets sent or overwritten.
 */
#ifndef BACKUP_TRANSPORT_LOCAL_FILE_H
#define BACKUP_TRANSPORT_LOCAL_FILE_H

#include <sys/types.h>

#include <cstdint>
#include <ctime>
#include <memory>
#include <string>

#include "core/staged_file.h"
#include "unique_fd.h"

namespace transport {

/** The parent directory of @p path, reached safely; @p name receives the last component. */
[[nodiscard]] UniqueFd open_local_parent(const std::string &path, std::string *name);

/** An open regular file that is being sent. One thread at a time. */
class LocalSource {
 public:
  /** @return false with errno; ELOOP for a link, EINVAL for what is not a regular file */
  [[nodiscard]] bool open(const std::string &path);

  int fd() const { return fd_.get(); }
  uint64_t size() const { return static_cast<uint64_t>(size_); }

  /** Is the content the one that was there when it was opened? */
  [[nodiscard]] bool unchanged() const;

 private:
  UniqueFd fd_;
  off_t size_ = 0;
  timespec changed_ = {};
};

/** The file that a download becomes. One thread at a time. */
class LocalTarget {
 public:
  /** Find its directory, which must exist. @return false with errno */
  [[nodiscard]] bool open(const std::string &path);

  /** Most bytes that it may have; 0: any number. */
  void set_limit(uint64_t limit) { limit_ = limit; }
  uint64_t limit() const { return limit_ == 0 ? UINT64_MAX : limit_; }

  /** Start, or start over, with an empty file that nobody sees. @return false with errno */
  [[nodiscard]] bool begin();

  /** The file since begin(). */
  int fd() const { return staged_->fd(); }

  /** Have the content on the disk. @return false with errno */
  [[nodiscard]] bool sync() const;

  /** Make it the file at the path. @return false with errno */
  [[nodiscard]] bool publish();

  /** Give up what begin() started. */
  void discard() { staged_.reset(); }

 private:
  UniqueFd folder_;
  std::string name_;
  uint64_t limit_ = 0;
  std::unique_ptr<StagedFile> staged_;
};

}  // namespace transport

#endif
