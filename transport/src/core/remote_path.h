/**
 * @file remote_path.h
 * @brief Which remote paths exist at all.
 */
#ifndef BACKUP_TRANSPORT_REMOTE_PATH_H
#define BACKUP_TRANSPORT_REMOTE_PATH_H

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace transport {

/** Longest component, in bytes: what every file system under a store takes. */
constexpr std::size_t kMaxComponentBytes = 255;
/** Longest path, in bytes: what object stores take, less room for a prefix. */
constexpr std::size_t kMaxPathBytes = 768;

/** Is @p path a proper absolute path of an object? */
[[nodiscard]] bool is_object_path(const char *path);

/** The same for a folder; @p folder receives it without a trailing slash, the root as "". */
[[nodiscard]] bool parse_folder_path(const char *path, std::string *folder);

/** The components of a checked path. */
std::vector<std::string> split_path(std::string_view path);

/** "/a/b" of "/a/b/c"; "" at the top. */
std::string parent_of(const std::string &path);

/** The last component. */
std::string name_of(const std::string &path);

/** A fresh name for something that is not an object yet, or no longer. */
std::string make_temporary_name();

/**
 * Could make_temporary_name() have made it? No object has such a name. Servers put
 * something behind a dot to it while they receive it.
 */
[[nodiscard]] bool is_temporary_name(std::string_view name);

}  // namespace transport

#endif
