/**
 * @file rules.h
 * @brief quarnctl rules: what an application's rules file takes and leaves out.
 *
 * For application authors. Decisions are those of the daemon's own matcher.
 * Main thread; needs no bus.
 */
#ifndef QUARNCTL_RULES_H
#define QUARNCTL_RULES_H

#include <cstdint>
#include <string>
#include <vector>

/** Exit codes of the verbs, for an author's CI. */
enum rules_exit : int {
  RULES_OK = 0,
  RULES_PROBLEMS = 1, /**< mistakes were found */
  RULES_OVER_CAP = 2, /**< the application would be skipped */
  /** The file is ignored (no file, malformed, or another root element) or blocks every backup. */
  RULES_UNUSABLE = 3,
  RULES_NO_INPUT = 66 /**< no such package or source */
};

/** One "include" or "exclude" element. */
struct rule_element {
  bool include = false;
  bool has_path = false;
  std::string given; /**< the attribute as written */
  std::string path;  /**< the absolute path it names */
  int line = 0;      /**< in the rules file, from 1 */
  int matches = 0;   /**< entries that it covers, whatever decided about them */
  int kept = 0;      /**< those of them that are in */
};

/** One file or link of the application. */
struct rule_entry {
  std::string path; /**< relative to the package root */
  bool link = false;
  std::uint64_t size = 0; /**< bytes that count against the cap */
  bool in = false;
  int element = -1; /**< index of the deciding element; -1: no element decided */
};

/** Something that is probably a mistake. */
struct rule_problem {
  std::string kind; /**< closed set, see docs/rules.md */
  int line = 0;
  std::string path;
  std::string text;
};

/** Everything that a check finds out. */
struct rules_report {
  std::string package;
  std::string root;
  std::string file;     /**< the rules file, relative to the root; empty: none */
  bool ignored = false; /**< a file is there, but the daemon does not use it */
  bool blocked = false; /**< what the file says cannot be known: nothing is backed up */
  std::vector<rule_element> elements;
  std::vector<rule_entry> entries;
  std::vector<rule_problem> problems;
  std::uint64_t total = 0;
  std::uint64_t cap = 0;
};

/**
 * Check a package.
 * @param package_id  its id
 * @param type        package type, "tpk" or another
 * @param root        absolute package root, or the root of its source
 * @param installed   a source need not bring all data directories, a package has them
 */
rules_report check_rules(const std::string &package_id, const std::string &type,
                         const std::string &root, bool installed = false);

/** The exit code that belongs to a report. */
int rules_exit_code(const rules_report &report);
/** The report for people. */
std::string rules_text(const rules_report &report);
/** The report as one JSON object and a line end. */
std::string rules_json(const rules_report &report);
/** Why one path (relative to the root, or absolute) is in or out: one line, or JSON. */
std::string explain_rules(const rules_report &report, const std::string &path, bool json,
                          int *exit_code);

/**
 * The verbs "check" and "explain".
 * @param arguments what follows "rules"
 * @param json      machine-readable output
 * @return exit code; errors are on standard error
 */
int rules_command(const std::vector<std::string> &arguments, bool json);

#endif
