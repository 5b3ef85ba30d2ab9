#include <fcntl.h>
#include <json-c/json.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>
#include <new>
#include <string>
#include <utility>

#include "files/safe_path.h"
#include "platform_smack.h"
#include "quarn_common.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_attributes.h"
#include "quarn_d_utils/file_info_table.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kPermissionBits = 07777;
constexpr std::size_t kTargetBuffer = 1024;

/**
 * An attribute object of the caller's. Most files of an application have the
 * same attributes: they share one object, so that the table of many files
 * stays small.
 */
JsonPtr attribute_object(file_info_table_h *table, const file_attributes &attributes) {
  auto &used = table->used;
  const auto values = std::tie(*attributes.mode, *attributes.owner, *attributes.group);
  if (used != table->attributes.end() && *attributes.label == std::get<std::string>(used->first) &&
      values ==
          std::tie(std::get<0>(used->first), std::get<1>(used->first), std::get<2>(used->first))) {
    return JsonPtr(json_object_get(used->second.get()));
  }
  used =
      table->attributes
          .try_emplace({*attributes.mode, *attributes.owner, *attributes.group, *attributes.label})
          .first;
  JsonPtr &shared = used->second;
  if (shared == nullptr) {
    shared = write_attributes(attributes);
    // Its text is made once for all that share it.
    char *text = strdup(json_object_get_string(shared.get()));
    if (text != nullptr) {
      json_object_set_serializer(shared.get(), json_object_userdata_to_json_string, text,
                                 json_object_free_userdata);
    }
  }
  return JsonPtr(json_object_get(shared.get()));
}

/** The label of an object, which may be one that only root may read. */
int label_of(const char *object, bool is_link, char **label) {
  const auto read = is_link ? smack_lgetlabel : smack_getlabel;
  errno = 0;
  const int result = read(object, label, SMACK_LABEL_ACCESS);
  if (result == 0 || errno != EACCES) return result;
  const ActAsRoot root;
  return read(object, label, SMACK_LABEL_ACCESS);
}

/** The same for one entry, whatever of it can be read. @param object what its label is read of */
JsonPtr attributes_of(file_info_table_h *table, const char *path, const struct stat &stat,
                      const char *object, int *error, bool *complete) {
  CString label;
  const int result = label_of(object, S_ISLNK(stat.st_mode), out(label));
  *complete = result == 0;
  if (result != 0) LOGE("error : cannot get smack label of %s (err=%d)", path, result);
  if (label == nullptr) {
    LOGE("error : cannot get smack label of %s", path);
    *error = QUARN_REFUSED;
  }
  file_attributes attributes;
  attributes.mode = stat.st_mode & kPermissionBits;
  attributes.owner = stat.st_uid;
  attributes.group = stat.st_gid;
  attributes.label = label == nullptr ? "" : label.get();
  return attribute_object(table, attributes);
}

