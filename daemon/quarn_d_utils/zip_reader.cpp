#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>
#include <unzip.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "log_scope.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/archive_check.h"
#include "quarn_d_utils/archive_entry.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/table_reader.h"
#include "quarn_d_utils/unpacked_file.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kTableMode = 0600;
constexpr mode_t kFolderMode = 0755;
constexpr int kStored = 0;
constexpr int kRaw = 1;
// A snapshot holds the data directories: only there can an unpacking be undone.
constexpr char kNoData[] = "it does not belong to the application's data";
constexpr char kWorkingFile[] = "it is a working file of a restore";

enum class Extracted { kDone, kFolder, kRefused, kFailed };

/**
 * The archive file under minizip. Two pieces of it are in memory: one of the entries and one of
 * the directory behind them, between which minizip goes to and fro.
 */
class ArchiveFile {
 public:
  ArchiveFile(UniqueFd fd, std::uint64_t size) : fd_(std::move(fd)), size_(size) {}
  ArchiveFile(const ArchiveFile &) = delete;
  ArchiveFile &operator=(const ArchiveFile &) = delete;

  std::uint64_t size() const { return size_; }

  /** The file for minizip, which never writes or closes it. */
  zlib_filefunc64_def functions() {
    zlib_filefunc64_def table = {};
    table.zopen64_file = [](voidpf self, const void *, int) { return self; };
    table.zread_file = [](voidpf, voidpf self, void *data, uLong size) -> uLong {
      return of(self)->read(static_cast<unsigned char *>(data), size);
    };
    table.zwrite_file = [](voidpf, voidpf, const void *, uLong) -> uLong { return 0; };
    table.ztell64_file = [](voidpf, voidpf self) -> ZPOS64_T { return of(self)->position_; };
    table.zseek64_file = [](voidpf, voidpf self, ZPOS64_T offset, int origin) -> long {
      ArchiveFile *file = of(self);
      file->position_ = offset + (origin == ZLIB_FILEFUNC_SEEK_CUR   ? file->position_
                                  : origin == ZLIB_FILEFUNC_SEEK_END ? file->size_
                                                                     : 0);
      return 0;
    };
    table.zclose_file = [](voidpf, voidpf) -> int { return 0; };
    table.zerror_file = [](voidpf, voidpf self) -> int { return of(self)->failed_ ? 1 : 0; };
    table.opaque = this;
    return table;
  }

  /** At most @p size bytes from @p offset: 0 at the end, -1 on failure. */
  long read_at(std::uint64_t offset, unsigned char *data, std::size_t size) {
    for (Piece &piece : pieces_) {
      if (offset - piece.start < piece.size) return copy(&piece, offset, data, size);
    }
    if (size >= kPiece) return fetch(offset, data, size);
    Piece &piece = pieces_[last_used_ == &pieces_[0] ? 1 : 0];
    piece.size = 0;
    // from a whole multiple on: minizip looks for the end record step by step backwards
    piece.start = offset - offset % kPiece;
    const long count = fetch(piece.start, piece.data, kPiece);
    if (count < 0) return count;
    piece.size = static_cast<std::size_t>(count);
    return offset - piece.start < piece.size ? copy(&piece, offset, data, size) : 0;
  }

 private:
  static constexpr std::size_t kPiece = 64U << 10;
  struct Piece {
    std::uint64_t start = 0;
    std::size_t size = 0;
    unsigned char data[kPiece];
  };

  static ArchiveFile *of(voidpf self) { return static_cast<ArchiveFile *>(self); }

  std::size_t read(unsigned char *data, std::size_t size) {
    std::size_t done = 0;
    while (done < size) {
      const long count = read_at(position_, data + done, size - done);
      if (count <= 0) break;
      done += static_cast<std::size_t>(count);
      position_ += static_cast<std::uint64_t>(count);
    }
    return done;
  }

  long copy(Piece *piece, std::uint64_t offset, unsigned char *data, std::size_t size) {
    last_used_ = piece;
    const auto at = static_cast<std::size_t>(offset - piece->start);
    const std::size_t count = std::min(size, piece->size - at);
    std::memcpy(data, piece->data + at, count);
    return static_cast<long>(count);
  }

