#include <memory>
#include <utility>

#include "files/package_files.h"
#include "glib_handles.h"
#include "quarn_d_backup/owed_archive.h"
#include "quarn_d_backup/single_backup.h"
#include "quarn_d_handler/quarn_d_handler.h"
#include "quarn_d_restore/app_restore.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_restore/recovery.h"
#include "quarn_d_restore/restore_context.h"
#include "quarn_d_utils/cloud_session.h"
#include "quarn_d_utils/device_info.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_d_utils/package.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/platform_handles.h"
#include "quarn_d_utils/power.h"
#include "quarn_dbus_client.h"
#include "quarn_log.h"

namespace {

/** The CPU lock for the length of a request. */
class PowerLock {
 public:
  PowerLock() { request_power_lock(true); }
  ~PowerLock() { request_power_lock(false); }
  PowerLock(const PowerLock &) = delete;
  PowerLock &operator=(const PowerLock &) = delete;
};

/** What a request needs to know of its package and the device. */
struct package_facts {
  std::string version;
  std::string type;
  std::string root;
  std::string model;
  std::string serial;
};

/** One of the package's texts. @return #QUARN_OK or #QUARN_FAILED */
int read_text(package_info_h info, int (*get)(package_info_h, char **), const char *call,
              const char *what, std::string *text) {
  CString value;
  const int result = get(info, out(value));
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("%s() was failed, ret = [%d]", call, result);
    return QUARN_FAILED;
  }
  if (value == nullptr) {
    LOGE("%s is NULL", what);
    return QUARN_FAILED;
  }
  *text = value.get();
  return QUARN_OK;
}

int read_version(package_info_h info, package_facts *facts) {
  return read_text(info, package_info_get_version, "package_info_get_version", "pkg_version",
                   &facts->version);
}

int read_type(package_info_h info, package_facts *facts) {
  return read_text(info, package_info_get_type, "package_info_get_type", "pkg_type", &facts->type);
}

int read_root_path(package_info_h info, package_facts *facts) {
  return read_text(info, package_info_get_root_path, "package_info_get_root_path", "pkg_root_path",
                   &facts->root);
}

/** #QUARN_OK for a package that the user installed. */
int refuse_preloaded(package_info_h info) {
  bool preload = false;
  const int result = package_info_is_preload_package(info, &preload);
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_is_preload_package fail, err = [%d]", result);
    return QUARN_FAILED;
  }
  if (preload) {
    LOGE("we don't support preload app");
    return QUARN_PRELOADED;
  }
  return QUARN_OK;
}

bool read_device(package_facts *facts) {
  CString model;
  CString serial;
  get_device_info(out(model), out(serial));
  if (model == nullptr || serial == nullptr) {
    LOGE("cannot get device info");
    return false;
  }
  facts->model = model.get();
  facts->serial = serial.get();
  return true;
}

/** Visit the package's applications. @return #QUARN_OK or #QUARN_FAILED */
int visit_applications(package_info_h info, package_info_app_cb callback, void *data) {
  const int result =
      package_info_foreach_app_from_package(info, PACKAGE_INFO_ALLAPP, callback, data);
  if (result == PACKAGE_MANAGER_ERROR_NONE) return QUARN_OK;
  LOGE("package_info_foreach_app_from_package() failed : %d", result);
  return QUARN_FAILED;
}

/** #QUARN_OK, or #QUARN_DISABLED when one of the package's applications does not take part in
 * backup. */
int refuse_disabled(const std::string &pkg_id, bool enabled) {
  if (!enabled) {
    LOGI("backup disabled for (%s)", pkg_id.c_str());
    return QUARN_DISABLED;
  }
  LOGI("backup enabled for (%s)", pkg_id.c_str());
  return QUARN_OK;
}

bool _check_backup_enabled(package_info_app_component_type_e /*type*/, const char *app_id,
                           void *data) {
  if (!backup_enabled_app(app_id)) static_cast<single_backup *>(data)->disable();
  return true;
}

bool _check_restore_enabled(package_info_app_component_type_e /*type*/, const char *app_id,
                            void *data) {
  auto *ctx = static_cast<pkg_restore_context *>(data);
  if (!backup_enabled_app(app_id)) ctx->backup_enabled = false;
  return true;
}

bool _package_cb_for_backup(package_info_app_component_type_e /*type*/, const char *app_id,
                            void *data) {
  auto *backup = static_cast<single_backup *>(data);
  if (!backup->take_first_application()) return true;
  if (backup->make_archive(app_id) != QUARN_OK) {
    LOGE("cannot make app data zip...");
    return true;
  }
  backup->upload();
  return true;
}

bool _package_cb_for_restore(package_info_app_component_type_e /*type*/, const char *app_id,
                             void *data) {
  auto *ctx = static_cast<pkg_restore_context *>(data);
  if (!ctx->backup_enabled || ctx->restore_started) return true;
  ctx->restore_started = true;
  run_on_thread_stack([&] { restore_app_data(app_id, ctx); });
  return true;
}

