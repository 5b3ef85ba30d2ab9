#include "state/facts.h"

#include "state/state_file.h"

namespace embedded {
namespace {

constexpr char kDeviceGroup[] = "device";
constexpr char kChangesGroup[] = "changes";

}  // namespace

bool get_fact(const std::string &device, const char *key, Fact *fact) {
  const KeyFilePtr file = read_state(device, kFactsFile);
  if (file == nullptr) return false;
  fact->value = text_of(file.get(), kDeviceGroup, key);
  fact->changes = number_of(file.get(), kChangesGroup, key, 0);
  return true;
}

bool set_fact(const std::string &device, const char *key, const std::string &value) {
  bool same = false;
  const bool written = edit_state(device, kFactsFile, [&](GKeyFile *file) {
    same = text_of(file, kDeviceGroup, key) == value;
    if (same) return false;
    g_key_file_set_string(file, kDeviceGroup, key, value.c_str());
    g_key_file_set_int64(file, kChangesGroup, key, number_of(file, kChangesGroup, key, 0) + 1);
    return true;
  });
  return written || same;
}

}  // namespace embedded
