/**
 * @file held_folder.h
 * @brief Working in the directory that was there at the beginning, whatever its path names later.
 *
 * A package can be removed, or installed anew, while its data is worked on, and
 * an application owns the folder that the daemon's own folders lie in. While a
 * HeldFolder lives, the functions of safe_path.h reach every path at and below
 * its own from the directory that it opened; nothing is found or made there
 * once that directory has gone, and nothing in another that has its path.
 */
#ifndef QUARN_HELD_FOLDER_H
#define QUARN_HELD_FOLDER_H

#include <string>
#include <utility>

#include "quarn_handles.h"

/**
 * One such directory, for the thread that made it and for as long as it lives. They
 * nest: the deepest that a path is below counts, and one of the same path is the
 * same directory, which the outer one keeps. Held across no fiber's wait.
 */
class HeldFolder {
 public:
  /** Open the directory at an absolute path. */
  explicit HeldFolder(std::string path);
  ~HeldFolder();
  HeldFolder(const HeldFolder &) = delete;
  HeldFolder &operator=(const HeldFolder &) = delete;

  /** False when there was none: nothing is found below its path then either. */
  explicit operator bool() const { return fd_ >= 0; }
  /** Its descriptor (O_PATH), borrowed; -1 for none. */
  int fd() const { return fd_; }
  /** True while its path still leads to it. */
  [[nodiscard]] bool is_in_place() const;

  /** The thread's deepest folder that @p path is at or below; null for none. */
  [[nodiscard]] static const HeldFolder *of(const char *path);
  /** What of @p path lies below this folder: "." for the folder itself. */
  [[nodiscard]] const char *below(const char *path) const;
  /** True for its own path. */
  [[nodiscard]] bool is_at(const char *path) const { return path_ == path; }
  /** Open what is held once more. */
  [[nodiscard]] UniqueFd reopen(int flags) const;

 protected:
  HeldFolder(std::string path, int flags);

 private:
  bool covers(const char *path) const;

  const std::string path_;
  UniqueFd opened_;
  int fd_;
  HeldFolder *outer_;
};

/** The same for one file. */
class HeldFile : public HeldFolder {
 public:
  explicit HeldFile(std::string path) : HeldFolder(std::move(path), 0) {}
};

#endif