int back_up(const std::string &pkg_id, package_info_h info, client_cb_data * /*record*/) {
  package_facts facts;
  int result = refuse_preloaded(info);
  if (result == QUARN_OK) result = read_version(info, &facts);
  if (result == QUARN_OK) result = read_type(info, &facts);
  if (result == QUARN_OK) result = read_root_path(info, &facts);
  if (result == QUARN_OK && !read_device(&facts)) result = QUARN_FAILED;
  if (result != QUARN_OK) return result;

  single_backup backup({facts.serial, facts.model, pkg_id, facts.version, facts.type, facts.root});
  result = visit_applications(info, _check_backup_enabled, &backup);
  if (result == QUARN_OK) result = refuse_disabled(pkg_id, backup.enabled());
  if (result != QUARN_OK) return result;
  result = visit_applications(info, _package_cb_for_backup, &backup);
  if (!backup.upload_under_way() && waits_are_ended()) return QUARN_CANCELLED;
  const int uploaded = backup.wait();
  if (result == QUARN_OK && uploaded == QUARN_OK) {
    // somebody has decided that the data as it is now is to be in the cloud
    forget_owed_archive(facts.serial, pkg_id, facts.root);
  }
  return result != QUARN_OK ? result : uploaded;
}

/** Wait for the end of the restore, and take its context back. @return its result */
int wait_for_restore(RestoreContextPtr ctx) {
  if (ctx->pending > 0) {
    const GMainLoopPtr loop(new_wait_loop());
    ctx->main_loop.reset(g_main_loop_ref(loop.get()));
    run_nested_loop(loop.get());
    const GMainLoopPtr left = std::move(ctx->main_loop);
    if (left != nullptr) {
      // Withdrawn, or the daemon ends, and the download still has its context.
      abandon_restore(std::move(ctx));
      return QUARN_CANCELLED;
    }
  }
  return ctx->result;
}

gboolean end_wait(gpointer loop) {
  g_main_loop_quit(static_cast<GMainLoop *>(loop));
  return G_SOURCE_REMOVE;
}

/** Leave the main loop to others until nobody packs the package. */
void wait_while_packed(const std::string &pkg_id) {
  constexpr guint kCheckMs = 50;
  while (package_is_packed(pkg_id) && !waits_are_ended()) {
    const GMainLoopPtr loop(new_wait_loop());
    g_timeout_add_full(
        G_PRIORITY_DEFAULT, kCheckMs, end_wait, g_main_loop_ref(loop.get()),
        [](gpointer waited) { g_main_loop_unref(static_cast<GMainLoop *>(waited)); });
    run_nested_loop(loop.get());
  }
}

int restore(const std::string &pkg_id, package_info_h info, client_cb_data * /*record*/) {
  package_facts facts;
  int result = refuse_preloaded(info);
  if (result == QUARN_OK) result = read_version(info, &facts);
  if (result == QUARN_OK) result = read_root_path(info, &facts);
  if (result == QUARN_OK) {
    run_on_thread_stack([&] { recover_interrupted_restore(pkg_id.c_str(), facts.root.c_str()); });
    if (!read_device(&facts)) result = QUARN_REFUSED;
  }
  if (result != QUARN_OK) return result;

  RestoreContextPtr ctx = std::make_unique<pkg_restore_context>();
  ctx->serial = facts.serial;
  ctx->wait_for_result = true;
  ctx->pkgid = pkg_id;
  ctx->version = facts.version;
  ctx->root = facts.root;
  result = visit_applications(info, _check_restore_enabled, ctx.get());
  if (result == QUARN_OK) result = refuse_disabled(pkg_id, ctx->backup_enabled);
  if (result != QUARN_OK) return result;
  // The companion's archive is unpacked at once, where nothing can wait any more.
  if (restores_from_companion()) wait_while_packed(pkg_id);
  if (waits_are_ended()) return QUARN_CANCELLED;
  result = visit_applications(info, _package_cb_for_restore, ctx.get());
  const int restored = wait_for_restore(std::move(ctx));
  return result != QUARN_OK ? result : restored;
}

/** The record is lent. */
using Work = int (*)(const std::string &pkg_id, package_info_h info, client_cb_data *record);
/** Deletes the record. */
using Answer = int (*)(int err, const char *msg, void *record);

/** The frame of both requests: whatever happens, the client is told once. */
int serve(const char *id, std::unique_ptr<client_cb_data> record, Work work, Answer answer) {
  const std::string pkg_id = id == nullptr ? "" : id;
  if (!is_safe_path_component(pkg_id)) {
    LOGE("refused : not a package id (%s)", pkg_id.c_str());
    answer(QUARN_BAD_ARGUMENT, pkg_id.c_str(), record.release());
    return QUARN_BAD_ARGUMENT;
  }
  const PowerLock lock;
  if (waits_are_ended() || !cloud_initialized()) {
    answer(waits_are_ended() ? QUARN_CANCELLED : QUARN_NO_SESSION, pkg_id.c_str(),
           record.release());
    return QUARN_OK;
  }
  PackageInfoPtr info;
  const int result = package_manager_get_package_info(pkg_id.c_str(), out(info));
  if (result != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_get_package_info() failed : %d", result);
    answer(QUARN_BAD_ARGUMENT, pkg_id.c_str(), record.release());
    return QUARN_BAD_ARGUMENT;
  }
  const int outcome = work(pkg_id, info.get(), record.get());
  info.reset();
  answer(outcome, pkg_id.c_str(), record.release());
  return QUARN_OK;
}

std::unique_ptr<client_cb_data> owned(void *record) {
  return std::unique_ptr<client_cb_data>(static_cast<client_cb_data *>(record));
}

}  // namespace

int quarnd_backup_app_data(const char *pkg_id, void *record) {
  LOGI("quarnd_backup_app_data");
  return serve(pkg_id, owned(record), back_up, quarn_dbus_app_backup_complete);
}

int quarnd_restore_app_data(const char *pkg_id, void *record) {
  LOGI("quarnd_restore_app_data");
  return serve(pkg_id, owned(record), restore, quarn_dbus_app_restore_complete);
}
