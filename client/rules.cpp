#include "rules.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "files/tree_walk.h"
#include "quarn_common.h"
#include "quarn_handles.h"
#include "rules/path_matcher.h"
#include "rules/rules_file.h"

namespace {

bool exists(const std::string &path) {
  struct stat status {};
  return safe_lstat(path.c_str(), &status) == 0;
}

bool lies_there(const std::string &path, mode_t type) {
  struct stat status {};
  return safe_lstat(path.c_str(), &status) == 0 && (status.st_mode & S_IFMT) == type;
}

/** Why the daemon gets no document out of a file that is there. */
rule_problem unusable_file(const rules_report &report, const std::string &path) {
  if (!lies_there(path, S_IFREG)) {
    return {"unreadable", 0, report.file, "the rules file is no regular file: it is ignored"};
  }
  if (!safe_open(path.c_str(), O_RDONLY)) {
    return {"unreadable", 0, report.file, "the rules file cannot be read: it is ignored"};
  }
  return {"malformed", 0, report.file, "not readable as XML: the file is ignored"};
}

/** Why nothing of an application with such a file is backed up. */
rule_problem blocking_file(const rules_report &report, rules_state state) {
  const char *kind = state == rules_state::too_large  ? "too-large"
                     : state == rules_state::entities ? "entities"
                                                      : "no-library";
  return {kind, 0, report.file,
          std::string(rules_state_text(state)) + ": the application is not backed up"};
}

void read_element(rules_report *report, const rules_element &found) {
  if (!found.is_rule) {
    report->problems.push_back({"unknown-element", found.line, found.name,
                                "element \"" + found.name + "\" is not known and is ignored"});
    return;
  }
  if (!found.has_path) {
    report->problems.push_back({"no-path", found.line, found.name,
                                "element \"" + found.name + "\" has no attribute \"path\""});
  }
  rule_element element;
  element.include = found.include;
  element.has_path = found.has_path;
  element.given = found.given;
  element.path = found.path;
  element.line = found.line;
  report->elements.push_back(element);
}

// The daemon keeps what exists; a report also needs what it dropped, and line numbers.
void read_elements(rules_report *report) {
  const std::string path = report->root + "/" + report->file;
  const RulesFile file(path);
  if (file.state() != rules_state::loaded) {
    report->blocked = !rules_usable(file.state());
    report->ignored = !report->blocked;
    report->problems.push_back(report->blocked ? blocking_file(*report, file.state())
                                               : unusable_file(*report, path));
    return;
  }
  if (!file.has_rules()) {
    report->ignored = true;
    const std::string name = file.root_name() == nullptr ? "" : file.root_name();
    report->problems.push_back(
        {"root-element", file.root_line(), name,
         "the root element is \"" + name + "\", not \"backup\": the file is ignored"});
    return;
  }
  file.for_each(report->root,
                [report](const rules_element &found) { read_element(report, found); });
}

/** What the daemon would decide: by the rules that name something which is there. */
class Decision {
 public:
  explicit Decision(const rules_report &report) : included_(&include_), excluded_(&exclude_) {
    for (const rule_element &element : report.elements) {
      if (!element.has_path) continue;
      has_includes_ = has_includes_ || element.include;
      if (exists(element.path)) (element.include ? include_ : exclude_).push_back(element.path);
    }
  }
  Decision(const Decision &) = delete;
  Decision &operator=(const Decision &) = delete;
  bool takes(const std::string &path) {
    return rules_take(&included_, &excluded_, has_includes_, path);
  }

 private:
  std::vector<std::string> include_;
  std::vector<std::string> exclude_;
  bool has_includes_ = false;
  RuleIndex included_;
  RuleIndex excluded_;
};

// Which element decided: the first one of the daemon's order that covers the path.
int deciding_element(rules_report *report, const std::string &path, bool in) {
  int deciding = -1;
  for (std::size_t i = 0; i < report->elements.size(); ++i) {
    rule_element &element = report->elements[i];
    if (!element.has_path) continue;
    if (element.path != path && !is_child_file(element.path.c_str(), path.c_str())) continue;
    ++element.matches;
    if (in) ++element.kept;
    if (deciding < 0 && element.include == in) deciding = static_cast<int>(i);
  }
  return deciding;
}

std::string relative_to(const rules_report &report, const std::string &path) {
  return path.substr(report.root.size() + 1);
}

void note_unreadable(rules_report *report, const std::string &path) {
  report->problems.push_back({"unreadable", 0, relative_to(*report, path),
                              "the directory cannot be read: the application would be skipped"});
}

/** True for a part of a download, which an application cannot have made. */
bool is_transports(const char *name, const struct stat &status) {
  return is_part_name(name) && S_ISREG(status.st_mode) && status.st_uid == geteuid() &&
         status.st_nlink == 1;
}

/** A check on its way through the data: as the daemon's, and no deeper. */
class Check {
 public:
  using Entries = EntriesByName;