  long fetch(std::uint64_t offset, unsigned char *data, std::size_t size) {
    if (offset >= size_) return 0;
    const ssize_t count =
        TEMP_FAILURE_RETRY(pread(fd_.get(), data, size, static_cast<off_t>(offset)));
    if (count < 0) failed_ = true;
    return count;
  }

  UniqueFd fd_;
  std::uint64_t size_;
  std::uint64_t position_ = 0;
  bool failed_ = false;
  Piece *last_used_ = nullptr;
  Piece pieces_[2];
};

/** The raw bytes of the archive's current entry. */
class EntrySource : public ByteSource {
 public:
  EntrySource(ArchiveFile *file, unzFile archive, std::uint64_t size)
      : file_(file), offset_(unzGetCurrentFileZStreamPos64(archive)), left_(size) {}
  long read(unsigned char *data, std::size_t size, bool *end) override {
    const long count = file_->read_at(offset_, data, std::min<std::uint64_t>(size, left_));
    if (count < 0) return -1;
    offset_ += static_cast<std::uint64_t>(count);
    left_ -= static_cast<std::uint64_t>(count);
    *end = left_ == 0 || count == 0;
    return count;
  }

 private:
  ArchiveFile *file_;
  std::uint64_t offset_;
  std::uint64_t left_;
};

/** The same through minizip, which counts their checksum: for an archive that somebody else opened.
 */
class LibrarySource : public ByteSource {
 public:
  explicit LibrarySource(unzFile archive) : archive_(archive) {}
  long read(unsigned char *data, std::size_t size, bool *end) override {
    const int count = unzReadCurrentFile(archive_, data, static_cast<unsigned int>(size));
    *end = count <= 0;
    return count;
  }

 private:
  unzFile archive_;
};

/** A new file that takes no more than its entry announced. */
class FileSink : public ByteSink {
 public:
  FileSink(int fd, std::uint64_t announced) : fd_(fd), left_(announced) {}
  bool write(const unsigned char *data, std::size_t size) override {
    if (size > left_) {
      too_long_ = true;
      return false;
    }
    left_ -= size;
    while (size > 0) {
      const ssize_t count = TEMP_FAILURE_RETRY(::write(fd_, data, size));
      if (count <= 0) return false;
      data += count;
      size -= static_cast<std::size_t>(count);
    }
    return true;
  }
  bool too_long() const { return too_long_; }

 private:
  int fd_;
  std::uint64_t left_;
  bool too_long_ = false;
};

/** What is wrong with an entry whatever its name is; null: nothing. */
const char *form_refusal(const unz_file_info64 &info) {
  if (info.compression_method != Z_DEFLATED && info.compression_method != kStored) {
    return "its compression is not known";
  }
  if ((info.flag & 1U) != 0) return "it is encrypted";
  return nullptr;
}

/** A stored entry: its bytes as they are. */
CodecResult copy_stored(ByteSource *source, ByteSink *sink, CodecTotals *totals) {
  constexpr std::size_t kChunk = 16U << 10;
  unsigned char chunk[kChunk];
  *totals = {};
  for (bool end = false; !end;) {
    const long count = source->read(chunk, sizeof chunk, &end);
    if (count < 0) return CodecResult::kSourceFailed;
    const auto size = static_cast<std::size_t>(count);
    totals->crc = codec_crc32(totals->crc, chunk, size);
    totals->plain += size;
    if (size > 0 && !sink->write(chunk, size)) return CodecResult::kSinkFailed;
  }
  return CodecResult::kDone;
}

/**
 * Puts the entries of one archive below one root. While it lives the thread acts as the package's
 * user, to whom all but the table belongs from the beginning.
 */
class Unpacker {
 public:
  Unpacker(const char *pkg_id, const char *destination)
      : destination_(destination),
        working_(pkg_id, destination),
        table_(working_.table().substr(destination_.size() + 1)),
        root_(safe_open(destination, O_PATH | O_DIRECTORY)),
        user_(user_of_package()),
        acting_(user_) {}

