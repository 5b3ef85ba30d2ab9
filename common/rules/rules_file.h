/**
 * @file rules_file.h
 * @brief An application's rules file: what it may be and what stands in it.
 *
 * A rules file that is none leaves everything to be backed up. One that is there and may say
 * something that cannot be known must not: what it excludes would leave the device. Nothing is
 * logged here: whoever reads the file tells of it. Any thread.
 */
#ifndef QUARN_RULES_FILE_H
#define QUARN_RULES_FILE_H

#include <cstddef>
#include <functional>
#include <memory>
#include <string>

/** Larger files are not parsed: a document takes many times its text. Bytes. */
inline constexpr std::size_t kMaxRulesSize = 256U << 10;

/** What became of a package's rules file. */
enum class rules_state {
  none,      /**< there is no rules file */
  loaded,    /**< its rules apply */
  ignored,   /**< it is no rules file: not readable, not XML, or with another root element */
  too_large, /**< it is larger than kMaxRulesSize */
  entities,  /**< it defines entities, or needs some that are defined elsewhere */
  no_library /**< what reads XML cannot be loaded */
};

/** True when a package whose rules are in this state may be packed. */
[[nodiscard]] constexpr bool rules_usable(rules_state state) {
  return state == rules_state::none || state == rules_state::loaded ||
         state == rules_state::ignored;
}

/** Why they cannot be used, as the end of a sentence about the file; static, empty when they can.
 */
[[nodiscard]] const char *rules_state_text(rules_state state);

/** One element below the root element. */
struct rules_element {
  std::string name;
  int line = 0;         /**< in the file, from 1 */
  bool is_rule = false; /**< "include" or "exclude" */
  bool include = false;
  bool has_path = false; /**< a rule without the attribute names nothing and counts for nothing */
  std::string given;     /**< the attribute as written */
  std::string path;      /**< the absolute path that it names */
};

/** A rules file that was read, without network, external parts or entities. */
class RulesFile {
 public:
  /** Read the file at an absolute path. */
  explicit RulesFile(const std::string &path);
  ~RulesFile();
  RulesFile(const RulesFile &) = delete;
  RulesFile &operator=(const RulesFile &) = delete;

  /** What became of it; loaded for every document that could be read, whatever its root. */
  rules_state state() const { return state_; }
  /** The root element's name, null for a document without one; lives as long as this. */
  const char *root_name() const;
  /** The root element's line, 0 for a document without one. */
  int root_line() const;
  /** True when it is a document of rules. */
  bool has_rules() const;
  /** Each element below the root, in order. @param root the package's, no slash at its end */
  void for_each(const std::string &root,
                const std::function<void(const rules_element &)> &take) const;

 private:
  struct Document;
  rules_state state_;
  std::unique_ptr<Document> document_;
};

#endif
