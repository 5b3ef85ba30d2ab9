#include "quarn_d_utils/kernel_settings.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <string>

#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

namespace {

struct Expected {
  const char *file;
  const char *name;
  int least;
  const char *against;
};

constexpr Expected kExpected[] = {
    {"fs/protected_hardlinks", "fs.protected_hardlinks", 1, "second names of files of others"},
    {"fs/protected_symlinks", "fs.protected_symlinks", 1, "links of others in /tmp"},
    {"fs/protected_fifos", "fs.protected_fifos", 1, "pipes of others in /tmp"},
    {"fs/protected_regular", "fs.protected_regular", 1, "files of others in /tmp"},
};

/** A small number's value; false, with errno, when there is none. */
bool read_number(const std::string &path, int *value) {
  const UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW));
  if (!fd) return false;
  char text[32];
  const ssize_t length = TEMP_FAILURE_RETRY(read(fd.get(), text, sizeof text - 1));
  if (length < 0) return false;
  text[length] = '\0';
  char *end = nullptr;
  const long number = std::strtol(text, &end, 10);
  if (end == text || (*end != '\0' && *end != '\n') || number < 0 || number > 1000) {
    errno = EINVAL;
    return false;
  }
  *value = static_cast<int>(number);
  return true;
}

}  // namespace

int tell_kernel_settings(const char *settings) {
  int told = 0;
  for (const Expected &expected : kExpected) {
    int value = 0;
    if (!read_number(std::string(settings) + "/" + expected.file, &value)) {
      LOGW("kernel setting %s cannot be read (%s): it should be at least %d, against %s",
           expected.name, std::strerror(errno), expected.least, expected.against);
    } else if (value < expected.least) {
      LOGW("kernel setting %s is %d: it should be at least %d, against %s", expected.name, value,
           expected.least, expected.against);
    } else {
      continue;
    }
    ++told;
  }
  return told;
}
