#include <glib.h>

#include <atomic>
#include <cstdint>
#include <memory>

#include "files/package_files.h"
#include "quarn_common.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/run_notes.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/handles.h"
#include "quarn_dbus_client.h"
#include "quarn_log.h"

namespace {

std::atomic<std::uint32_t> last_run_id{0};

}  // namespace

backup_context::backup_context() : notes(std::make_shared<run_notes>()), run_id(++last_run_id) {}

backup_context::~backup_context() {
  release_all_staged_archives(this);
  GMainLoop *loop = wait_loop.exchange(nullptr);
  if (loop != nullptr) g_main_loop_unref(loop);
}

void backup_context_unref::operator()(backup_context *ctx) const { ctx->unref(); }

run_notes &notes_of(const backup_context *ctx) { return *ctx->notes; }

void note_cause(backup_context *ctx, request_cause cause) {
  request_cause none = request_cause::none;
  ctx->notes->cause.compare_exchange_strong(none, cause);
}

BackupContextPtr share_backup_context(backup_context *ctx) {
  ctx->ref();
  return BackupContextPtr(ctx);
}

int backup_context_init(backup_context *ctx) {
  CString model;
  CString serial;
  get_device_info(out(model), out(serial));
  // the serial becomes a folder's name
  if (!model || !serial || !is_safe_path_component(serial.get())) {
    LOGE("cannot get device info");
    ctx->result = QUARN_REFUSED;
    return QUARN_REFUSED;
  }
  ctx->serial_number = serial.get();
  ctx->model_name = model.get();
  return QUARN_OK;
}

void set_result_once(backup_context *ctx, std::int32_t code) {
  std::int32_t expected = QUARN_OK;
  ctx->result.compare_exchange_strong(expected, code);
}
