#include <algorithm>
#include <cstring>

#include "quarn_common.h"
#include "quarn_d_backup/run_private.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_log.h"

namespace {

constexpr const char *kDataDirs[] = {"/data", "/shared/data", "/shared/trusted"};
constexpr int kMaxBackupMegabytes = kMaxBackupSize >> 20;
constexpr char kIndexSeparator = '/';  // in no id and no version

std::string crc_index_key(const std::string &pkg_id, const std::string &version) {
  return pkg_id + kIndexSeparator + version;
}

/** What a package says of itself. */
struct package_values {
  CString id;
  CString version;
  CString type;
  CString root;
};

/** Read the values in order; false at the first that is missing. */
bool read_package_values(package_info_h info, package_values *values) {
  int ret = package_info_get_package(info, out(values->id));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_package() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->id) {
    LOGE("pkg_id is NULL");
    return false;
  }
  ret = package_info_get_version(info, out(values->version));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_version() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->version) {
    LOGE("pkg_version is NULL");
    return false;
  }
  ret = package_info_get_type(info, out(values->type));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_type() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->type) {
    LOGE("pkg_type is NULL");
    return false;
  }
  ret = package_info_get_root_path(info, out(values->root));
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_get_root_path() was failed, ret = [%d]", ret);
    return false;
  }
  if (!values->root) {
    LOGE("pkg_root_path is NULL");
    return false;
  }
  return true;
}

void enter_current_package(backup_context *ctx) {
  if (!ctx->current_pkg_list.empty() && ctx->current_pkg_list.back().pkg_id == ctx->cur_pkg_id) {
    return;
  }
  ctx->current_pkg_list.push_back({ctx->serial_number, ctx->cur_pkg_id, ctx->cur_version, "", 0});
}

/** Undo what the current package's archive brought about: the package will not be listed. */
void withdraw_current_package(backup_context *ctx) {
  if (!ctx->upload_list.empty() && ctx->upload_list.back().pkg_id == ctx->cur_pkg_id) {
    delete_staged_file(staged_archive_path(ctx->cur_root_path, ctx->cur_pkg_id));
    release_staged_archive(ctx, ctx->cur_pkg_id);
    ctx->upload_list.pop_back();
  }
  if (!ctx->current_pkg_list.empty() && ctx->current_pkg_list.back().pkg_id == ctx->cur_pkg_id) {
    ctx->current_pkg_list.pop_back();
  }
}

/** A package that is installed but cannot be examined now: its backup stays as it is. */
void keep_unexamined(backup_context *ctx, const char *pkg_id) {
  if (pkg_id != nullptr && is_safe_path_component(pkg_id)) {
    ctx->unexamined_pkg_ids.emplace_back(pkg_id);
  } else if (pkg_id == nullptr) {
    ctx->package_walk_complete = false;
  }
}

/**
 * What stays in the cloud stays in the list: the last list's entries of
 * packages that could not be examined.
 */
void list_unexamined_packages(backup_context *ctx) {
  if (ctx->package_walk_complete && ctx->unexamined_pkg_ids.empty()) return;
  std::vector<std::string> listed;
  listed.reserve(ctx->current_pkg_list.size());
  for (const pkg_information &package : ctx->current_pkg_list) listed.push_back(package.pkg_id);
  std::sort(listed.begin(), listed.end());
  std::sort(ctx->unexamined_pkg_ids.begin(), ctx->unexamined_pkg_ids.end());
  for (const pkg_information &previous : ctx->previous_pkg_list) {
    if (std::binary_search(listed.begin(), listed.end(), previous.pkg_id)) continue;
    if (!ctx->package_walk_complete ||
        std::binary_search(ctx->unexamined_pkg_ids.begin(), ctx->unexamined_pkg_ids.end(),
                           previous.pkg_id)) {
      add_pkg_info_to_app_list(ctx, previous.pkg_id.c_str(), previous.version.c_str(),
                               previous.crc);
    }
  }
}

bool any_directory_unreadable(const std::string &root) {
  return std::any_of(std::begin(kDataDirs), std::end(kDataDirs), [&](const char *dir) {
    return safe_opendir((root + dir).c_str()) == nullptr;
  });
}

void report_package(backup_context *ctx, backup_outcome outcome, std::uint64_t size = 0,
                    std::uint64_t limit = 0) {
  report_progress(ctx, backup_stage::archiving, ctx->cur_pkg_id.c_str(), outcome, size, limit);
}

