#include "quarn_d_utils/archive_index.h"

#include <algorithm>
#include <cstring>
#include <optional>
#include <utility>
#include <vector>

#include "files/package_files.h"
#include "files/tree_depth.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/entry_reader.h"
#include "quarn_d_utils/table_reader.h"
#include "quarn_d_utils/table_text.h"

namespace {

constexpr std::uint64_t kMostReadings = 2;
/** Some are counted again where the entries do not come in the order of a walk. */
constexpr std::uint64_t kMostFolders = 4 * kMaxArchiveEntries;

/** Directories in one another that an entry's name has, the data directory counted as one. */
int depth_of(const char *name) {
  constexpr char kShared[] = "shared/";
  const bool shared = std::strncmp(name, kShared, std::strlen(kShared)) == 0;
  return static_cast<int>(std::count(name, name + std::strlen(name), '/')) - (shared ? 1 : 0);
}

constexpr char kTableTooLarge[] = "its table is larger than a backup's can be";

/** Shows a table to those who look at it, as far as it was announced. */
class TableLook : public ByteSink {
 public:
  TableLook(TableText *table, std::uint64_t announced) : table_(table), left_(announced) {}
  bool write(const unsigned char *data, std::size_t size) override {
    if (size > left_) return false;
    left_ -= size;
    return table_->take(reinterpret_cast<const char *>(data), size);
  }

 private:
  TableText *table_;
  std::uint64_t left_;
};

/** Whether inflated, or as it is, an entry's bytes reach @p sink whole. */
bool read_entry(const OpenArchive &from, const unz_file_info64 &info, ByteSink *sink) {
  EntrySource source(from.file.get(), from.handle.get(), info.compressed_size);
  CodecTotals totals;
  CodecResult result = CodecResult::kCorrupt;
  if (is_stored(info)) {
    result = copy_stored(&source, sink, &totals);
  } else if (const auto codec = make_codec(CodecUse::kInflate)) {
    result = codec->inflate(&source, sink, &totals);
  }
  return result == CodecResult::kDone && totals.plain == info.uncompressed_size &&
         totals.crc == info.crc;
}

/**
 * Look at the archive's current entry, which is its table.
 * @param closely whether each of its values is to be JSON as well
 */
table_state look_at_table(const OpenArchive &from, const unz_file_info64 &info, bool closely) {
  if (info.uncompressed_size > kArchiveTableBounds.text) return table_state::beyond;
  if (form_refusal(info) != nullptr) return table_state::malformed;  // it is not unpacked either
  unzFile archive = from.handle.get();
  if (unzOpenCurrentFile2(archive, nullptr, nullptr, kRawEntry) != UNZ_OK)
    return table_state::malformed;
  TableReader reader(TableUse::check);
  TableText table(kArchiveTableBounds, closely ? &reader : nullptr);
  TableLook look(&table, info.uncompressed_size);
  const bool arrived = read_entry(from, info, &look);
  unzCloseCurrentFile(archive);
  if (table.end() == table_state::beyond) return table_state::beyond;
  return arrived ? table.end() : table_state::malformed;
}

}  // namespace

const char *Announced::add(const unz_file_info64 &info, const char *name) {
  ++entries_;
  names_ += info.size_filename;
  size_ += std::min<std::uint64_t>(info.uncompressed_size, kMaxUnpackedSize + 1);
  // A size that is a lie is read to the file's end, and costs its entry.
  read_ += std::min<std::uint64_t>(info.compressed_size, archive_size_);
  if (entries_ > kMaxArchiveEntries || size_ > kMaxUnpackedSize) {
    return "it unpacks to more than a backup can hold";
  }
  // Nothing says that what is read over and over comes to anything.
  if (read_ > kMostReadings * archive_size_) return "its entries lie over one another";
  folders_ += new_folders(name);
  if (folders_ > kMostFolders) return "its directories are more than a backup can hold";
  if (names_ > kMaxUnpackedSize) return "its names are longer than a backup's can be";
  if (depth_of(name) > kMaxDirDepth) return "its directories are deeper than a backup's can be";
  return nullptr;
}

/** Directories on the way to an entry that were not on the way to the one before. */
std::uint64_t Announced::new_folders(const char *name) {
  const std::string path = name;
  const auto differ = std::mismatch(path.begin(), path.end(), before_.begin(), before_.end());
  const auto count = std::count(differ.first, path.end(), '/');
  before_ = path;
  return static_cast<std::uint64_t>(count);
}

const char *look_at_archive(const OpenArchive &from, const char *pkg_id, archived_table *found) {
  const std::string table_name = archived_table_name(pkg_id);
  unzFile archive = from.handle.get();
  Announced announced(from.file->size());
  std::optional<std::pair<unz64_file_pos, unz_file_info64>> table;
  std::vector<char> name(kMaxNameSize + 1);
  for (int at = unzGoToFirstFile(archive); at == UNZ_OK; at = unzGoToNextFile(archive)) {
    unz_file_info64 info = {};
    if (unzGetCurrentFileInfo64(archive, &info, name.data(), name.size(), nullptr, 0, nullptr, 0) !=
        UNZ_OK) {
      break;
    }
    if (const char *why = announced.add(info, name.data())) return why;
    unz64_file_pos place = {};
    const bool is_table = table_name == name.data() && table_name.size() == info.size_filename;
    if (is_table && unzGetFilePos64(archive, &place) == UNZ_OK) {
      table.emplace(place, info);
    }
  }
  if (found != nullptr) *found = archived_table::none;
  if (!table || unzGoToFilePos64(archive, &table->first) != UNZ_OK) return nullptr;
  const table_state state = look_at_table(from, table->second, found != nullptr);
  if (state == table_state::beyond) return kTableTooLarge;
  if (found != nullptr) {
    *found = state == table_state::whole ? archived_table::whole : archived_table::malformed;
  }
  return nullptr;
}
