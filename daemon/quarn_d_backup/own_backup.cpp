#include "quarn_d_backup/own_backup.h"

#include <zlib.h>

#include "platform_settings.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_log.h"

namespace {

/** In place of a serial's: a backup was found, and nothing has been decided on it. */
constexpr int kUndecided = -1;

/** Never 0, which a setting that was never written may read as. */
int mark_of(const std::string &serial) {
  const uLong crc =
      crc32(0, reinterpret_cast<const Bytef *>(serial.data()), static_cast<uInt>(serial.size()));
  const int mark = static_cast<int>(static_cast<std::uint32_t>(crc));
  return mark != 0 && mark != kUndecided ? mark : 1;
}

bool has_mark(const std::string &serial) {
  int mark = 0;
  return vconf_get_int(kOwnBackupKey, &mark) == VCONF_OK && mark == mark_of(serial);
}

bool has_any_mark() {
  int mark = 0;
  return vconf_get_int(kOwnBackupKey, &mark) == VCONF_OK && mark != 0;
}

std::string own_serial() {
  CString model;
  CString serial;
  get_device_info(out(model), out(serial));
  return serial ? serial.get() : "";
}

/** A backup of a release that did not keep the setting. */
bool knows_last_backup() {
  std::uint64_t time = 0;
  return read_last_backup_time(&time) && time != 0 && !has_any_mark();
}

}  // namespace

bool knows_own_backup(const std::string &serial) { return has_mark(serial) || knows_last_backup(); }

void note_own_backup(const std::string &serial) {
  if (has_mark(serial)) return;
  if (vconf_set_int(kOwnBackupKey, mark_of(serial)) != VCONF_OK) {
    LOGE("cannot set own backup to vconf");
  }
}

void note_found_backup() {
  if (has_any_mark()) return;
  if (vconf_set_int(kOwnBackupKey, kUndecided) != VCONF_OK) {
    LOGE("cannot set own backup to vconf");
  }
}

void keep_knowledge_of_last_backup() {
  if (!knows_last_backup()) return;
  const std::string serial = own_serial();
  if (!serial.empty()) note_own_backup(serial);
}

void note_restore_mode_used() {
  const std::string serial = own_serial();
  if (!serial.empty()) note_own_backup(serial);
}