  Check(rules_report *report, const std::string &package_id)
      : report_(report), decision_(*report), files_(package_id, report->root) {}

  void run(bool installed) {
    for (const std::string &dir : files_.data_dirs()) walk_data(dir, installed);
  }

  static bool ended() { return false; }

  EntryVisit visit(int dir, const WalkEntry &entry, const std::string &path) {
    struct stat status {};
    if (files_.names(path) || fstatat(dir, entry.name, &status, AT_SYMLINK_NOFOLLOW) != 0 ||
        is_transports(entry.name, status)) {
      return EntryVisit::passed;
    }
    if (S_ISDIR(status.st_mode)) return EntryVisit::folder;
    note_entry(path, status);
    return EntryVisit::counted;
  }

  static DirPtr open(int dir, const char *name, struct stat * /*status*/) {
    return safe_opendir_at(dir, name);
  }

  /** Beyond its depth an application is skipped. */
  void missed(const std::string &path, int /*depth*/) { note_unreadable(report_, path); }

  static bool left(int /*dir*/, const struct stat & /*status*/, const std::string & /*path*/,
                   bool counted) {
    return counted;
  }

 private:
  void walk_data(std::string path, bool installed) {
    const DirPtr dir = safe_opendir(path.c_str());
    if (dir) {
      walk_in_order(dir.get(), &path, this);
    } else if (installed || exists(path)) {
      // A source need not bring all three: the installation makes them.
      note_unreadable(report_, path);
    }
  }

  void note_entry(const std::string &path, const struct stat &status) {
    rule_entry entry;
    entry.path = relative_to(*report_, path);
    if (!S_ISREG(status.st_mode) && !S_ISLNK(status.st_mode)) {
      report_->problems.push_back({"special-file", 0, entry.path,
                                   "neither file, directory nor link: its application's backup "
                                   "fails"});
      return;
    }
    entry.link = S_ISLNK(status.st_mode);
    entry.size = static_cast<std::uint64_t>(status.st_size);
    entry.in = !report_->blocked && decision_.takes(path);
    entry.element = deciding_element(report_, path, entry.in);
    report_->entries.push_back(entry);
  }

  rules_report *report_;
  Decision decision_;
  const package_files files_;
};

// Mistakes that only show once it is known what the elements matched.
void find_mistakes(rules_report *report) {
  for (const rule_element &element : report->elements) {
    if (!element.has_path) continue;
    struct stat status {};
    const bool exists = safe_lstat(element.path.c_str(), &status) == 0;
    const std::string name = element.include ? "include" : "exclude";
    if (!exists) {
      report->problems.push_back(
          {"nothing-there", element.line, element.given,
           name + " \"" + element.given + "\" names nothing: it is dropped"});
    } else if (S_ISDIR(status.st_mode) && element.path.back() != '/') {
      report->problems.push_back({"no-trailing-slash", element.line, element.given,
                                  name + " \"" + element.given +
                                      "\" names a directory without a trailing slash: it covers "
                                      "nothing inside"});
    } else if (element.matches == 0) {
      report->problems.push_back({"matches-nothing", element.line, element.given,
                                  name + " \"" + element.given + "\" matches nothing"});
    } else if (element.include && element.kept == 0) {
      report->problems.push_back(
          {"all-excluded", element.line, element.given,
           name + " \"" + element.given + "\" has no effect: all that it covers is excluded"});
    }
  }
}

}  // namespace

rules_report check_rules(const std::string &package_id, const std::string &type,
                         const std::string &root, bool installed) {
  rules_report report;
  report.package = package_id;
  report.root = root;
  report.cap = kMaxBackupSize;
  const std::string file = rules_file_of(type);
  const std::string other = rules_file_of_others(type);
  if (exists(root + "/" + file)) {
    report.file = file;
    read_elements(&report);
  } else if (exists(root + "/" + other)) {
    report.problems.push_back(
        {"wrong-place", 0, other, "a package of type \"" + type + "\" keeps its rules in " + file});
  }
  Check(&report, package_id).run(installed);
  for (const rule_entry &entry : report.entries) report.total += entry.in ? entry.size : 0;
  find_mistakes(&report);
  return report;
}

int rules_exit_code(const rules_report &report) {
  if (report.ignored || report.blocked) return RULES_UNUSABLE;
  if (report.total > report.cap) return RULES_OVER_CAP;
  return report.problems.empty() ? RULES_OK : RULES_PROBLEMS;
}
