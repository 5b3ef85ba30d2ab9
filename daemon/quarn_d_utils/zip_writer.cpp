#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "quarn_common.h"
#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

std::mutex package_data_mutex;

namespace {

constexpr const char *kDataDirs[] = {"/data", "/shared/data", "/shared/trusted"};
constexpr char kSnapshotDir[] = "/shared/data/quarn_tmp_rst_dir";
constexpr char kTableDir[] = "/shared/data/";
constexpr char kTableSuffix[] = ".perm";
constexpr int kLevel = 1;
constexpr mode_t kArchiveMode = 0600;
/** Name flag of the zip format: the entry's name is UTF-8. */
constexpr uLong kUtf8Name = 1UL << 11;
constexpr uLong kMadeByDefault = 0;

/**
 * The archive file under minizip. It keeps the last bytes in memory, because the sizes of an entry
 * are written into its header after its data: most of those patches then cost no system call.
 */
class ArchiveFile {
 public:
  ArchiveFile(UniqueFd fd, std::uint64_t max_size) : fd_(std::move(fd)), room_(max_size) {}
  ArchiveFile(const ArchiveFile &) = delete;
  ArchiveFile &operator=(const ArchiveFile &) = delete;

  bool is_open() const { return static_cast<bool>(fd_); }

  /** Room for one more file or link of @p size: no restore takes what is beyond. */
  bool admit(std::uint64_t size) {
    constexpr std::uint64_t kTableItself = 1;
    full_ = full_ || ++entries_ + kTableItself > kMaxArchiveEntries || size > room_;
    if (full_) return false;
    room_ -= size;
    return true;
  }
  bool is_full() const { return full_; }

  /** Let the next header fit into memory. @return false when the file cannot be written */
  bool make_room() { return !failed_ && (filled_ + kHeaderRoom <= kBuffer || flush()); }

  zlib_filefunc64_def functions() {
    zlib_filefunc64_def table = {};
    table.zopen64_file = [](voidpf self, const void *, int) { return self; };
    table.zread_file = [](voidpf, voidpf, void *, uLong) -> uLong { return 0; };
    table.zwrite_file = [](voidpf, voidpf self, const void *data, uLong size) -> uLong {
      return of(self)->write(static_cast<const char *>(data), size) ? size : 0;
    };
    table.ztell64_file = [](voidpf, voidpf self) -> ZPOS64_T { return of(self)->position_; };
    table.zseek64_file = [](voidpf, voidpf self, ZPOS64_T offset, int origin) -> long {
      return of(self)->seek(offset, origin);
    };
    table.zclose_file = [](voidpf, voidpf self) -> int { return of(self)->finish() ? 0 : EOF; };
    table.zerror_file = [](voidpf, voidpf self) -> int { return of(self)->failed_ ? 1 : 0; };
    table.opaque = this;
    return table;
  }

 private:
  static constexpr std::size_t kBuffer = 128U << 10;
  static constexpr std::size_t kHeaderRoom = 8U << 10;  // the longest path, and the fields

  static ArchiveFile *of(voidpf self) { return static_cast<ArchiveFile *>(self); }

  bool write(const char *data, std::size_t size) {
    if (failed_) return false;
    while (size > 0) {
      std::size_t taken = 0;
      if (position_ < start_) {
        // behind what is in memory already: a header patch far back
        taken = static_cast<std::size_t>(std::min<ZPOS64_T>(size, start_ - position_));
        if (!write_at(data, taken, position_)) return false;
      } else {
        const std::size_t at = static_cast<std::size_t>(position_ - start_);
        if (at >= kBuffer) {
          if (!flush()) return false;
          continue;
        }
        taken = std::min(size, kBuffer - at);
        std::memcpy(buffer_.get() + at, data, taken);
        filled_ = std::max(filled_, at + taken);
      }
      position_ += taken;
      data += taken;
      size -= taken;
    }
    return true;
  }

  long seek(ZPOS64_T offset, int origin) {
    const ZPOS64_T end = start_ + filled_;
    const ZPOS64_T base = origin == ZLIB_FILEFUNC_SEEK_SET   ? 0
                          : origin == ZLIB_FILEFUNC_SEEK_CUR ? position_
                                                             : end;
    if (base + offset > end) return -1;
    position_ = base + offset;
    return 0;
  }

  bool flush() {
    if (!write_at(buffer_.get(), filled_, start_)) return false;
    start_ += filled_;
    filled_ = 0;
    return true;
  }

  bool finish() {
    const bool flushed = flush();
    return close(fd_.release()) == 0 && flushed;
  }

