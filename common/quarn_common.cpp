#include "quarn_common.h"

#include <cstdlib>
#include <cstring>

#include "quarn_log.h"

char *quarn_utils_parse_key(const char *key) {
  LOGI(">>>>>>>> called");
  if (key == nullptr) {
    LOGE("\033[0;31m(%s)\033[0;m", "NULL == key");
    return nullptr;
  }
  const std::size_t length = std::strlen(key);
  char *path = static_cast<char *>(std::calloc(length + 2, 1));
  if (path == nullptr) {
    LOGE("\033[0;31m(%s)\033[0;m", "NULL == path");
    return nullptr;
  }
  path[0] = '/';
  std::memcpy(path + 1, key, length);
  return path;
}
