/**
 * @file labels.h
 * @brief Security labels of files, kept in extended attributes.
 *
 * The attribute is the kernel's own, "security.SMACK64". A process that may
 * not write it (a container without CAP_SYS_ADMIN) keeps labels in
 * "user.quarn.SMACK64" instead, which symbolic links and special files cannot
 * have.
 *
 * What an application makes has neither. On a kernel that labels it would have
 * its maker's label: below a package's root an object without the attribute
 * has the package's, which is the package's id, elsewhere the floor label.
 * What cannot have the attribute has the floor label everywhere. Any thread.
 */
#ifndef QUARN_EMBEDDED_LABELS_H
#define QUARN_EMBEDDED_LABELS_H

#include <string>

namespace embedded {

/** Label of what has none and is no application's. */
inline constexpr char kFloorLabel[] = "_";
/** Longest label. */
inline constexpr std::string::size_type kMaxLabel = 255;

/** Which of an object's labels. */
enum class LabelKind { kAccess, kExec, kMmap };

enum class Links { kFollow, kKeep };

/** True for a text that can be a label. */
bool is_label(const std::string &label);

/** Read a label. @return 0, or -1 with errno (ENODATA: no label of a kind that has no floor) */
int read_label(const char *path, Links links, LabelKind kind, std::string *label);

/** Write a label. @return 0, or -1 with errno */
int write_label(const char *path, Links links, LabelKind kind, const std::string &label);

}  // namespace embedded

#endif
