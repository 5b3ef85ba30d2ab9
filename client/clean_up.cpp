#include "clean_up.h"

#include <glib-unix.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <utility>

#include "glib_handles.h"
#include "text.h"

namespace quarn_client {

namespace {

constexpr std::size_t kNamed = 8;

}  // namespace

std::optional<std::set<std::string>> read_kept_packages(GVariant *answer) {
  const GVariantPtr boxed(g_variant_get_child_value(answer, 0));
  const GVariantPtr texts(g_variant_get_variant(boxed.get()));
  if (g_variant_is_of_type(texts.get(), G_VARIANT_TYPE_STRING_ARRAY) == FALSE) return std::nullopt;
  std::set<std::string> kept;
  for (std::size_t i = 0; i < g_variant_n_children(texts.get()); ++i) {
    const GVariantPtr child(g_variant_get_child_value(texts.get(), i));
    kept.insert(g_variant_get_string(child.get(), nullptr));
  }
  return kept;
}

std::vector<std::string> packages_to_remove(const BackupSet &set,
                                            const std::set<std::string> &kept) {
  std::vector<std::string> removed;
  for (const SetPackage &package : set.packages) {
    if (kept.count(package.id) != 0) continue;
    if (std::find(removed.begin(), removed.end(), package.id) == removed.end()) {
      removed.push_back(package.id);
    }
  }
  return removed;
}

std::string packages_text(const std::vector<std::string> &packages) {
  std::string text;
  const std::size_t named = packages.size() > kNamed + 1 ? kNamed : packages.size();
  for (std::size_t i = 0; i < named; ++i) text += (i == 0 ? "" : ", ") + packages[i];
  if (named < packages.size()) text += " and " + std::to_string(packages.size() - named) + " more";
  return text;
}

Question::~Question() {
  if (source_ != 0) g_source_remove(source_);
}

bool Question::possible() { return isatty(STDIN_FILENO) != 0 && isatty(STDOUT_FILENO) != 0; }

void Question::ask(const std::string &text, Answered answered) {
  answered_ = std::move(answered);
  std::fputs(printable(text).c_str(), stdout);
  std::fflush(stdout);
  source_ = g_unix_fd_add(STDIN_FILENO, static_cast<GIOCondition>(G_IO_IN | G_IO_HUP | G_IO_ERR),
                          on_input, this);
}

gboolean Question::on_input(int fd, GIOCondition, gpointer user_data) {
  auto *self = static_cast<Question *>(user_data);
  char buffer[256];
  const ssize_t count = read(fd, buffer, sizeof buffer);
  if (count > 0) {
    self->line_.append(buffer, static_cast<std::size_t>(count));
    if (self->line_.find('\n') == std::string::npos) return G_SOURCE_CONTINUE;
  }
  self->source_ = 0;
  const std::string line = self->line_.substr(0, self->line_.find('\n'));
  self->answered_(line == "y" || line == "Y" || line == "yes");
  return G_SOURCE_REMOVE;
}

}  // namespace quarn_client