/** make_app_data_zip() between taking the staged archive and settling what becomes of it. */
int make_staged_archive(backup_context *ctx, const std::string &archive_path) {
  if (app_data_storage_is_external(ctx->cur_pkg_id.c_str())) {
    LOGI("current storage of (%s) is external, so will not be backed up", ctx->cur_pkg_id.c_str());
    report_package(ctx, backup_outcome::external);
    return QUARN_SKIPPED;
  }
  const int skipped = check_current_backup_size(ctx);
  if (skipped != QUARN_OK) return skipped;

  int error = QUARN_OK;
  make_zip_data(ctx->cur_pkg_id.c_str(), ctx->cur_root_path.c_str(), archive_path.c_str(), &error,
                kMaxBackupSize);
  if (error != QUARN_OK) {
    LOGE("fail to make zip data for %s", ctx->cur_pkg_id.c_str());
    delete_staged_file(archive_path);
    report_package(ctx, backup_outcome::unreadable);
    return error;
  }

  ctx->cur_crc = static_cast<std::int32_t>(get_file_crc(archive_path.c_str()));
  // 0 is what an unreadable archive and an unknown one have in common
  if (ctx->cur_crc != 0 && ctx->cur_crc == get_previous_crc_value(ctx)) {
    LOGI("same backup for (%s) already exist in cloud!(crc : %d)", ctx->cur_pkg_id.c_str(),
         ctx->cur_crc);
    const std::uint64_t size = staged_file_size(archive_path);
    delete_staged_file(archive_path);
    report_package(ctx, backup_outcome::unchanged, size);
    return QUARN_UNCHANGED;
  }
  LOGI("app data of (%s) was changed, so will be backed up", ctx->cur_pkg_id.c_str());
  ctx->bytes_to_upload += staged_file_size(archive_path);
  if (!ctx->single_package) add_to_app_data_upload_list(ctx);
  report_package(ctx, backup_outcome::none);
  return QUARN_OK;
}

}  // namespace

int check_current_backup_size(backup_context *ctx) {
  parse_backup_path_xml(ctx->cur_pkg_id.c_str(), ctx->cur_pkg_type.c_str(),
                        ctx->cur_root_path.c_str());
  const std::uint64_t size = get_app_backup_size(ctx);
  const std::uint64_t available = get_dir_available_size(ctx->cur_root_path.c_str());
  LOGI("app backup size : %llu, available space size : %llu", static_cast<unsigned long long>(size),
       static_cast<unsigned long long>(available));
  if (size > available) {
    LOGE("app backup size(=%llu) exceed available space size(=%llu), so can not backup data",
         static_cast<unsigned long long>(size), static_cast<unsigned long long>(available));
    report_package(ctx, backup_outcome::no_space, size, available);
    return QUARN_SKIPPED;
  }
  if (size > kMaxBackupSize) {
    LOGI("app backup size exceed %dMB, so will not backup data", kMaxBackupMegabytes);
    if (any_directory_unreadable(ctx->cur_root_path)) {
      report_package(ctx, backup_outcome::unreadable);
    } else {
      report_package(ctx, backup_outcome::too_large, size, kMaxBackupSize);
    }
    return QUARN_SKIPPED;
  }
  return QUARN_OK;
}

int make_backup_items(backup_context *ctx) {
  forget_single_uploads();
  if (!create_app_list_info(ctx)) return QUARN_FAILED;
  const int ret = package_manager_foreach_package_info(foreach_package_info_callback, ctx);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_manager_foreach_package_info() failed %d", ret);
    ctx->package_walk_complete = false;
  }
  list_unexamined_packages(ctx);
  save_app_list_to_file(ctx);
  return QUARN_OK;
}