  Extracted extract(ByteSource *source, const unz_file_info64 &info, const char *name) {
    const std::size_t length = std::strlen(name);
    if (length > 0 && name[length - 1] == '/' && info.uncompressed_size == 0) {
      make_folder(name, info);
      return Extracted::kFolder;
    }
    const char *why = refusal(name, info);
    if (why != nullptr) return refuse(name, why);
    const std::string path = name;
    const auto slash = path.rfind('/');
    const int parent = open_parent(path.substr(0, slash));
    if (parent < 0 && (errno == ELOOP || errno == ENOTDIR)) {
      return refuse(
          name, errno == ELOOP ? "its way leads through a link" : "its way leads through a file");
    }
    if (codec_ == nullptr) codec_ = make_codec(CodecUse::kInflate);
    if (codec_ == nullptr) {
      LOGE("calloc() failed, buf is NULL");
      return Extracted::kFailed;
    }
    UniqueFd file = create(parent, path, slash + 1);
    if (!file) {
      LOGE("fopen() failed, file is NULL %s", (destination_ + "/" + path).c_str());
      return Extracted::kFailed;
    }
    return write(source, info, &file, path);
  }

 private:
  /** A folder's own entry, of an archive that another program made: without it nothing is lost. */
  void make_folder(const char *name, const unz_file_info64 &info) {
    std::string path = name;
    path.pop_back();
    const char *why = path.size() + 1 != info.size_filename ? "its name holds a NUL"
                      // a folder there would keep the table out for good
                      : path == table_            ? kWorkingFile
                      : is_data_place(path + "/") ? name_refusal(path)
                                                  : kNoData;
    if (why != nullptr) {
      refuse(name, why);
      return;
    }
    if (open_parent(path) < 0) {
      LOGE("fail to make folder %s : %d", (destination_ + "/" + path).c_str(), errno);
    }
  }

  /** True for what lies in a data directory, and for such a directory and those that hold one. */
  static bool is_data_place(const std::string &path) {
    return std::any_of(kDataDirs.begin(), kDataDirs.end(), [&](const std::string &dir) {
      const std::string inside = dir + "/";
      return path.compare(0, inside.size(), inside) == 0 ||
             inside.compare(0, path.size(), path) == 0;
    });
  }

  static Extracted refuse(const char *name, const char *why) {
    LOGE("refused archive entry %s: %s", name, why);
    return Extracted::kRefused;
  }

  const char *refusal(const char *name, const unz_file_info64 &info) const {
    const std::string path = name;
    if (path.size() != info.size_filename) return "its name holds a NUL";
    if (!path.empty() && path.back() == '/') return "it is a directory";
    if (const char *why = name_refusal(path)) return why;
    if (std::none_of(kDataDirs.begin(), kDataDirs.end(), [&](const char *dir) {
          const std::size_t length = std::strlen(dir);
          return path.compare(0, length, dir) == 0 && path.size() > length && path[length] == '/';
        })) {
      return kNoData;
    }
    return form_refusal(info);
  }

  /** What is wrong with a name wherever it lies. */
  const char *name_refusal(const std::string &path) const {
    if (path.empty() || path.front() == '/') return "its name is absolute or empty";
    for (std::size_t start = 0; start <= path.size();) {
      const std::size_t end = std::min(path.find('/', start), path.size());
      if (!is_safe_path_component(path.substr(start, end - start))) {
        return "its name leaves its place";
      }
      start = end + 1;
    }
    if (path.compare(0, table_.size() + 1, table_ + "/") == 0) return kWorkingFile;
    if (working_.contain(destination_ + "/" + path)) return kWorkingFile;
    return nullptr;
  }

  /** The folder of an entry, made when missing; the last one is kept open. -1 with errno. */
  int open_parent(const std::string &folder) {
    constexpr int kFlags = O_PATH | O_DIRECTORY;
    if (parent_ && folder == parent_name_) return parent_.get();
    UniqueFd known = open_below_as_package(root_.get(), folder.c_str(), kFlags, 0, user_, nullptr);
    if (known) {
      parent_ = std::move(known);
      parent_name_ = folder;
      return parent_.get();
    }
    UniqueFd at(root_ ? fcntl(root_.get(), F_DUPFD_CLOEXEC, 0) : -1);
    for (std::size_t start = 0; at && start <= folder.size();) {
      const std::size_t end = std::min(folder.find('/', start), folder.size());
      const std::string name = folder.substr(start, end - start);
      if (mkdir_as_package(at.get(), name.c_str(), kFolderMode, user_) != 0 && errno != EEXIST) {
        return -1;
      }
      UniqueFd next = open_as_package(at.get(), name.c_str(), kFlags, 0, user_, nullptr);
      if (!next && errno == ENOTDIR) errno = is_link(at.get(), name) ? ELOOP : ENOTDIR;
      const int reason = errno;
      at = std::move(next);
      errno = reason;
      start = end + 1;
    }
    if (!at) return -1;
    parent_ = std::move(at);
    parent_name_ = folder;
    return parent_.get();
  }