  bool write_at(const char *data, std::size_t size, ZPOS64_T offset) {
    while (size > 0) {
      const ssize_t count =
          TEMP_FAILURE_RETRY(pwrite(fd_.get(), data, size, static_cast<off_t>(offset)));
      if (count <= 0) {
        failed_ = true;
        return false;
      }
      data += count;
      offset += static_cast<ZPOS64_T>(count);
      size -= static_cast<std::size_t>(count);
    }
    return true;
  }

  UniqueFd fd_;
  const std::unique_ptr<char[]> buffer_{new char[kBuffer]};  // the file's bytes from start_ on
  std::size_t filled_ = 0;
  ZPOS64_T start_ = 0;     // bytes before it are in the file
  ZPOS64_T position_ = 0;  // where the next write goes
  bool failed_ = false;
  std::uint64_t room_;  // for the files' bytes
  std::uint64_t entries_ = 0;
  bool full_ = false;
};

/** The archive that this thread is writing: its file, and the codec whose memory entries share. */
thread_local ArchiveFile *archive_file = nullptr;
thread_local std::unique_ptr<Codec> archive_codec;
/** Where it lies: one that is made among the data it takes in must not take in itself. */
thread_local std::string archive_path;

/** A file's bytes, as many as it had when it was opened. */
class FileSource : public ByteSource {
 public:
  FileSource(int fd, std::uint64_t size) : fd_(fd), expected_(size) {}

  long read(unsigned char *data, std::size_t size, bool *end) override {
    // one byte more than expected shows a file that grows, which must not grow the archive
    const std::uint64_t left = expected_ - total_;
    const std::size_t wanted = static_cast<std::size_t>(std::min<std::uint64_t>(size, left + 1));
    const ssize_t count = TEMP_FAILURE_RETRY(::read(fd_, data, wanted));
    if (count < 0) return -1;
    auto filled = static_cast<std::size_t>(count);
    // a regular file gives less than was wanted only where it ends
    *end = filled < wanted;
    if (filled > left) {
      grew_ = true;
      *end = true;
      filled = static_cast<std::size_t>(left);
    }
    total_ += filled;
    return static_cast<long>(filled);
  }

  bool grew() const { return grew_; }
  bool shrank() const { return total_ != expected_; }

 private:
  int fd_;
  std::uint64_t expected_;
  std::uint64_t total_ = 0;
  bool grew_ = false;
};

class EntrySink : public ByteSink {
 public:
  explicit EntrySink(zipFile zip) : zip_(zip) {}
  bool write(const unsigned char *data, std::size_t size) override {
    error_ = zipWriteInFileInZip(zip_, data, static_cast<unsigned int>(size));
    return error_ == ZIP_OK;
  }
  int error() const { return error_; }

