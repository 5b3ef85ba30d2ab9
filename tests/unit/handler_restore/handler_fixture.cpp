#include "handler_fixture.h"
#include "quarn_d_utils/cloud_session.h"

#include <Ecore.h>

#include <cstring>
#include <filesystem>

#include "quarn_d_restore/quarn_d_restore.h"

FakeSession session;

bool cloud_initialized() {
  ++session.asked;
  if (session.meanwhile) {
    const auto action = std::exchange(session.meanwhile, nullptr);
    action();
  }
  return session.ready;
}
backup_trans_handle_h cloud_handler() { return nullptr; }

namespace {
char a_handle[1];
}

extern "C" Ecore_Timer *ecore_timer_add(double, Ecore_Task_Cb, const void *) {
  return reinterpret_cast<Ecore_Timer *>(a_handle);
}
extern "C" void *ecore_timer_del(Ecore_Timer *) { return nullptr; }

HandlerTest::HandlerTest() {
  session = FakeSession{};
  ON_CALL(platform, package_manager_get_package_info).WillByDefault([](auto, auto *info) {
    *info = reinterpret_cast<package_info_h>(a_handle);
    return 0;
  });
  ON_CALL(platform, package_info_get_root_path).WillByDefault([this](auto, char **path) {
    *path = strdup(root.c_str());
    return 0;
  });
  ON_CALL(platform, package_info_get_version).WillByDefault([](auto, char **text) {
    *text = strdup(kVersion);
    return 0;
  });
  ON_CALL(platform, package_info_get_type).WillByDefault([](auto, char **text) {
    *text = strdup("tpk");
    return 0;
  });
  ON_CALL(platform, package_info_is_preload_package).WillByDefault([](auto, bool *preload) {
    *preload = false;
    return 0;
  });
  ON_CALL(platform, package_info_foreach_app_from_package)
      .WillByDefault([this](auto, auto type, auto callback, void *data) {
        for (const auto &app : apps) EXPECT_TRUE(callback(type, app.c_str(), data));
        return 0;
      });
  ON_CALL(platform, pkgmgrinfo_appinfo_get_appinfo).WillByDefault([](auto, auto *handle) {
    *handle = a_handle;
    return 0;
  });
  ON_CALL(platform, pkgmgrinfo_appinfo_get_api_version).WillByDefault([](auto, char **text) {
    static char version[] = "4.0";
    *text = version;
    return 0;
  });
  ON_CALL(platform, pkgmgrinfo_appinfo_get_metadata_value)
      .WillByDefault([this](auto, auto, char **value) {
        static char disable[] = "disable";
        if (!opted_out) return PMINFO_R_ENOENT;
        *value = disable;
        return PMINFO_R_OK;
      });
  ON_CALL(platform, package_manager_create).WillByDefault([](auto *handle) {
    *handle = reinterpret_cast<package_manager_h>(a_handle);
    return 0;
  });
  ON_CALL(platform, package_manager_set_event_cb).WillByDefault([this](auto, auto callback, auto) {
    subscriptions.push_back(callback);
    return 0;
  });
  ON_CALL(transport, backup_trans_upload_file_ors_async)
      .WillByDefault([this](auto, const char *local, const char *remote,
                            backup_trans_upload_cb callback, auto, auto, void *data, auto) {
        // What the descriptor that is handed over holds.
        const std::string held = std::filesystem::read_symlink(local).string();
        if (upload_result == 0) uploads.push_back({held, remote, data, callback});
        return upload_result;
      });
}

HandlerTest::~HandlerTest() {
  quarnd_restore_enable(0, 0, "", "", nullptr);
  while (!uploads.empty()) answer_upload(BACKUP_TRANS_ERROR_CANCELLED);
  run_pending();
}

void HandlerTest::later(std::function<void()> action) {
  auto *call = new std::function<void()>(std::move(action));
  g_idle_add(
      [](gpointer data) {
        const std::unique_ptr<std::function<void()>> owned(
            static_cast<std::function<void()> *>(data));
        (*owned)();
        return static_cast<gboolean>(G_SOURCE_REMOVE);
      },
      call);
}

void HandlerTest::answer_upload(backup_trans_error_code error) {
  ASSERT_FALSE(uploads.empty());
  const Upload upload = uploads.front();
  uploads.erase(uploads.begin());
  upload.callback(error, upload.user_data, nullptr);
}