UniqueFd open_link(int dir, const char *name) {
  UniqueFd link(openat(dir, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
  if (link || errno != EACCES) return link;
  const ActAsRoot root;
  return UniqueFd(openat(dir, name, O_PATH | O_NOFOLLOW | O_CLOEXEC));
}

/** Bytes of a text in the document, its quotes included. */
std::size_t quoted_size(const char *text) {
  constexpr std::size_t kShort = 2;  // a sign behind a backslash
  constexpr std::size_t kLong = 6;   // \u and four digits
  std::size_t size = 2;
  for (; *text != '\0'; ++text) {
    const auto c = static_cast<unsigned char>(*text);
    if (std::strchr("\"\\/\b\n\r\t\f", c) != nullptr) {
      size += kShort;
    } else {
      size += c < ' ' ? kLong : 1;
    }
  }
  return size;
}

/** Note one more member, whose attributes are the last used ones. */
void count_member(file_info_table_h *table, const char *name, std::size_t text) {
  constexpr std::size_t kSeparators = 4;  // before it and behind its name
  ++table->members;
  table->names += std::strlen(name);
  table->text +=
      text + kSeparators + std::strlen(json_object_get_string(table->used->second.get()));
}

const char *relative_name(const char *root, const char *path) {
  const std::size_t skipped = std::strlen(root) + 1;
  const std::size_t length = std::strlen(path);
  return path + (length < skipped ? length : skipped);
}

}  // namespace

void ready_file_info_table(file_info_table_h **table) {
  *table = nullptr;
  JsonPtr root(json_object_new_object());
  JsonPtr list(json_object_new_array());
  if (root == nullptr || list == nullptr) return;
  auto *made = new (std::nothrow) file_info_table_h;
  if (made == nullptr) return;
  made->symbolic_list = list.get();
  json_object_object_add_ex(root.get(), kLinkListKey, list.release(),
                            JSON_C_OBJECT_ADD_KEY_IS_NEW | JSON_C_OBJECT_KEY_IS_CONSTANT);
  made->root = root.release();
  *table = made;
}

void release_file_info_table(file_info_table_h *table) {
  if (table == nullptr) return;
  json_object_put(table->root);
  delete table;
}

bool get_file_info_from_file(const char *path, const struct stat &stat, int *permission,
                             unsigned int *uid, unsigned int *gid, char **label, int fd) {
  *permission = static_cast<int>(stat.st_mode & kPermissionBits);
  *uid = stat.st_uid;
  *gid = stat.st_gid;
  *label = nullptr;
  const std::string opened = fd < 0 ? std::string() : own_fd_path(fd);
  const char *object = fd < 0 ? path : opened.c_str();
  const int result = label_of(object, S_ISLNK(stat.st_mode), label);
  if (result != 0) {
    LOGE("error : cannot get smack label of %s (err=%d)", path, result);
    return false;
  }
  return true;
}

void add_to_file_info_table(file_info_table_h *table, const char *root, const char *path,
                            const struct stat &stat, int *error, int fd) {
  bool complete = false;
  const std::string opened = fd < 0 ? std::string() : own_fd_path(fd);
  JsonPtr attributes =
      attributes_of(table, path, stat, fd < 0 ? path : opened.c_str(), error, &complete);
  if (!complete) *error = QUARN_REFUSED;
  const char *name = relative_name(root, path);
  json_object_object_add(table->root, name, attributes.release());
  count_member(table, name, quoted_size(name));
}

void add_sym_info_to_file_info_table(file_info_table_h *table, const char *root, const char *path,
                                     const struct stat &stat, int *error, int dir) {
  char target[kTargetBuffer] = {};
  const char *last = std::strrchr(path, '/') + 1;
  const UniqueFd link = dir < 0 ? safe_open(path, O_PATH) : open_link(dir, last);
  const ssize_t length = link ? readlinkat(link.get(), "", target, sizeof(target)) : -1;
  if (length < 0) {
    LOGE("error : cannot read symbolic info of %s", path);
    *error = QUARN_REFUSED;
    return;
  }
  if (static_cast<std::size_t>(length) >= sizeof(target)) {
    LOGE("error : symlink of %s is too long", path);
    *error = QUARN_REFUSED;
    return;
  }
  LOGI("%s -> %s", path, target);
  bool complete = false;
  const std::string object = dir < 0 ? path : own_fd_path(dir) + "/" + last;
  JsonPtr attributes = attributes_of(table, path, stat, object.c_str(), error, &complete);
  const char *name = relative_name(root, path);
  json_object_array_add(table->symbolic_list,
                        write_link(name, target, std::move(attributes)).release());
  count_member(table, name, quoted_size(name) + quoted_size(target) + kLinkFrame);
}

int save_file_info_table(file_info_table_h *table, const char *path) {
  const char *text = json_object_get_string(table->root);
  std::string data = text == nullptr ? "" : text;
  json_object_put(table->root);
  table->root = nullptr;
  table->symbolic_list = nullptr;
  table->attributes.clear();
  table->used = table->attributes.end();
  return write_string_to_file(std::move(data), path);
}
