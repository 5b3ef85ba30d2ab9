#include "state/values.h"

#include <algorithm>

#include "state/state_file.h"

namespace embedded {
namespace {

constexpr char kValuesGroup[] = "settings";
constexpr char kWritesGroup[] = "writes";
constexpr unsigned char kFirstPrintable = 0x20;

}  // namespace

bool is_value_key(const std::string &key) {
  return !key.empty() && key.front() != ' ' && key.back() != ' ' && key.front() != '#' &&
         std::none_of(key.begin(), key.end(),
                      [](char c) {
                        return c == '=' || c == '[' || c == ']' ||
                               static_cast<unsigned char>(c) < kFirstPrintable;
                      }) &&
         g_utf8_validate(key.c_str(), -1, nullptr);
}

bool get_value(const std::string &device, const std::string &key, std::string *value) {
  if (!is_value_key(key)) return false;
  const KeyFilePtr file = read_state(device, kValuesFile);
  if (file == nullptr) return false;
  const GText text(g_key_file_get_string(file.get(), kValuesGroup, key.c_str(), nullptr));
  if (text == nullptr) return false;
  *value = text.get();
  return true;
}

bool set_value(const std::string &device, const std::string &key, const std::string &value) {
  if (!is_value_key(key)) return false;
  return edit_state(device, kValuesFile, [&](GKeyFile *file) {
    g_key_file_set_string(file, kValuesGroup, key.c_str(), value.c_str());
    g_key_file_set_int64(file, kWritesGroup, key.c_str(),
                         number_of(file, kWritesGroup, key.c_str(), 0) + 1);
    return true;
  });
}

std::int64_t value_writes(const std::string &device, const std::string &key) {
  const KeyFilePtr file = read_state(device, kValuesFile);
  return file == nullptr ? 0 : number_of(file.get(), kWritesGroup, key.c_str(), 0);
}

}  // namespace embedded
