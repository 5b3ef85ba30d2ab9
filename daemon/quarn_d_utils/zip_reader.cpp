#include <unzip.h>

#include <cstdint>
#include <cstdlib>
#include <string>

#include "log_scope.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/archive_check.h"
#include "quarn_d_utils/archive_index.h"
#include "quarn_d_utils/archive_input.h"
#include "quarn_d_utils/entry_reader.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/unpacker.h"
#include "quarn_log.h"

namespace {

/**
 * One entry, under the names and with the messages of its steps. 14 when memory is out, 31 when
 * the archive is not any more what it announced.
 */
int unpack_entry(Unpacker *unpacker, const OpenArchive &from, Announced *announced, CString *name,
                 unzip_report *report) {
  unzFile archive = from.handle.get();
  const int opened = unzOpenCurrentFile2(archive, nullptr, nullptr, kRawEntry);
  if (opened != UNZ_OK) {
    LOGE("unzOpenCurrentFile() failed, unz_err = [%d]", opened);
    ++report->failed;
    return QUARN_OK;
  }
  unz_file_info64 info = {};
  int asked = unzGetCurrentFileInfo64(archive, &info, nullptr, 0, nullptr, 0, nullptr, 0);
  if (asked != UNZ_OK) {
    LOGE("unzGetCurrentFileInfo() failed, unz_err = [%d]", asked);
    ++report->failed;
    return QUARN_OK;
  }
  name->reset(static_cast<char *>(std::calloc(info.size_filename + 1, 1)));
  if (*name == nullptr) {
    LOGE("calloc() failed, current_file_path_in_zip is NULL");
    return QUARN_OUT_OF_MEMORY;
  }
  asked = unzGetCurrentFileInfo64(archive, &info, name->get(), info.size_filename, nullptr, 0,
                                  nullptr, 0);
  if (asked != UNZ_OK) {
    LOGE("unzGetCurrentFileInfo() failed %s, unz_err = [%d]", name->get(), asked);
    ++report->failed;
    return QUARN_OK;
  }
  if (announced->add(info, name->get()) != nullptr) {
    LOGE("archive was changed while it was read");
    ++report->failed;
    return QUARN_UNREADABLE;
  }
  EntrySource source(from.file.get(), archive, info.compressed_size);
  switch (unpacker->extract(&source, info, name->get())) {
    case Extracted::kDone:
      ++report->extracted;
      return QUARN_OK;
    case Extracted::kFolder:
      return QUARN_OK;
    case Extracted::kRefused:
      ++report->refused;
      break;
    case Extracted::kFailed:
      ++report->failed;
      break;
  }
  LOGE("extract_file_from_zip() failed %s", name->get());
  return QUARN_OK;
}

/** Everything of an archive that was looked at; its first entry is the current one. */
int unpack_entries(const char *pkg_id, const char *destination, const OpenArchive &archive,
                   unzip_report *report) {
  const LogScope scope(std::string("the archive of ") + pkg_id);
  Unpacker unpacker(pkg_id, destination);
  Announced announced(archive.file->size());
  CString name;
  unz_global_info64 global = {};
  unzGetGlobalInfo64(archive.handle.get(), &global);
  std::uint64_t visited = 0;
  for (int at = UNZ_OK; at == UNZ_OK; at = unzGoToNextFile(archive.handle.get())) {
    ++visited;
    const int result = unpack_entry(&unpacker, archive, &announced, &name, report);
    unzCloseCurrentFile(archive.handle.get());
    if (result != QUARN_OK) return result;
  }
  // a directory that breaks off hides entries
  if (visited < global.number_entry) ++report->failed;
  return QUARN_OK;
}

/** @param[in,out] table must be whole where it is not null */
int unpack_archive(const char *pkg_id, const char *destination, const char *zip_path,
                   unzip_report *report, archived_table *table) {
  *report = {};
  const OpenArchive archive = open_archive(zip_path);
  if (archive.handle == nullptr) {
    LOGE("unzOpen() failed, unzf is NULL");
    return QUARN_UNREADABLE;
  }
  if (const char *why = look_at_archive(archive, pkg_id, table)) {
    LOGE("refused archive %s: %s", zip_path, why);
    return QUARN_UNREADABLE;
  }
  const int first = unzGoToFirstFile(archive.handle.get());
  if (first != UNZ_OK) {
    LOGE("unzGoToFirstFile() failed, unz_err = [%d]", first);
    return QUARN_UNREADABLE;
  }
  if (table != nullptr && *table != archived_table::whole) return QUARN_NO_FILE_INFO;
  return unpack_entries(pkg_id, destination, archive, report);
}

}  // namespace

int unzip_data(const char *pkg_id, const char *destination, const char *zip_path,
               unzip_report *report) {
  return unpack_archive(pkg_id, destination, zip_path, report, nullptr);
}

int unzip_data_with_table(const char *pkg_id, const char *destination, const char *zip_path,
                          unzip_report *report, archived_table *table) {
  *table = archived_table::none;
  return unpack_archive(pkg_id, destination, zip_path, report, table);
}

int unzip_data(const char *pkg_id, const char *destination, const char *zip_path) {
  unzip_report report;
  return unzip_data(pkg_id, destination, zip_path, &report);
}
