#include "json_read.h"

#include <climits>

namespace quarn_client {

namespace {

using Tokener = Handle<json_tokener, &json_tokener_free>;

}  // namespace

JsonPtr json_parse(const std::string &text) {
  if (text.size() >= INT_MAX) return nullptr;
  const Tokener tokener(json_tokener_new());
  if (!tokener) return nullptr;
  JsonPtr root(json_tokener_parse_ex(tokener.get(), text.data(), static_cast<int>(text.size())));
  if (json_tokener_get_error(tokener.get()) != json_tokener_success) return nullptr;
  const std::size_t end = json_tokener_get_parse_end(tokener.get());
  if (text.find_first_not_of(" \t\r\n", end) != std::string::npos) return nullptr;
  return root;
}

json_object *json_member(json_object *object, const char *name, json_type type) {
  json_object *member = nullptr;
  if (object == nullptr || !json_object_is_type(object, json_type_object) ||
      !json_object_object_get_ex(object, name, &member) || !json_object_is_type(member, type)) {
    return nullptr;
  }
  return member;
}

std::optional<std::string> json_string(json_object *object, const char *name) {
  json_object *member = json_member(object, name, json_type_string);
  if (member == nullptr) return std::nullopt;
  return std::string(json_object_get_string(member),
                     static_cast<std::size_t>(json_object_get_string_len(member)));
}

std::optional<std::int64_t> json_integer(json_object *object, const char *name) {
  json_object *member = json_member(object, name, json_type_int);
  if (member == nullptr) return std::nullopt;
  return json_object_get_int64(member);
}

void json_add(json_object *object, const char *name, const std::string &value) {
  json_object_object_add(object, name,
                         json_object_new_string_len(value.data(), static_cast<int>(value.size())));
}

}  // namespace quarn_client
