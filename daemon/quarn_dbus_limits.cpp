#include "quarn_dbus_limits.h"

#include <cstring>

namespace {

std::string sentence(const char *what, std::size_t bound, const char *unit) {
  return std::string(what) + " has more than " + std::to_string(bound) + " " + unit;
}

std::string excess_of_list(const char *text) {
  if (std::strlen(text) > kMostListBytes) return sentence("pkg_list", kMostListBytes, "bytes");
  if (most_elements_of(text) > kMostCandidates) {
    return sentence("pkg_list", kMostCandidates, "packages");
  }
  return "";
}

std::string excess_of_name(const char *what, const char *text) {
  return std::strlen(text) > kMostNameBytes ? sentence(what, kMostNameBytes, "bytes") : "";
}

}  // namespace

std::size_t most_argument_bytes(const char *member) {
  return g_strcmp0(member, "restore_enable") == 0 ? kMostListArgumentBytes : kMostArgumentBytes;
}

std::size_t most_elements_of(const char *text) {
  std::size_t commas = 0;
  bool quoted = false;
  for (; *text != '\0'; ++text) {
    if (quoted && *text == '\\') {
      if (*++text == '\0') break;
    } else if (*text == '"') {
      quoted = !quoted;
    } else if (!quoted && *text == ',') {
      ++commas;
    }
  }
  return commas + 1;
}

std::string excess_of_arguments(const std::string &member, GVariant *arguments) {
  if (arguments == nullptr) return "";
  const auto has_form = [arguments](const char *form) {
    return g_variant_is_of_type(arguments, G_VARIANT_TYPE(form)) != FALSE;
  };
  if (member == "restore_enable" && has_form("(iissu)")) {
    const char *serial_num = nullptr;
    const char *pkg_list = nullptr;
    g_variant_get_child(arguments, 2, "&s", &serial_num);
    g_variant_get_child(arguments, 3, "&s", &pkg_list);
    const std::string excess = excess_of_name("serial_num", serial_num);
    return excess.empty() ? excess_of_list(pkg_list) : excess;
  }
  if (member == "auto_backup_start" || (!has_form("(s)") && !has_form("(su)"))) return "";
  const char *pkg_id = nullptr;
  g_variant_get_child(arguments, 0, "&s", &pkg_id);
  return excess_of_name("pkg_id", pkg_id);
}
