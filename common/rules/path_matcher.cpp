#include "rules/path_matcher.h"

#include <cstring>

bool is_child_file(const char *parent, const char *path) {
  const std::size_t length = std::strlen(parent);
  return length > 0 && parent[length - 1] == '/' && std::strncmp(parent, path, length) == 0;
}

void RuleIndex::forget() {
  rules_.clear();
  first_ = nullptr;
  count_ = 0;
}

bool RuleIndex::names(std::string_view path) {
  follow();
  if (rules_.empty()) return false;
  if (rules_.count(path) != 0) return true;
  for (std::size_t i = 0; i < path.size(); ++i) {
    if (path[i] == '/' && rules_.count(path.substr(0, i + 1)) != 0) return true;
  }
  return false;
}

void RuleIndex::follow() {
  if (list_->empty()) return forget();
  if (list_->data() == first_ && list_->size() == count_) return;
  rules_.clear();
  rules_.insert(list_->begin(), list_->end());
  first_ = list_->data();
  count_ = list_->size();
}
