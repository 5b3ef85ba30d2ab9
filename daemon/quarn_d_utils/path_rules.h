/**
 * @file path_rules.h
 * @brief Which of a package's files are backed up: the rules of the calling thread.
 *
 * Every function logs its failures and reports them by its result only.
 * Each thread has rules of its own.
 */
#ifndef QUARN_D_UTILS_PATH_RULES_H
#define QUARN_D_UTILS_PATH_RULES_H

#include <cstdint>
#include <string>
#include <vector>

#include "rules/rules_file.h"

extern thread_local std::vector<std::string> backup_include_list;
extern thread_local std::vector<std::string> backup_exclude_list;
extern thread_local bool xml_has_include_field;

/** Forget the calling thread's rules: everything is backed up. */
void reset_backup_path_info();
/** Load a package's rules file, if it has one, in place of the thread's rules. */
void parse_backup_path_xml(const char *pkg_id, const char *pkg_type, const char *root);
/** What the last parse_backup_path_xml() of the calling thread found; none after a reset. */
[[nodiscard]] rules_state backup_rules_state();
/** rules_usable() of that. */
[[nodiscard]] bool backup_rules_usable();
/** Append @p path when something lies there. */
void add_to_path_info_list(const char *path, std::vector<std::string> *list);
/** Whether the thread's rules take the file or link at @p path. */
[[nodiscard]] bool is_backup_file(const char *path);
/** Bytes that an archive would take from @p dir; 26214401 for an unreadable directory. */
[[nodiscard]] std::uint64_t get_dir_backup_size(const char *dir, const char *pkg_id,
                                                const char *root);

#endif
