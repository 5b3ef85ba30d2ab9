/**
 * @file rules_state.h
 * @brief What became of a package's rules file.
 *
 * A rules file that is none leaves everything to be backed up. One that is there and may say
 * something that cannot be known must not: what it excludes would leave the device.
 */
#ifndef QUARN_D_UTILS_RULES_STATE_H
#define QUARN_D_UTILS_RULES_STATE_H

enum class rules_state {
  none,      /**< there is no rules file */
  loaded,    /**< its rules apply */
  ignored,   /**< it is no rules file: not readable, not XML, or with another root element */
  too_large, /**< it is larger than kMaxRulesSize */
  entities,  /**< it defines entities, or needs some that are defined elsewhere */
  no_library /**< what reads XML cannot be loaded */
};

/** True when a package whose rules are in this state may be packed. */
constexpr bool rules_usable(rules_state state) {
  return state == rules_state::none || state == rules_state::loaded ||
         state == rules_state::ignored;
}

/** Why they cannot be used, as the end of a sentence about the file; empty when they can. */
const char *rules_state_text(rules_state state);

/** What parse_backup_path_xml() found for the calling thread; none after a reset. */
rules_state backup_rules_state();
/** rules_usable() of that. */
bool backup_rules_usable();

#endif
