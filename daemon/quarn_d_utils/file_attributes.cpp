#include "quarn_d_utils/file_attributes.h"

namespace {

constexpr char kModeKey[] = "0";
constexpr char kOwnerKey[] = "1";
constexpr char kGroupKey[] = "2";
constexpr char kLabelKey[] = "3";

constexpr char kNameKey[] = "real_name";
constexpr char kTargetKey[] = "lnk";
constexpr char kAttributesKey[] = "perm";

/** A member of an object, null when it is missing or of another type. */
json_object *member_of(json_object *object, const char *key, json_type type) {
  json_object *value = nullptr;
  if (!json_object_object_get_ex(object, key, &value)) return nullptr;
  return json_object_is_type(value, type) ? value : nullptr;
}

/** A new object's next member; its key is one of the above. */
void add_member(const JsonPtr &object, const char *key, json_object *value) {
  json_object_object_add_ex(object.get(), key, value,
                            JSON_C_OBJECT_ADD_KEY_IS_NEW | JSON_C_OBJECT_KEY_IS_CONSTANT);
}

}  // namespace

const std::size_t kLinkFrame = sizeof R"({ "real_name": , "lnk": , "perm":  })";

std::optional<const char *> read_label(json_object *member) {
  json_object *value = member_of(member, kLabelKey, json_type_string);
  if (value == nullptr) return std::nullopt;
  return json_object_get_string(value);
}

file_attributes read_attributes(json_object *member) {
  file_attributes read;
  if (json_object *value = member_of(member, kModeKey, json_type_int)) {
    read.mode = static_cast<mode_t>(json_object_get_int(value));
  }
  if (json_object *value = member_of(member, kOwnerKey, json_type_int)) {
    read.owner = static_cast<uid_t>(json_object_get_int64(value));
  }
  if (json_object *value = member_of(member, kGroupKey, json_type_int)) {
    read.group = static_cast<gid_t>(json_object_get_int64(value));
  }
  read.label = read_label(member);
  return read;
}

JsonPtr write_attributes(const file_attributes &attributes) {
  JsonPtr member(json_object_new_object());
  if (member == nullptr) return member;
  add_member(member, kModeKey, json_object_new_int(static_cast<int>(*attributes.mode)));
  add_member(member, kOwnerKey, json_object_new_int64(*attributes.owner));
  add_member(member, kGroupKey, json_object_new_int64(*attributes.group));
  add_member(member, kLabelKey, json_object_new_string(*attributes.label));
  return member;
}

std::optional<link_info> read_link(json_object *element) {
  json_object *name = member_of(element, kNameKey, json_type_string);
  json_object *target = member_of(element, kTargetKey, json_type_string);
  json_object *attributes = nullptr;
  if (name == nullptr || target == nullptr ||
      !json_object_object_get_ex(element, kAttributesKey, &attributes)) {
    return std::nullopt;
  }
  const link_info read{json_object_get_string(name), json_object_get_string(target),
                       read_attributes(attributes)};
  if (!read.attributes.complete()) return std::nullopt;
  return read;
}

JsonPtr write_link(const char *name, const char *target, JsonPtr attributes) {
  JsonPtr element(json_object_new_object());
  add_member(element, kNameKey, json_object_new_string(name));
  add_member(element, kTargetKey, json_object_new_string(target));
  add_member(element, kAttributesKey, attributes.release());
  return element;
}
