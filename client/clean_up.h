/**
 * @file clean_up.h
 * @brief What a backup would remove from the cloud, and asking for it.
 */
#ifndef QUARN_CLIENT_CLEAN_UP_H
#define QUARN_CLIENT_CLEAN_UP_H

#include <gio/gio.h>

#include <functional>
#include <optional>
#include <set>
#include <string>
#include <vector>

#include "backup_sets.h"

namespace quarn_client {

/** Reads the answer "(v)" of the daemon; nothing when it holds no texts. */
std::optional<std::set<std::string>> read_kept_packages(GVariant *answer);

/** Packages of the set that are not among @p kept, once each, in the set's order. */
std::vector<std::string> packages_to_remove(const BackupSet &set,
                                            const std::set<std::string> &kept);

/** The packages in one line, the first few by name. */
std::string packages_text(const std::vector<std::string> &packages);

/** A question on the terminal that does not hold up the main loop. */
class Question {
 public:
  using Answered = std::function<void(bool yes)>;

  Question() = default;
  ~Question();
  Question(const Question &) = delete;
  Question &operator=(const Question &) = delete;

  /** Whether there is somebody to ask. */
  static bool possible();
  /** Shows the text and reads one line; only "y" and "yes" mean yes. */
  void ask(const std::string &text, Answered answered);

 private:
  static gboolean on_input(int fd, GIOCondition condition, gpointer user_data);

  Answered answered_;
  std::string line_;
  guint source_ = 0;
};

}  // namespace quarn_client

#endif
