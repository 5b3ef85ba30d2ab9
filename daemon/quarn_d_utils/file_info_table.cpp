#include <fcntl.h>

#include <cerrno>
#include <cstring>
#include <new>

#include "platform_smack.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_d_utils/table_text.h"
#include "quarn_log.h"

namespace {

constexpr char kRealNameKey[] = "real_name";
constexpr char kLinkKey[] = "lnk";
constexpr char kPermKey[] = "perm";
constexpr char kPermissionKey[] = "0";
constexpr char kUidKey[] = "1";
constexpr char kGidKey[] = "2";
constexpr char kLabelKey[] = "3";

constexpr mode_t kPermissionBits = 07777;
constexpr std::size_t kTargetBuffer = 1024;
constexpr int kNotOpen = -1;

void add_constant(json_object *object, const char *key, json_object *value) {
  json_object_object_add_ex(object, key, value,
                            JSON_C_OBJECT_ADD_KEY_IS_NEW | JSON_C_OBJECT_KEY_IS_CONSTANT);
}

/**
 * An attribute object of the caller's. Most files of an application have the
 * same attributes: they share one object, so that the table of many files
 * stays small.
 */
json_object *attribute_object(file_info_table_h *table, int permission, unsigned int uid,
                              unsigned int gid, const char *label) {
  auto &used = table->used;
  const auto values = std::tie(permission, uid, gid);
  if (used != table->attributes.end() && label == std::get<std::string>(used->first) &&
      values ==
          std::tie(std::get<0>(used->first), std::get<1>(used->first), std::get<2>(used->first))) {
    return json_object_get(used->second.get());
  }
  used = table->attributes.try_emplace({permission, uid, gid, label}).first;
  JsonPtr &shared = used->second;
  if (shared == nullptr) {
    shared.reset(json_object_new_object());
    add_constant(shared.get(), kPermissionKey, json_object_new_int(permission));
    add_constant(shared.get(), kUidKey, json_object_new_int64(uid));
    add_constant(shared.get(), kGidKey, json_object_new_int64(gid));
    add_constant(shared.get(), kLabelKey, json_object_new_string(label));
    // Its text is made once for all that share it.
    char *text = strdup(json_object_get_string(shared.get()));
    if (text != nullptr) {
      json_object_set_serializer(shared.get(), json_object_userdata_to_json_string, text,
                                 json_object_free_userdata);
    }
  }
  return json_object_get(shared.get());
}

/** The same for one entry, whatever of it can be read. */
json_object *attributes_of(file_info_table_h *table, const char *path, const struct stat &stat,
                           int fd, int *error, bool *complete) {
  int permission = 0;
  unsigned int uid = 0;
  unsigned int gid = 0;
  CString label;
  *complete = get_file_info_from_file(path, stat, &permission, &uid, &gid, out(label), fd);
  if (label == nullptr) {
    LOGE("error : cannot get smack label of %s", path);
    *error = QUARN_REFUSED;
  }
  return attribute_object(table, permission, uid, gid, label == nullptr ? "" : label.get());
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
  add_constant(root.get(), kLinkListKey, list.release());
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
  const int result = S_ISLNK(stat.st_mode) ? smack_lgetlabel(path, label, SMACK_LABEL_ACCESS)
                                           : smack_getlabel(object, label, SMACK_LABEL_ACCESS);
  if (result != 0) {
    LOGE("error : cannot get smack label of %s (err=%d)", path, result);
    return false;
  }
  return true;
}

void add_to_file_info_table(file_info_table_h *table, const char *root, const char *path,
                            const struct stat &stat, int *error, int fd) {
  bool complete = false;
  json_object *attributes = attributes_of(table, path, stat, fd, error, &complete);
  if (!complete) *error = QUARN_REFUSED;
  const char *name = relative_name(root, path);
  json_object_object_add(table->root, name, attributes);
  count_member(table, name, quoted_size(name));
}

void add_sym_info_to_file_info_table(file_info_table_h *table, const char *root, const char *path,
                                     const struct stat &stat, int *error) {
  char target[kTargetBuffer] = {};
  const UniqueFd link = safe_open(path, O_PATH);
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
  json_object *attributes = attributes_of(table, path, stat, kNotOpen, error, &complete);
  json_object *entry = json_object_new_object();
  const char *name = relative_name(root, path);
  add_constant(entry, kRealNameKey, json_object_new_string(name));
  add_constant(entry, kLinkKey, json_object_new_string(target));
  add_constant(entry, kPermKey, attributes);
  json_object_array_add(table->symbolic_list, entry);
  constexpr char kFrame[] = R"({ "real_name": , "lnk": , "perm":  })";
  count_member(table, name, quoted_size(name) + quoted_size(target) + sizeof kFrame);
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