 private:
  zipFile zip_;
  int error_ = ZIP_OK;
};

bool needs_utf8_flag(const char *name) {
  for (const char *c = name; *c != '\0'; ++c) {
    if (static_cast<unsigned char>(*c) >= 0x80) return g_utf8_validate(name, -1, nullptr) != FALSE;
  }
  return false;
}

int open_entry(zipFile zip, const char *name) {
  constexpr int kRaw = 1;
  // the library loses memory when it cannot write a header
  if (archive_file != nullptr && !archive_file->make_room()) return ZIP_ERRNO;
  return zipOpenNewFileInZip4_64(zip, name, nullptr, nullptr, 0, nullptr, 0, nullptr, Z_DEFLATED,
                                 kLevel, kRaw, -MAX_WBITS, DEF_MEM_LEVEL, Z_DEFAULT_STRATEGY,
                                 nullptr, 0, kMadeByDefault, needs_utf8_flag(name) ? kUtf8Name : 0,
                                 0);
}

/** One open file's bytes as the entry @p name. */
bool add_open_file(zipFile zip, const char *path, const char *name, int fd,
                   const struct stat &status, int *error) {
  if (archive_codec == nullptr) archive_codec = make_codec(CodecUse::kDeflate);
  if (archive_codec == nullptr) {
    LOGE("calloc() failed, buf is NULL");
    *error = QUARN_REFUSED;
    return false;
  }
  const int opened = open_entry(zip, name);
  if (opened != ZIP_OK) {
    LOGE("zipOpenNewFileInZip() failed, zip_err = [%d]", opened);
    *error = QUARN_REFUSED;
    return false;
  }
  FileSource source(fd, static_cast<std::uint64_t>(status.st_size));
  EntrySink sink(zip);
  CodecTotals totals;
  const CodecResult result = archive_codec->deflate(&source, &sink, &totals);
  bool added = result == CodecResult::kDone;
  if (result == CodecResult::kSinkFailed) {
    LOGE("zipWriteInFileInZip() failed, zip_err = [%d]", sink.error());
  } else if (!added) {
    LOGE("cannot read %s", path);
  } else if (source.shrank()) {
    LOGE("file changed while it was archived : %s", path);
    added = false;
  } else if (source.grew()) {
    // what is written to all the time, a log say, would never be backed up otherwise
    LOGI("file grew while it was archived : %s", path);
  }
  const int closed = zipCloseFileInZipRaw64(zip, totals.plain, totals.crc);
  if (closed != ZIP_OK && added) {
    LOGE("zipCloseFileInZip() failed, zip_err = [%d]", closed);
    added = false;
  }
  if (!added) *error = QUARN_REFUSED;
  return added;
}

/** What a walk carries along. */
struct Walk {
  const std::string root;
  const WorkingFiles working;
  zipFile zip;
  file_info_table_h *table;
  int *error;
};

bool walk_dir(Walk *walk, DIR *dir, std::string *path, int depth);

bool walk_subdir(Walk *walk, int parent, const char *name, std::string *path, int depth) {
  const DirPtr dir = depth < kMaxDirDepth ? safe_opendir_at(parent, name) : nullptr;
  if (dir == nullptr) {
    LOGE("error : cannot open this path %s", path->c_str());
    *walk->error = QUARN_REFUSED;
    return false;
  }
  return walk_dir(walk, dir.get(), path, depth);
}

/** Whether the archive takes one more file or link. */
bool admit(Walk *walk, const std::string &path, off_t size) {
  if (archive_file == nullptr || archive_file->admit(static_cast<std::uint64_t>(size))) return true;
  LOGE("archive is full at %s", path.c_str());
  *walk->error = QUARN_REFUSED;
  return false;
}

/** Record a file and pack it, when it could be opened. */
void add_regular(Walk *walk, const std::string &path, const UniqueFd &fd,
                 const struct stat &status) {
  if (status.st_nlink > 1 && status.st_uid != kAppUid) {
    // by such a link an application would get a copy of what it may not read
    LOGE("refused : %s is a link to another owner's file", path.c_str());
    *walk->error = QUARN_REFUSED;
    return;
  }
  if (!admit(walk, path, status.st_size)) return;
  add_to_file_info_table(walk->table, walk->root.c_str(), path.c_str(), status, walk->error,
                         fd.get());
  if (fd) {
    add_open_file(walk->zip, path.c_str(), path.c_str() + walk->root.size() + 1, fd.get(), status,
                  walk->error);
  } else {
    LOGE("fopen() failed, file is NULL");
    *walk->error = QUARN_REFUSED;
  }
}

/** What the directory calls a regular file, and is one that can be opened: the usual case. */
bool walk_regular(Walk *walk, int parent, const char *name, const std::string &path, bool *noted) {
  *noted = is_backup_file(path.c_str());
  if (!*noted) return true;
  struct stat status {};
  const UniqueFd fd = safe_open_file_at(parent, name, &status);
  if (fd) add_regular(walk, path, fd, status);
  return static_cast<bool>(fd);
}

bool walk_entry(Walk *walk, int parent, const dirent &entry, std::string *path, int depth) {
  const char *name = entry.d_name;
  bool noted = false;
  if (entry.d_type == DT_REG && walk_regular(walk, parent, name, *path, &noted)) return noted;
  struct stat status {};
  const int found = fstatat(parent, name, &status, AT_SYMLINK_NOFOLLOW);
  if (found != 0) {
    LOGE("error : lstat for %d %s", found, path->c_str());
    *walk->error = QUARN_REFUSED;
    return false;
  }
  if (S_ISDIR(status.st_mode)) {
    if (!walk_subdir(walk, parent, name, path, depth + 1)) return false;
    add_to_file_info_table(walk->table, walk->root.c_str(), path->c_str(), status, walk->error);
    return true;
  }
  if (S_ISREG(status.st_mode)) {
    if (!is_backup_file(path->c_str())) return false;
    struct stat opened {};
    const UniqueFd fd = safe_open_file_at(parent, name, &opened);
    add_regular(walk, *path, fd, fd ? opened : status);
    return true;
  }
  if (S_ISLNK(status.st_mode)) {
    if (!is_backup_file(path->c_str()) || !admit(walk, *path, 0)) return false;
    add_sym_info_to_file_info_table(walk->table, walk->root.c_str(), path->c_str(), status,
                                    walk->error);
    return true;
  }
  LOGE("this is unexpected type : %s", path->c_str());
  *walk->error = QUARN_REFUSED;
  return false;
}

bool walk_dir(Walk *walk, DIR *dir, std::string *path, int depth) {
  bool noted = false;
  while (const dirent *entry = readdir(dir)) {
    if (is_dot_entry(entry->d_name)) continue;
    if (archive_file != nullptr && archive_file->is_full()) break;
    const PathStep step(path, entry->d_name);
    if (walk->working.contain(*path) || *path == archive_path) continue;
    if (walk_entry(walk, dirfd(dir), *entry, path, depth)) noted = true;
  }
  return noted;
}

UniqueFd create_archive(const char *zip_path) {
  claim_working_file(zip_path);
  if (file_exist(zip_path)) delete_file(zip_path);
  return safe_open(zip_path, O_RDWR | O_CREAT | O_EXCL, kArchiveMode);
}

/**
 * A complete snapshot that nobody works with: its restore was cut off, and what
 * lies in the data directories is part of the old and part of the new.
 */
bool is_half_restored(const char *pkg_id, const char *root) {
  const std::string snapshot = std::string(root) + kSnapshotDir;
  const std::string table = snapshot + kTableDir + pkg_id + kTableSuffix;
  struct stat status = {};
  // An application can make neither of root's.
  return safe_lstat(snapshot.c_str(), &status) == 0 && S_ISDIR(status.st_mode) &&
         status.st_uid == geteuid() && file_exist(table.c_str());
}

struct ReleaseTable {
  void operator()(file_info_table_h *table) const { release_file_info_table(table); }
};

}  // namespace

