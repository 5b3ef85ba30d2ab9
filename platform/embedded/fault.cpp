#include "fault.h"

#include <unistd.h>

#include "state/state_file.h"

namespace embedded {

std::optional<int> fault_of(const char *function) {
  constexpr char kGroup[] = "faults";
  const std::string device = current_device();
  if (device.empty() || access(state_path(device, kFaultsFile).c_str(), F_OK) != 0) {
    return std::nullopt;
  }
  const KeyFilePtr file = read_state(device, kFaultsFile);
  if (file == nullptr || !g_key_file_has_key(file.get(), kGroup, function, nullptr)) {
    return std::nullopt;
  }
  return static_cast<int>(number_of(file.get(), kGroup, function, -1));
}

}  // namespace embedded
