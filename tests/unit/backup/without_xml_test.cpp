#include <dlfcn.h>
#include <json-c/json.h>

#include <cstring>
#include <filesystem>

#include "backup_device.h"
#include "lazy_xml.h"
#include "quarn_d_backup/app_list.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/changes.h"
#include "quarn_d_backup/package_archive.h"
#include "quarn_d_backup/pellix.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/path_rules.h"
#include "rules/rules_file.h"

extern "C" {
void *__real_dlopen(const char *name, int flags);
// A device on which the library is missing, or is not whole.
void *__wrap_dlopen(const char *name, int flags) {
  if (name != nullptr && std::strncmp(name, "libxml2", std::strlen("libxml2")) == 0) return nullptr;
  return __real_dlopen(name, flags);
}
}

namespace {

using ::testing::IsEmpty;

class WithoutXml : public BackupDevice {};

TEST_F(WithoutXml, TheLibraryIsNamed) { EXPECT_STREQ(missing_xml_library(), "libxml2.so.2"); }

TEST_F(WithoutXml, APackageWithRulesIsNotBackedUp) {
  const FakePackage &app = install("org.app");
  std::filesystem::create_directories(app.root + "/res");
  write_text(app.root + "/res/backup.path.xml", "<backup><exclude path=\"data/\"/></backup>");
  const BackupContextPtr ctx(new backup_context);
  ctx->serial_number = kSerial;
  ctx->model_name = "Model One";
  EXPECT_EQ(make_backup_items(ctx.get()), 0);
  EXPECT_TRUE(ctx->upload_list.empty());
  EXPECT_FALSE(exists(app.staged()));
  EXPECT_EQ(backup_rules_state(), rules_state::no_library);
  EXPECT_EQ(count_logged(DLOG_ERROR,
                         "rules file of (org.app) cannot be used: libxml2.so.2 cannot be loaded"),
            1);
}

TEST_F(WithoutXml, APackageWithoutRulesIsBackedUp) {
  install("org.app");
  const BackupContextPtr ctx(new backup_context);
  ctx->serial_number = kSerial;
  ctx->model_name = "Model One";
  EXPECT_EQ(make_backup_items(ctx.get()), 0);
  EXPECT_EQ(ctx->upload_list.size(), 1U);
}

TEST_F(WithoutXml, TheCompanionGetsNoArchiveOfAPackageWithRules) {
  const FakePackage &app = install("org.app");
  std::filesystem::create_directories(app.root + "/res");
  write_text(app.root + "/res/backup.path.xml", "<backup><exclude path=\"data/\"/></backup>");
  const BackupContextPtr ctx(new backup_context);
  ctx->for_pellix = true;
  ctx->cur_pkg_id = app.id;
  ctx->cur_version = app.version;
  ctx->cur_pkg_type = app.type;
  ctx->cur_root_path = app.root;
  ctx->cur_backup_enabled = true;
  ASSERT_TRUE(create_app_list_info(ctx.get()));
  EXPECT_TRUE(pellix_app_info_foreach_cb(PACKAGE_INFO_UIAPP, "org.app", ctx.get()));
  EXPECT_EQ(json_object_array_length(ctx->app_data_path), 0U);
}

}  // namespace
