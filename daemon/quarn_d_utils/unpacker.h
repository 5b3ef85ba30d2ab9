/**
 * @file unpacker.h
 * @brief Writing the files of one archive below one root.
 */
#ifndef QUARN_D_UTILS_UNPACKER_H
#define QUARN_D_UTILS_UNPACKER_H

#include <sys/stat.h>
#include <unzip.h>

#include <memory>
#include <string>

#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/working_files.h"

/** What became of an entry. */
enum class Extracted {
  kDone,
  kFolder,  /**< it names one, which counts nowhere */
  kRefused, /**< hostile: nothing of it was written */
  kFailed   /**< corrupt, or not to be written; a part may lie there */
};

/**
 * Puts the entries of one archive below one root. While it lives the thread acts as the package's
 * user, to whom all but the table belongs from the beginning. Failures are logged. Lives and dies
 * on one thread.
 */
class Unpacker {
 public:
  /** @param destination an absolute path, the package's root as a rule */
  Unpacker(const char *pkg_id, const char *destination);

  /** Write one entry, whose bytes @p source gives as they lie in the archive. */
  [[nodiscard]] Extracted extract(ByteSource *source, const unz_file_info64 &info,
                                  const char *name);

 private:
  void make_folder(const char *name, const unz_file_info64 &info);
  const char *refusal(const char *name, const unz_file_info64 &info) const;
  const char *name_refusal(const std::string &path) const;
  int open_parent(const std::string &folder);
  bool is_link(int dir, const std::string &name) const;
  UniqueFd create(int parent, const std::string &path, std::size_t name_at);
  UniqueFd create_named(int parent, const char *name, mode_t mode, const package_user &owner);
  Extracted write(ByteSource *source, const unz_file_info64 &info, UniqueFd *file,
                  const std::string &path);

  std::string destination_;
  WorkingFiles working_;
  std::string table_;
  UniqueFd root_;
  package_user user_;
  ActAsPackage acting_;
  UniqueFd parent_;
  std::string parent_name_;
  bool expect_taken_ = false;  // files lie where the entries go
  std::unique_ptr<Codec> codec_;
};

#endif
