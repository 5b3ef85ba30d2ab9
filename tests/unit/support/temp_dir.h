/**
 * @file temp_dir.h
 * @brief A fresh directory for one test.
 */
#ifndef TEMP_DIR_H
#define TEMP_DIR_H

#include <string>

#include "test_files.h"

/** Where thousands of files are made soonest: memory, when there is enough of it. */
std::string quick_directory();

/** Made on construction, removed with everything in it on destruction. */
class TempDir {
 public:
  /** Where temporary files go here, see TMPDIR. */
  TempDir();
  explicit TempDir(const std::string &above);
  ~TempDir();
  TempDir(const TempDir &) = delete;
  TempDir &operator=(const TempDir &) = delete;

  const std::string &path() const { return path_; }
  std::string operator/(const std::string &name) const { return path_ + "/" + name; }

  /** Write a file, with its directories. @return its path */
  std::string file(const std::string &name, const std::string &content) const;
  std::string dir(const std::string &name) const;
  std::string link(const std::string &name, const std::string &target) const;

 private:
  std::string path_;
};

#endif
