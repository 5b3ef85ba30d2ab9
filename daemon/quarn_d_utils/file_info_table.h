/**
 * @file file_info_table.h
 * @brief The table of the modes, owners, labels and links of one archive, as it is made.
 *
 * Every function logs its failures and reports them by its result only.
 * One table is one thread's.
 */
#ifndef QUARN_D_UTILS_FILE_INFO_TABLE_H
#define QUARN_D_UTILS_FILE_INFO_TABLE_H

#include <json-c/json.h>
#include <sys/stat.h>

#include <cstdint>
#include <map>
#include <string>
#include <tuple>

#include "json_ptr.h"

/** Table of the modes, owners, labels and links of one archive. */
struct file_info_table_h {
  json_object *root = nullptr;          /**< the document; owns everything below */
  json_object *symbolic_list = nullptr; /**< the links, borrowed */
  using Attributes = std::map<std::tuple<mode_t, uid_t, gid_t, std::string>, JsonPtr>;
  /** Attribute objects by permission, owner, group and label: entries with the same share one. */
  Attributes attributes;
  Attributes::iterator used = attributes.end(); /**< the last one: the next entry's as a rule */
  std::uint64_t members = 0;                    /**< files, directories and links that were added */
  std::uint64_t names = 0;                      /**< bytes of their names */
  std::uint64_t text = 0; /**< bytes of the document's text with them, or a few less */
};

/** Make an empty table; *@p table is null on failure. Released with release_file_info_table(). */
void ready_file_info_table(file_info_table_h **table);
/** Release a table; null is accepted. */
void release_file_info_table(file_info_table_h *table);
/**
 * Attributes of one entry; @p label is malloc'd, null when it could not be read.
 * No part of the daemon calls it.
 * @param fd the entry's descriptor, borrowed, when it is open: its label is then the label of what
 *           was opened, found without another walk along the path; else negative
 */
[[nodiscard]] bool get_file_info_from_file(const char *path, const struct stat &stat,
                                           int *permission, unsigned int *uid, unsigned int *gid,
                                           char **label, int fd = -1);
/**
 * Add a directory or a regular file. *@p error becomes #QUARN_REFUSED on failure.
 * @param fd as for get_file_info_from_file()
 */
void add_to_file_info_table(file_info_table_h *table, const char *root, const char *path,
                            const struct stat &stat, int *error, int fd = -1);
/**
 * Add a symbolic link. *@p error becomes #QUARN_REFUSED on failure.
 * @param dir the directory that the link is in, borrowed, when it is open: the link is then found
 *            without another walk along the path; else negative
 */
void add_sym_info_to_file_info_table(file_info_table_h *table, const char *root, const char *path,
                                     const struct stat &stat, int *error, int dir = -1);
/** Write the table's JSON text and release its root. @return as write_string_to_file() */
[[nodiscard]] int save_file_info_table(file_info_table_h *table, const char *path);

#endif
