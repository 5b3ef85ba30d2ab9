#include "files/package_files.h"

#include <cstring>
#include <string_view>

#include "backup_transport.h"
#include "quarn_common.h"

namespace {

constexpr std::string_view kPartPrefix = BACKUP_TRANS_TEMPORARY_PREFIX;
constexpr char kNativeType[] = "tpk";
constexpr char kRulesFile[] = "res/backup.path.xml";
constexpr char kWebRulesFile[] = "res/wgt/res/backup.path.xml";
constexpr char kArchiveSuffix[] = ".zip";
constexpr char kExportDir[] = "/tmp/";
constexpr char kExportSuffix[] = "_tmp.zip";
constexpr char kCompanionList[] = "app_list.txt";

}  // namespace

bool is_safe_path_component(const std::string &text) {
  return !text.empty() && text != "." && text != ".." && text.find('/') == std::string::npos &&
         text.find('\0') == std::string::npos;
}

bool is_part_name(const char *name) {
  return std::strncmp(name, kPartPrefix.data(), kPartPrefix.size()) == 0;
}

const char *rules_file_of(const std::string &type) {
  return type == kNativeType ? kRulesFile : kWebRulesFile;
}

const char *rules_file_of_others(const std::string &type) {
  return type == kNativeType ? kWebRulesFile : kRulesFile;
}

std::string archived_table_name(const std::string &pkg_id) {
  return std::string(kSharedDataDir) + "/" + pkg_id + ".perm";
}

std::string cloud_package_folder(const std::string &serial, const std::string &pkg_id) {
  return "/" + serial + "/" + pkg_id;
}

std::string cloud_version_folder(const std::string &serial, const std::string &pkg_id,
                                 const std::string &version) {
  return cloud_package_folder(serial, pkg_id) + "/" + version;
}

std::string cloud_archive(const std::string &serial, const std::string &pkg_id,
                          const std::string &version) {
  return cloud_version_folder(serial, pkg_id, version) + "/" + pkg_id + kArchiveSuffix;
}

std::string exported_archive(const std::string &pkg_id) {
  return kExportDir + pkg_id + kExportSuffix;
}

std::string companion_folder() {
  return std::string(kAppsDir) + kPellixPackage + "/" + kSharedDataDir + "/";
}

std::string companion_archive_name(const std::string &pkg_id, const std::string &version) {
  return pkg_id + "_" + version + kArchiveSuffix;
}

std::string companion_list() { return companion_folder() + kCompanionList; }

package_files::package_files(const std::string &pkg_id, const std::string &root)
    : id_(pkg_id),
      root_(root),
      folder_(root + "/" + kSharedDataDir),
      upload_(folder_ + "/" + pkg_id + "_upload.zip"),
      download_(folder_ + "/" + pkg_id + "_download.zip"),
      snapshot_(folder_ + "/quarn_tmp_rst_dir") {}

std::array<std::string, kDataDirs.size()> package_files::data_dirs() const {
  std::array<std::string, kDataDirs.size()> dirs;
  for (std::size_t i = 0; i < dirs.size(); ++i) dirs[i] = root_ + "/" + kDataDirs[i];
  return dirs;
}

std::string package_files::table() const { return root_ + "/" + archived_table_name(id_); }

snapshot_files::snapshot_files(const std::string &pkg_id, const std::string &snapshot)
    : table(snapshot + "/" + archived_table_name(pkg_id)),
      unfinished_table(snapshot + "/table"),
      stamps(snapshot + "/stamps"),
      unpacked(snapshot + "/unpacked"),
      told(snapshot + "/told") {}
