/**
 * @file put_attributes_back.h
 * @brief What a snapshot's table says of the data, and making the data so again.
 *
 * Failures are logged, and leave an object as it is. The caller's thread, which holds the package's
 * lock.
 */
#ifndef QUARN_D_RESTORE_PUT_ATTRIBUTES_BACK_H
#define QUARN_D_RESTORE_PUT_ATTRIBUTES_BACK_H

#include <json-c/json.h>
#include <sys/stat.h>

#include <string>

/** What the table has for @p key, a path below the root; null for nothing. The table's. */
[[nodiscard]] json_object *entry_of(json_object *table, const std::string &key);

/**
 * Make an open object what the snapshot's table says. The table is this
 * device's own, so unlike a restore it may put back any owner, mode and label.
 * @param before what @p fd is by now. @param key for messages
 */
void put_attributes_back(int fd, const struct stat &before, const char *key, json_object *entry);

/**
 * A folder that goes back to somebody else is closed to the application first, and emptied of
 * what is not its own: whatever it has linked there would count as the other's from then on.
 * Each of those files comes back from the snapshot.
 * @param entry the table's for the folder, null when it has none
 * @param folder may be of the O_PATH kind
 */
void take_from_application(int folder, json_object *entry);

/** Which of them. */
enum class Objects { kAll, kDirectories };

/**
 * The attributes of what the table has below the directory @p top. Files get
 * theirs in the snapshot, where the application cannot put another file in
 * their place; what is not there stays away.
 */
void put_all_attributes_back(json_object *table, const std::string &top, Objects objects);

#endif
