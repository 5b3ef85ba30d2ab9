/**
 * @file packing.h
 * @brief What the archive that a thread is making has taken, and what it may take.
 */
#ifndef QUARN_D_UTILS_PACKING_H
#define QUARN_D_UTILS_PACKING_H

#include <atomic>
#include <cstdint>
#include <string>
#include <vector>

#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/file_info_table.h"
#include "quarn_d_utils/handles.h"

class ArchiveOutput;

/** The archive that a thread is making. */
class Packing {
 public:
  Packing(ArchiveOutput *file, const char *zip_path, const archive_bounds &bounds,
          const std::atomic<bool> *stop)
      : path(zip_path), file_(file), bounds_(bounds), stop_(stop) {}

  /** Where it lies: one that is made among the data it takes in must not take in itself. */
  const std::string path;
  std::vector<UniqueFd> data_dirs; /**< those that were walked */

  ArchiveOutput *file() const { return file_; }
  bool stopped() const { return stop_ != nullptr && *stop_; }
  bool ended() const { return stopped() || excess_.bound != archive_bound::none; }
  const archive_excess &excess() const { return excess_; }

  /** Whether a file of @p size, a link or a directory, with this name, lies within the bounds. */
  [[nodiscard]] bool admit(const file_info_table_h &table, std::uint64_t size, std::uint64_t name) {
    content_ += size;
    return check(archive_bound::content, content_, bounds_.content) &&
           check(archive_bound::members, table.members + 1, bounds_.members) &&
           check(archive_bound::names, table.names + name, bounds_.names);
  }
  /** Whether the table with everything that was added does. */
  [[nodiscard]] bool admit(const file_info_table_h &table) {
    return check(archive_bound::table, table.text, bounds_.table);
  }
  /** Whether a directory at @p depth is too deep for this archive to be of use. */
  [[nodiscard]] bool refuses_depth(int depth) {
    if (bounds_.members == kNoBounds.members) return false;
    return !check(archive_bound::depth, static_cast<std::uint64_t>(depth), kMaxDirDepth);
  }

 private:
  bool check(archive_bound bound, std::uint64_t size, std::uint64_t limit) {
    if (size <= limit) return true;
    if (excess_.bound == archive_bound::none) excess_ = {bound, size, limit};
    return false;
  }

  ArchiveOutput *file_;
  const archive_bounds bounds_;
  const std::atomic<bool> *stop_;
  std::uint64_t content_ = 0;
  archive_excess excess_;
};

/** The calling thread's; null where single entries are written into an archive of somebody's. */
extern thread_local Packing *packing;

/** Whether nothing more is taken. */
[[nodiscard]] inline bool packing_ended() { return packing != nullptr && packing->ended(); }

#endif