  bool is_link(int dir, const std::string &name) const {
    struct stat status {};
    return status_as_package(dir, name.c_str(), user_, &status) == 0 && S_ISLNK(status.st_mode);
  }

  /** A file that nobody else has open, whatever lay under its name. */
  UniqueFd create(int parent, const std::string &path, std::size_t name_at) {
    if (parent < 0) return {};
    const char *name = path.c_str() + name_at;
    if (path == table_) {  // the daemon's own, until it has been read
      const ActAsRoot root;
      return create_named(parent, name, kTableMode, {0, 0});
    }
    return create_named(parent, name, kUnpackedMode, user_);
  }

  UniqueFd create_named(int parent, const char *name, mode_t mode, const package_user &owner) {
    constexpr int kFlags = O_WRONLY | O_CREAT | O_EXCL;
    // where one name was taken the next one will be, and then this saves a call
    if (expect_taken_) expect_taken_ = unlink_as_package(parent, name, 0, user_) == 0;
    UniqueFd file = open_as_package(parent, name, kFlags, mode, owner, nullptr);
    if (file || errno != EEXIST) return file;
    expect_taken_ = unlink_as_package(parent, name, 0, user_) == 0;
    if (!expect_taken_) return {};  // a directory stays
    return open_as_package(parent, name, kFlags, mode, owner, nullptr);
  }

  Extracted write(ByteSource *source, const unz_file_info64 &info, UniqueFd *file,
                  const std::string &path) {
    FileSink sink(file->get(), info.uncompressed_size);
    CodecTotals totals;
    const CodecResult result = info.compression_method == kStored
                                   ? copy_stored(source, &sink, &totals)
                                   : codec_->inflate(source, &sink, &totals);
    const bool closed = close(file->release()) == 0;
    if (sink.too_long()) {
      unlink_as_package(parent_.get(), path.c_str() + path.rfind('/') + 1, 0, user_);
      return refuse(path.c_str(), "it holds more than it announces");
    }
    if (result == CodecResult::kSinkFailed || !closed) {
      LOGE("fwrite() failed");
      return Extracted::kFailed;
    }
    if (result != CodecResult::kDone || totals.plain != info.uncompressed_size ||
        totals.crc != info.crc) {
      LOGE("archive entry %s is corrupt", path.c_str());
      return Extracted::kFailed;
    }
    return Extracted::kDone;
  }

  std::string destination_;
  WorkingFiles working_;
  std::string table_;
  UniqueFd root_;
  package_user user_;
  ActAsPackage acting_;
  UniqueFd parent_;
  std::string parent_name_;
  bool expect_taken_ = false;  // files lie where the entries go
  std::unique_ptr<Codec> codec_;
};

struct CloseArchive {
  void operator()(void *archive) const { unzClose(archive); }
};

struct Archive {
  std::unique_ptr<ArchiveFile> file;
  std::unique_ptr<void, CloseArchive> handle;  // reads the file to its end
};

Archive open_archive(const char *zip_path) {
  UniqueFd fd = safe_open(zip_path, O_RDONLY | O_NONBLOCK);
  struct stat status {};
  if (!fd || fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) return {};
  Archive archive;
  archive.file =
      std::make_unique<ArchiveFile>(std::move(fd), static_cast<std::uint64_t>(status.st_size));
  zlib_filefunc64_def functions = archive.file->functions();
  archive.handle.reset(unzOpen2_64(zip_path, &functions));
  return archive;
}

