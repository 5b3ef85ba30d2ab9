#include "quarn_dbus_limits.h"

#include <algorithm>
#include <cstring>
#include <iterator>
#include <optional>

#include "quarn_d_methods.h"

namespace {

std::string sentence(const char *what, std::size_t bound, const char *unit) {
  return std::string(what) + " has more than " + std::to_string(bound) + " " + unit;
}

/** @p text is null where the method has no such argument; likewise below. */
std::string excess_of_list(const char *text) {
  if (text == nullptr) return "";
  if (std::strlen(text) > kMostListBytes) return sentence(kPkgList.name, kMostListBytes, "bytes");
  if (most_elements_of(text) > kMostCandidates) {
    return sentence(kPkgList.name, kMostCandidates, "packages");
  }
  return "";
}

std::string excess_of_name(const char *what, const char *text) {
  return text != nullptr && std::strlen(text) > kMostNameBytes
             ? sentence(what, kMostNameBytes, "bytes")
             : "";
}

bool has_list(const quarn_method &method) {
  return std::any_of(std::begin(method.arguments), std::end(method.arguments),
                     [](const quarn_argument &argument) {
                       return argument.text != nullptr && argument.text == kPkgList.text;
                     });
}

}  // namespace

std::size_t most_argument_bytes(const char *member) {
  const quarn_method *const method = find_quarn_method(member);
  return method != nullptr && has_list(*method) ? kMostListArgumentBytes : kMostArgumentBytes;
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
  const std::optional<quarn_arguments> given = read_quarn_arguments(member, arguments);
  if (!given) return "";
  std::string excess = excess_of_name(kSerialNum.name, given->serial_num);
  if (excess.empty()) excess = excess_of_list(given->pkg_list);
  return excess.empty() ? excess_of_name(kPkgId.name, given->pkg_id) : excess;
}
