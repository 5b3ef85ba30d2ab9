/**
 * @file platform_smack.h
 * @brief Security labels of files: the part of libsmack's interface that is used here.
 *
 * The names, types and results are libsmack's, so that the system's library
 * can be linked where it exists (-DQUARN_SMACK=system). Results are 0, or
 * negative with errno set. Any thread.
 */
#ifndef QUARN_PLATFORM_SMACK_H
#define QUARN_PLATFORM_SMACK_H

#include <sys/types.h>

#ifdef __cplusplus
extern "C" {
#endif

enum smack_label_type { SMACK_LABEL_ACCESS = 0, SMACK_LABEL_EXEC = 1, SMACK_LABEL_MMAP = 2 };

/** Longest label, without its terminator. */
#define SMACK_LABEL_LEN 255

/** Label of the object at @p path (links followed); malloc'd and the caller's. */
int smack_getlabel(const char *path, char **label, enum smack_label_type type);
/** The same without following a link. */
int smack_lgetlabel(const char *path, char **label, enum smack_label_type type);
/** Set the label of the object at @p path (links followed). */
int smack_setlabel(const char *path, const char *label, enum smack_label_type type);
/** The same without following a link. */
int smack_lsetlabel(const char *path, const char *label, enum smack_label_type type);

#ifdef __cplusplus
}
#endif
#endif
