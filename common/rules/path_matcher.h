/**
 * @file path_matcher.h
 * @brief Which paths the rules of an application take.
 */
#ifndef QUARN_PATH_MATCHER_H
#define QUARN_PATH_MATCHER_H

#include <string>
#include <string_view>
#include <unordered_set>
#include <vector>

/** True when @p parent ends with "/" and @p path begins with it. */
[[nodiscard]] bool is_child_file(const char *parent, const char *path);

/**
 * The rules of one list by their text: an application may have thousands of
 * rules and of files, and each file is asked about. It follows its list, which
 * only grows until it is told to forget it. One thread.
 */
class RuleIndex {
 public:
  /** @param list borrowed for the index's life */
  explicit RuleIndex(const std::vector<std::string> *list) : list_(list) {}

  /** The list is being made anew, perhaps in the same place. */
  void forget();
  /** Whether a rule names @p path, or a folder (with its slash) that it lies in. */
  bool names(std::string_view path);

 private:
  void follow();

  const std::vector<std::string> *list_;
  const std::string *first_ = nullptr;
  std::size_t count_ = 0;
  std::unordered_set<std::string_view> rules_;
};

/**
 * Whether the file or link at @p path is backed up: what is excluded never is, and where anything
 * is included, that alone is.
 */
[[nodiscard]] inline bool rules_take(RuleIndex *included, RuleIndex *excluded, bool has_includes,
                                     std::string_view path) {
  if (excluded->names(path)) return false;
  return !has_includes || included->names(path);
}

#endif