void make_zip_data(const char *pkg_id, const char *root, const char *zip_path, int *error,
                   std::uint64_t max_size) {
  const std::lock_guard<std::mutex> lock(package_data_mutex);
  if (is_half_restored(pkg_id, root)) {
    LOGE("restore of (%s) was interrupted, so its data is not packed", pkg_id);
    *error = QUARN_REFUSED;
    return;
  }
  create_directory_of_file(zip_path);
  file_info_table_h *made = nullptr;
  ready_file_info_table(&made);
  const std::unique_ptr<file_info_table_h, ReleaseTable> table(made);
  if (table == nullptr) {
    LOGE("file_info_table is NULL");
    *error = QUARN_REFUSED;
    return;
  }
  UniqueFd fd = create_archive(zip_path);
  ArchiveFile file(std::move(fd), max_size);
  zlib_filefunc64_def functions = file.functions();
  zipFile zip =
      file.is_open() ? zipOpen2_64(zip_path, APPEND_STATUS_CREATE, nullptr, &functions) : nullptr;
  if (zip == nullptr) {
    LOGE("zipOpen() failed, zf is NULL");
    *error = QUARN_UNREADABLE;
    return;
  }
  archive_file = &file;
  archive_path = zip_path;
  for (const char *dir : kDataDirs) {
    parse_app_dir_for_zip(pkg_id, root, zip, (std::string(root) + dir).c_str(), table.get(), error);
  }
  insert_file_info_table_to_zip(table.get(), zip, pkg_id, root, error);
  const int closed = zipClose(zip, nullptr);
  archive_file = nullptr;
  archive_codec.reset();
  archive_path.clear();
  if (closed != ZIP_OK) {
    LOGE("zipClose() failed, zip_err = [%d]", closed);
    *error = QUARN_REFUSED;
  }
}

bool parse_app_dir_for_zip(const char *pkg_id, const char *root, zipFile zip, const char *dir,
                           file_info_table_h *table, int *error) {
  const DirPtr opened = safe_opendir(dir);
  if (opened == nullptr) {
    LOGE("error : cannot open this path %s", dir);
    *error = QUARN_REFUSED;
    return false;
  }
  Walk walk{root, WorkingFiles(pkg_id, root), zip, table, error};
  std::string path = dir;
  return walk_dir(&walk, opened.get(), &path, 0);
}

bool add_file_to_zip(const char *root, zipFile zip, const char *file, int *error) {
  const UniqueFd fd = safe_open(file, O_RDONLY | O_NONBLOCK);
  struct stat status {};
  if (!fd || fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) {
    LOGE("fopen() failed, file is NULL");
    *error = QUARN_REFUSED;
    return false;
  }
  return add_open_file(zip, file, file + std::strlen(root) + 1, fd.get(), status, error);
}

void insert_file_info_table_to_zip(file_info_table_h *table, zipFile zip, const char *pkg_id,
                                   const char *root, int *error) {
  const char *document = json_object_get_string(table->root);
  std::string text = document == nullptr ? "" : document;
  const std::string path = std::string(root) + kTableDir + pkg_id + kTableSuffix;
  const int written = write_string_to_file(std::move(text), path);
  if (written != QUARN_OK) {
    LOGE("fail. insert_file_info_table_to_zip : %d", written);
    *error = written;
  }
  if (!file_exist(path.c_str())) {
    LOGE("fail. insert_file_info_table_to_zip : %d", QUARN_REFUSED);
    *error = QUARN_REFUSED;
  } else {
    add_file_to_zip(root, zip, path.c_str(), error);
    delete_file(path.c_str());
  }
  json_object_put(table->root);
  table->root = nullptr;
  table->symbolic_list = nullptr;
}
