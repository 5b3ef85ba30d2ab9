#include "quarn_d_backup/package_archive.h"

#include <sys/stat.h>

#include <cstdint>
#include <string>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/package_trouble.h"
#include "quarn_d_backup/progress_report.h"
#include "quarn_d_backup/staged_archive.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/fiber.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_crc.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package.h"
#include "quarn_d_utils/path_rules.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_d_utils/zip_archive.h"
#include "quarn_log.h"

namespace {

constexpr int kMaxBackupMegabytes = kMaxBackupSize >> 20;
constexpr char kIndexSeparator = '/';  // in no id and no version

std::string crc_index_key(const std::string &pkg_id, const std::string &version) {
  return pkg_id + kIndexSeparator + version;
}

/** A size that is too large may be that of a folder that cannot be measured. */
void report_oversize(backup_context *ctx, backup_outcome outcome, std::uint64_t size,
                     std::uint64_t limit) {
  const backup_outcome trouble =
      size < kUnmeasurableSize ? backup_outcome::none : find_package_trouble(ctx->cur_root_path);
  if (trouble == backup_outcome::none) {
    report_package(ctx, outcome, size, limit);
  } else {
    report_package(ctx, trouble);
  }
}

/** What a package is told to be whose archive failed. */
backup_outcome outcome_of(archive_bound bound) {
  switch (bound) {
    case archive_bound::none:
      break;
    case archive_bound::content:
      return backup_outcome::too_large;
    case archive_bound::members:
      return backup_outcome::too_many_files;
    case archive_bound::names:
      return backup_outcome::names_too_long;
    case archive_bound::table:
      return backup_outcome::table_too_large;
    case archive_bound::depth:
      return backup_outcome::too_deep;
  }
  return backup_outcome::unreadable;
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
  archive_excess excess;
  // What is summed up, measured and sent is what was made, whatever its name leads to by then.
  const UniqueFd archive = make_archive(ctx->cur_pkg_id.c_str(), ctx->cur_root_path.c_str(),
                                        archive_path.c_str(), &error, kBackupBounds, &excess);
  if (error != QUARN_OK) {
    LOGE("fail to make zip data for %s", ctx->cur_pkg_id.c_str());
    delete_staged_file(archive_path);
    if (excess.bound != archive_bound::none) {
      report_package(ctx, outcome_of(excess.bound), excess.size, excess.limit);
      return QUARN_SKIPPED;
    }
    const backup_outcome trouble = find_package_trouble(ctx->cur_root_path);
    report_package(ctx, trouble == backup_outcome::none ? backup_outcome::unreadable : trouble);
    return error;
  }

  struct stat made = {};
  fstat(archive.get(), &made);
  const auto size = static_cast<std::uint64_t>(made.st_size);
  note_working_file(archive_path, archive.get());
  ctx->cur_crc = static_cast<std::int32_t>(get_open_file_crc(archive.get()));
  // 0 is what an unreadable archive and an unknown one have in common
  if (ctx->cur_crc != 0 && ctx->cur_crc == get_previous_crc_value(ctx)) {
    LOGI("same backup for (%s) already exist in cloud!(crc : %d)", ctx->cur_pkg_id.c_str(),
         ctx->cur_crc);
    delete_staged_file(archive_path);
    report_package(ctx, backup_outcome::unchanged, size);
    return QUARN_UNCHANGED;
  }
  LOGI("app data of (%s) was changed, so will be backed up", ctx->cur_pkg_id.c_str());
  ctx->bytes_to_upload += size;
  if (!ctx->single_package) add_to_app_data_upload_list(ctx);
  report_package(ctx, backup_outcome::none);
  return QUARN_OK;
}

}  // namespace

void enter_current_package(backup_context *ctx) {
  if (!ctx->current_pkg_list.empty() && ctx->current_pkg_list.back().pkg_id == ctx->cur_pkg_id) {
    return;
  }
  ctx->current_pkg_list.push_back({ctx->serial_number, ctx->cur_pkg_id, ctx->cur_version, "", 0});
}

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

void report_package(backup_context *ctx, backup_outcome outcome, std::uint64_t size,
                    std::uint64_t limit) {
  report_progress(ctx, backup_stage::archiving, ctx->cur_pkg_id.c_str(), outcome, size, limit);
}

int check_current_backup_size(backup_context *ctx) {
  parse_backup_path_xml(ctx->cur_pkg_id.c_str(), ctx->cur_pkg_type.c_str(),
                        ctx->cur_root_path.c_str());
  if (!backup_rules_usable()) {
    LOGE("rules file of (%s) cannot be used, so will not backup data", ctx->cur_pkg_id.c_str());
    report_package(ctx, backup_outcome::unusable_rules);
    return QUARN_REFUSED;
  }
  const std::uint64_t size = get_app_backup_size(ctx);
  const std::uint64_t available = get_dir_available_size(ctx->cur_root_path.c_str());
  LOGI("app backup size : %llu, available space size : %llu", static_cast<unsigned long long>(size),
       static_cast<unsigned long long>(available));
  if (size > available) {
    LOGE("app backup size(=%llu) exceed available space size(=%llu), so can not backup data",
         static_cast<unsigned long long>(size), static_cast<unsigned long long>(available));
    report_oversize(ctx, backup_outcome::no_space, size, available);
    return QUARN_SKIPPED;
  }
  if (size > kMaxBackupSize) {
    LOGI("app backup size exceed %dMB, so will not backup data", kMaxBackupMegabytes);
    report_oversize(ctx, backup_outcome::too_large, size, kMaxBackupSize);
    return QUARN_SKIPPED;
  }
  return QUARN_OK;
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
  for (const std::string &dir : package_files(ctx->cur_pkg_id, ctx->cur_root_path).data_dirs()) {
    size += get_dir_backup_size(dir.c_str(), ctx->cur_pkg_id.c_str(), ctx->cur_root_path.c_str());
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
