#include "quarn_d_methods.h"

namespace {

/** Whether @p text begins with the types of the method's arguments. @return behind them, or null */
const char *behind_types(const quarn_method &method, const char *text) {
  for (const quarn_argument *argument = method.arguments; argument->name != nullptr; ++argument) {
    if (*text++ != argument->type) return nullptr;
  }
  return text;
}

/** As has_signature(), of a tuple. */
bool is_tuple_of(const quarn_method &method, const char *type) {
  const char *const end = *type == '(' ? behind_types(method, type + 1) : nullptr;
  return end != nullptr && *end == ')';
}

void read_argument(const quarn_argument &argument, GVariant *from, gsize index,
                   quarn_arguments *into) {
  if (argument.integer != nullptr) {
    g_variant_get_child(from, index, "i", &(into->*argument.integer));
  } else if (argument.number != nullptr) {
    g_variant_get_child(from, index, "u", &(into->*argument.number));
  } else {
    g_variant_get_child(from, index, "&s", &(into->*argument.text));
  }
}

}  // namespace

const quarn_method *find_quarn_method(const char *name) {
  for (const quarn_method &method : kQuarnMethods) {
    if (g_strcmp0(method.name, name) == 0) return &method;
  }
  return nullptr;
}

bool has_signature(const quarn_method &method, const char *signature) {
  const char *const end = behind_types(method, signature);
  return end != nullptr && *end == '\0';
}

std::optional<quarn_arguments> read_quarn_arguments(const std::string &member,
                                                    GVariant *arguments) {
  const quarn_method *const method = find_quarn_method(member.c_str());
  if (method == nullptr || arguments == nullptr) return std::nullopt;
  if (!is_tuple_of(*method, g_variant_get_type_string(arguments))) return std::nullopt;
  quarn_arguments read;
  gsize index = 0;
  for (const quarn_argument *argument = method->arguments; argument->name != nullptr; ++argument) {
    read_argument(*argument, arguments, index++, &read);
  }
  return read;
}