bool foreach_package_info_callback(package_info_h info, void *user_data) {
  auto *ctx = static_cast<backup_context *>(user_data);
  bool preload = false;
  int ret = package_info_is_preload_package(info, &preload);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_is_preload_package fail, err = [%d]", ret);
    keep_unexamined(ctx, nullptr);
    return true;
  }
  if (preload) return true;

  package_values values;
  if (!read_package_values(info, &values)) {
    keep_unexamined(ctx, values.id.get());
    return true;
  }
  if (!is_safe_path_component(values.id.get()) || !is_safe_path_component(values.version.get())) {
    LOGE("refused package with unsafe id or version : (%s), (%s)", values.id.get(),
         values.version.get());
    keep_unexamined(ctx, values.id.get());
    return true;
  }

  ++ctx->packages_examined;
  ctx->zip_made = false;
  ctx->cur_pkg_id = values.id.get();
  ctx->cur_version = values.version.get();
  ctx->cur_pkg_type = values.type.get();
  ctx->cur_root_path = values.root.get();
  ctx->cur_backup_enabled = true;
  ctx->cur_crc = 0;

  ret = package_info_foreach_app_from_package(info, PACKAGE_INFO_ALLAPP, check_backup_enabled, ctx);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_foreach_app_from_package() fail, err = [%d]", ret);
    keep_unexamined(ctx, ctx->cur_pkg_id.c_str());
    return true;
  }
  if (ctx->cur_backup_enabled) {
    LOGI("backup enabled for (%s)", ctx->cur_pkg_id.c_str());
  } else {
    LOGI("backup disabled for (%s)", ctx->cur_pkg_id.c_str());
    report_package(ctx, backup_outcome::disabled);
  }

  ret = package_info_foreach_app_from_package(
      info, PACKAGE_INFO_ALLAPP, ctx->for_pellix ? pellix_app_info_foreach_cb : app_info_foreach_cb,
      ctx);
  if (ret != PACKAGE_MANAGER_ERROR_NONE) {
    LOGE("package_info_foreach_app_from_package() fail, err = [%d]", ret);
    withdraw_current_package(ctx);
    keep_unexamined(ctx, ctx->cur_pkg_id.c_str());
    return true;
  }
  if (ctx->abandoned) return false;
  enter_current_package(ctx);
  LOGI("add (%s) to package list", ctx->cur_pkg_id.c_str());
  add_pkg_info_to_app_list(ctx, ctx->cur_pkg_id.c_str(), ctx->cur_version.c_str(), ctx->cur_crc);
  return true;
}

bool check_backup_enabled(package_info_app_component_type_e, const char *app_id, void *user_data) {
  if (!backup_enabled_app(app_id)) {
    static_cast<backup_context *>(user_data)->cur_backup_enabled = false;
  }
  return true;
}

bool app_info_foreach_cb(package_info_app_component_type_e, const char *app_id, void *user_data) {
  auto *ctx = static_cast<backup_context *>(user_data);
  if (!ctx->cur_backup_enabled || ctx->zip_made) return true;
  ctx->zip_made = true;
  make_app_data_zip(ctx, app_id);
  return true;
}

int make_app_data_zip(backup_context *ctx, const char *) {
  if (!is_safe_path_component(ctx->cur_pkg_id) || !is_safe_path_component(ctx->cur_version)) {
    LOGE("refused package with unsafe id or version : (%s), (%s)", ctx->cur_pkg_id.c_str(),
         ctx->cur_version.c_str());
    return QUARN_REFUSED;
  }
  const std::string archive_path = staged_archive_path(ctx->cur_root_path, ctx->cur_pkg_id);
  enter_current_package(ctx);
  if (!acquire_staged_archive(ctx, ctx->cur_pkg_id)) return QUARN_REFUSED;
  int ret = QUARN_FAILED;
  run_on_thread_stack([&] { ret = make_staged_archive(ctx, archive_path); });
  if (ret != QUARN_OK) release_staged_archive(ctx, ctx->cur_pkg_id);
  return ret;
}

std::uint64_t get_app_backup_size(backup_context *ctx) {
  std::uint64_t size = 0;
  for (const char *dir : kDataDirs) {
    size += get_dir_backup_size((ctx->cur_root_path + dir).c_str(), ctx->cur_pkg_id.c_str(),
                                ctx->cur_root_path.c_str());
  }
  return size;
}

int get_previous_crc_value(backup_context *ctx) {
  for (; ctx->previous_crc_indexed < ctx->previous_pkg_list.size(); ++ctx->previous_crc_indexed) {
    const pkg_information &previous = ctx->previous_pkg_list[ctx->previous_crc_indexed];
    ctx->previous_crc_index.emplace(crc_index_key(previous.pkg_id, previous.version), previous.crc);
  }
  const auto known = ctx->previous_crc_index.find(crc_index_key(ctx->cur_pkg_id, ctx->cur_version));
  return known != ctx->previous_crc_index.end() ? known->second : 0;
}

void add_to_app_data_upload_list(backup_context *ctx) {
  ctx->upload_list.push_back(
      {ctx->serial_number, ctx->cur_pkg_id, ctx->cur_version, ctx->cur_root_path, 0});
}
