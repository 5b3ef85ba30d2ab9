/**
 * @file file_attributes.h
 * @brief What a file-info table says of one file, directory or link, and how it spells it.
 *
 * The only place that knows the names of a table's members; docs/formats.md shows them. Functions
 * log nothing. A table is one thread's.
 */
#ifndef QUARN_D_UTILS_FILE_ATTRIBUTES_H
#define QUARN_D_UTILS_FILE_ATTRIBUTES_H

#include <json-c/json.h>
#include <sys/types.h>

#include <cstddef>
#include <optional>

#include "json_ptr.h"

/** The table's member that lists the links: each element of it is a member of its own. */
inline constexpr char kLinkListKey[] = "quarn_symbolic_info";

/** What is absent, or of another type than it should be, has no value. */
struct file_attributes {
  std::optional<mode_t> mode; /**< as st_mode has it, without the type */
  std::optional<uid_t> owner;
  std::optional<gid_t> group;
  /** Empty where it could not be had. Borrowed: the table's, as long as that is. */
  std::optional<const char *> label;

  /** True when nothing is absent. */
  [[nodiscard]] bool complete() const { return mode && owner && group && label; }
};

/** The attributes that a member of a table has. @param member null, or no object: nothing */
[[nodiscard]] file_attributes read_attributes(json_object *member);
/** The label alone, for those who ask for nothing else. */
[[nodiscard]] std::optional<const char *> read_label(json_object *member);
/** A new member with these attributes, none of which may be absent; null when memory is out. */
[[nodiscard]] JsonPtr write_attributes(const file_attributes &attributes);

/** One element of the list of links. Texts are borrowed, the table's. */
struct link_info {
  const char *name;   /**< its path below the package's root */
  const char *target; /**< what it leads to, as it was read */
  file_attributes attributes;
};

/** @return none when anything of it is absent */
[[nodiscard]] std::optional<link_info> read_link(json_object *element);
/** A new element. @param attributes a member of write_attributes(), which it takes a share of */
[[nodiscard]] JsonPtr write_link(const char *name, const char *target, JsonPtr attributes);
/** Bytes of an element's text beside those of its name, target and attributes. */
extern const std::size_t kLinkFrame;

#endif