/** Directories in one another that an entry's name has, the data directory counted as one. */
int depth_of(const char *name) {
  constexpr char kShared[] = "shared/";
  const bool shared = std::strncmp(name, kShared, std::strlen(kShared)) == 0;
  return static_cast<int>(std::count(name, name + std::strlen(name), '/')) - (shared ? 1 : 0);
}

/**
 * What an archive announces, entry by entry: it must be what a backup can hold. It is counted
 * before anything is written, and again with the writing, for the file may be somebody else's.
 */
class Announced {
 public:
  /** @param archive_size bytes of the file itself */
  explicit Announced(std::uint64_t archive_size) : archive_size_(archive_size) {}

  /** @return why the archive is refused, null when it is not */
  const char *add(const unz_file_info64 &info, const char *name) {
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

 private:
  static constexpr std::uint64_t kMostReadings = 2;
  /** Some are counted again where the entries do not come in the order of a walk. */
  static constexpr std::uint64_t kMostFolders = 4 * kMaxArchiveEntries;

  /** Directories on the way to an entry that were not on the way to the one before. */
  std::uint64_t new_folders(const char *name) {
    const std::string path = name;
    const auto differ = std::mismatch(path.begin(), path.end(), before_.begin(), before_.end());
    const auto count = std::count(differ.first, path.end(), '/');
    before_ = path;
    return static_cast<std::uint64_t>(count);
  }

  const std::uint64_t archive_size_;
  std::uint64_t entries_ = 0;
  std::uint64_t size_ = 0;
  std::uint64_t read_ = 0;
  std::uint64_t names_ = 0;
  std::uint64_t folders_ = 0;
  std::string before_;
};

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
bool read_entry(const Archive &from, const unz_file_info64 &info, ByteSink *sink) {
  EntrySource source(from.file.get(), from.handle.get(), info.compressed_size);
  CodecTotals totals;
  CodecResult result = CodecResult::kCorrupt;
  if (info.compression_method == kStored) {
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
table_state look_at_table(const Archive &from, const unz_file_info64 &info, bool closely) {
  if (info.uncompressed_size > kArchiveTableBounds.text) return table_state::beyond;
  if (form_refusal(info) != nullptr) return table_state::malformed;  // it is not unpacked either
  unzFile archive = from.handle.get();
  if (unzOpenCurrentFile2(archive, nullptr, nullptr, kRaw) != UNZ_OK) return table_state::malformed;
  TableReader reader(TableUse::check);
  TableText table(kArchiveTableBounds, closely ? &reader : nullptr);
  TableLook look(&table, info.uncompressed_size);
  const bool arrived = read_entry(from, info, &look);
  unzCloseCurrentFile(archive);
  if (table.end() == table_state::beyond) return table_state::beyond;
  return arrived ? table.end() : table_state::malformed;
}

/**
 * Look at everything that an archive announces, and at its table; the entries are held to it later.
 * Of several entries of the table's name the last is the table, and replaces the others, which are
 * nobody's to read: an application's own file of that name, with whatever it holds.
 * @param[in,out] found asks for a close look at the table where it is not null
 * @return why it is refused, null when it is not
 */
const char *look_at_archive(const Archive &from, const char *pkg_id, archived_table *found) {
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

/**
 * One entry, under the names and with the messages of its steps. 14 when memory is out, 31 when
 * the archive is not any more what it announced.
 */
int unpack_entry(Unpacker *unpacker, const Archive &from, Announced *announced, CString *name,
                 unzip_report *report) {
  unzFile archive = from.handle.get();
  const int opened = unzOpenCurrentFile2(archive, nullptr, nullptr, kRaw);
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
int unpack_entries(const char *pkg_id, const char *destination, const Archive &archive,
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
  const Archive archive = open_archive(zip_path);
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

bool extract_file_from_zip(const char *pkg_id, const char *destination, unzFile archive,
                           const char *name) {
  unz_file_info64 info = {};
  if (unzGetCurrentFileInfo64(archive, &info, nullptr, 0, nullptr, 0, nullptr, 0) != UNZ_OK) {
    return false;
  }
  LibrarySource source(archive);
  const Extracted result = Unpacker(pkg_id, destination).extract(&source, info, name);
  return result == Extracted::kDone || result == Extracted::kFolder;
}
