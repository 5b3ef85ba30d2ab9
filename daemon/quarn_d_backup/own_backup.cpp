#include "quarn_d_backup/own_backup.h"

#include <zlib.h>

#include <atomic>
#include <cstdint>
#include <string>

#include "platform_settings.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

namespace {

/** In place of a serial's: a backup was found, and nothing has been decided on it. */
constexpr int kUndecided = -1;
/** Likewise: restore mode waits for packages of the device's own backup. */
constexpr int kWaitedFor = -2;

/** It is this process that waits, so it knows for what; a later one knows only that one did. */
std::atomic<bool> waits_here{false};

/** Never 0, which a setting that was never written may read as. */
int mark_of(const std::string &serial) {
  const uLong crc =
      crc32(0, reinterpret_cast<const Bytef *>(serial.data()), static_cast<uInt>(serial.size()));
  const int mark = static_cast<int>(static_cast<std::uint32_t>(crc));
  const bool taken = mark == 0 || mark == kUndecided || mark == kWaitedFor;
  return taken ? 1 : mark;
}

int stored_mark() {
  int mark = 0;
  return vconf_get_int(kOwnBackupKey, &mark) == VCONF_OK ? mark : 0;
}

bool has_mark(const std::string &serial) { return stored_mark() == mark_of(serial); }

bool has_any_mark() { return stored_mark() != 0; }

bool waits_for_own_backup() { return waits_here && stored_mark() == kWaitedFor; }

void store_mark(int mark) {
  if (vconf_set_int(kOwnBackupKey, mark) != VCONF_OK) LOGE("cannot set own backup to vconf");
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

bool knows_own_backup(const std::string &serial) {
  return has_mark(serial) || knows_last_backup() || waits_for_own_backup();
}

void note_own_backup(const std::string &serial) {
  // what is waited for is to outlive this process, whatever it backs up meanwhile
  if (!has_mark(serial) && !waits_for_own_backup()) store_mark(mark_of(serial));
}

void note_found_backup() {
  if (!has_any_mark()) store_mark(kUndecided);
}

void keep_knowledge_of_last_backup() {
  if (!knows_last_backup()) return;
  const std::string serial = own_serial();
  if (!serial.empty()) note_own_backup(serial);
}

void note_restore_mode_waits(const std::string &serial) {
  if (serial != own_serial()) waits_here = false;
  if (serial != own_serial() || !knows_own_backup(serial)) return;
  store_mark(kWaitedFor);
  waits_here = true;
}

void note_restore_mode_withdrawn() { waits_here = false; }

void note_restore_mode_used() {
  waits_here = false;
  const std::string serial = own_serial();
  if (!serial.empty()) note_own_backup(serial);
}
