#include <dirent.h>
#include <fcntl.h>
#include <json-c/json.h>
#include <sys/stat.h>
#include <unistd.h>
#include <zip.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "log_scope.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/archive_entry.h"
#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/file_info_table.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/package_directory.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/package_lock.h"
#include "quarn_d_utils/path_rules.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_d_utils/zip_archive.h"
#include "quarn_log.h"
#include "rules/rules_file.h"

namespace {

constexpr int kLevel = 1;
constexpr mode_t kArchiveMode = 0600;
constexpr mode_t kFolderMode = 0755;
/** Name flag of the zip format: the entry's name is UTF-8. */
constexpr uLong kUtf8Name = 1UL << 11;
constexpr uLong kMadeByDefault = 0;

/**
 * The archive file under minizip. It keeps the last bytes in memory, because the sizes of an entry
 * are written into its header after its data: most of those patches then cost no system call.
 */
class ArchiveFile {
 public:
  /** @param fd borrowed; negative for none */
  explicit ArchiveFile(int fd) : fd_(fd) {}
  ArchiveFile(const ArchiveFile &) = delete;
  ArchiveFile &operator=(const ArchiveFile &) = delete;

  bool is_open() const { return fd_ >= 0; }

  /** One more entry was written. */
  void count_entry() { ++entries_; }

  /** Let the next header fit into memory. @return false when the file cannot be written */
  bool make_room(std::size_t name) {
    return !failed_ && (filled_ + name + kHeaderRoom <= kBuffer || flush());
  }

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
  static constexpr std::size_t kHeaderRoom = 8U << 10;  // its fields, and a path of usual length
  // of the format's end records
  static constexpr std::uint64_t kNotInEnd = 0xffff;
  static constexpr std::size_t kEndSize = 22;
  static constexpr std::size_t kEndDirectorySize = 12;
  static constexpr std::size_t kEndDirectory = 16;
  static constexpr std::uint32_t kZip64EndRecord = 0x06064b50;
  static constexpr std::uint32_t kZip64Locator = 0x07064b50;
  static constexpr std::uint64_t kZip64EndSize = 44;
  static constexpr std::uint64_t kZip64Version = 45;

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
    const bool written = flush() && (entries_ < kNotInEnd || add_zip64_end());
    // some file systems tell only here that there was no room
    return close(fcntl(fd_, F_DUPFD_CLOEXEC, 0)) == 0 && written;
  }

  /**
   * minizip counts no more than 65,534 entries unless the archive is larger than 4 GiB, and other
   * programs then look for as many as its end record tells. What has to stand before that is added.
   */
  bool add_zip64_end() {
    char end[kEndSize];
    if (start_ < sizeof end) return false;
    const ZPOS64_T at = start_ - sizeof end;
    const ssize_t count = TEMP_FAILURE_RETRY(pread(fd_, end, sizeof end, static_cast<off_t>(at)));
    if (count != static_cast<ssize_t>(sizeof end)) return false;
    const std::uint64_t directory_size = number(end + kEndDirectorySize);
    const std::uint64_t directory = number(end + kEndDirectory);
    if (directory == UINT32_MAX) return true;  // it is there already
    std::string record;
    put(&record, kZip64EndRecord, 4);
    put(&record, kZip64EndSize, 8);
    put(&record, kZip64Version, 2);
    put(&record, kZip64Version, 2);
    put(&record, 0, 8);  // disks
    put(&record, entries_, 8);
    put(&record, entries_, 8);
    put(&record, directory_size, 8);
    put(&record, directory, 8);
    put(&record, kZip64Locator, 4);
    put(&record, 0, 4);  // disk
    put(&record, at, 8);
    put(&record, 1, 4);  // disks
    record.append(end, sizeof end);
    return write_at(record.data(), record.size(), at);
  }

  static void put(std::string *bytes, std::uint64_t value, int count) {
    for (int i = 0; i < count; ++i) *bytes += static_cast<char>(value >> (8 * i));
  }
  static std::uint32_t number(const char *bytes) {
    std::uint32_t value = 0;
    for (int i = 3; i >= 0; --i) value = value << 8 | static_cast<unsigned char>(bytes[i]);
    return value;
  }

  bool write_at(const char *data, std::size_t size, ZPOS64_T offset) {
    // the archive is the daemon's own, and so is the room that it takes
    const ActAsRoot root;
    while (size > 0) {
      const ssize_t count = TEMP_FAILURE_RETRY(pwrite(fd_, data, size, static_cast<off_t>(offset)));
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

  const int fd_;
  const std::unique_ptr<char[]> buffer_{new char[kBuffer]};  // the file's bytes from start_ on
  std::size_t filled_ = 0;
  ZPOS64_T start_ = 0;     // bytes before it are in the file
  ZPOS64_T position_ = 0;  // where the next write goes
  bool failed_ = false;
  std::uint64_t entries_ = 0;
};

/** The archive that a thread is making. */
class Packing {
 public:
  Packing(ArchiveFile *file, const char *zip_path, const archive_bounds &bounds,
          const std::atomic<bool> *stop)
      : path(zip_path), file_(file), bounds_(bounds), stop_(stop) {}

  /** Where it lies: one that is made among the data it takes in must not take in itself. */
  const std::string path;
  std::vector<UniqueFd> data_dirs; /**< those that were walked */

  ArchiveFile *file() const { return file_; }
  bool stopped() const { return stop_ != nullptr && *stop_; }
  bool ended() const { return stopped() || excess_.bound != archive_bound::none; }
  const archive_excess &excess() const { return excess_; }

  /** Whether a file of @p size, a link or a directory, with this name, lies within the bounds. */
  bool admit(const file_info_table_h &table, std::uint64_t size, std::uint64_t name) {
    content_ += size;
    return check(archive_bound::content, content_, bounds_.content) &&
           check(archive_bound::members, table.members + 1, bounds_.members) &&
           check(archive_bound::names, table.names + name, bounds_.names);
  }
  /** Whether the table with everything that was added does. */
  bool admit(const file_info_table_h &table) {
    return check(archive_bound::table, table.text, bounds_.table);
  }
  /** Whether a directory at @p depth is too deep for this archive to be of use. */
  bool refuses_depth(int depth) {
    if (bounds_.members == kNoBounds.members) return false;
    return !check(archive_bound::depth, static_cast<std::uint64_t>(depth), kMaxDirDepth);
  }

 private:
  bool check(archive_bound bound, std::uint64_t size, std::uint64_t limit) {
    if (size <= limit) return true;
    if (excess_.bound == archive_bound::none) excess_ = {bound, size, limit};
    return false;
  }

  ArchiveFile *file_;
  const archive_bounds bounds_;
  const std::atomic<bool> *stop_;
  std::uint64_t content_ = 0;
  archive_excess excess_;
};

/** The calling thread's, and the codec whose memory its entries share. */
thread_local Packing *packing = nullptr;
thread_local std::unique_ptr<Codec> archive_codec;

bool packing_ended() { return packing != nullptr && packing->ended(); }

class MemorySource : public ByteSource {
 public:
  MemorySource(const char *data, std::size_t size) : data_(data), left_(size) {}

  long read(unsigned char *data, std::size_t size, bool *end) override {
    const std::size_t count = std::min(size, left_);
    std::memcpy(data, data_, count);
    data_ += count;
    left_ -= count;
    *end = left_ == 0;
    return static_cast<long>(count);
  }

 private:
  const char *data_;
  std::size_t left_;
};

/** A file's bytes, as many as it had when it was opened. */
class FileSource : public ByteSource {
 public:
  FileSource(int fd, std::uint64_t size) : fd_(fd), expected_(size) {}

  long read(unsigned char *data, std::size_t size, bool *end) override {
    if (packing != nullptr && packing->stopped()) return -1;
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

int open_entry(zipFile zip, const char *name, std::uint64_t size) {
  constexpr int kRaw = 1;
  // what does not compress becomes a little larger, and must still fit the header's fields
  constexpr std::uint64_t kLarge = UINT32_MAX - (16U << 20);
  // the library loses memory when it cannot write a header
  if (packing != nullptr && !packing->file()->make_room(std::strlen(name))) return ZIP_ERRNO;
  return zipOpenNewFileInZip4_64(zip, name, nullptr, nullptr, 0, nullptr, 0, nullptr, Z_DEFLATED,
                                 kLevel, kRaw, -MAX_WBITS, DEF_MEM_LEVEL, Z_DEFAULT_STRATEGY,
                                 nullptr, 0, kMadeByDefault, needs_utf8_flag(name) ? kUtf8Name : 0,
                                 size >= kLarge ? 1 : 0);
}

/** Everything that @p source gives, about @p size bytes, as the entry @p name. */
bool add_entry(zipFile zip, const char *path, const char *name, ByteSource *source,
               std::uint64_t size, int *error) {
  if (archive_codec == nullptr) archive_codec = make_codec(CodecUse::kDeflate);
  if (archive_codec == nullptr) {
    LOGE("calloc() failed, buf is NULL");
    *error = QUARN_REFUSED;
    return false;
  }
  const int opened = open_entry(zip, name, size);
  if (opened != ZIP_OK) {
    LOGE("zipOpenNewFileInZip() failed, zip_err = [%d]", opened);
    *error = QUARN_REFUSED;
    return false;
  }
  if (packing != nullptr) packing->file()->count_entry();
  EntrySink sink(zip);
  CodecTotals totals;
  const CodecResult result = archive_codec->deflate(source, &sink, &totals);
  bool added = result == CodecResult::kDone;
  if (result == CodecResult::kSinkFailed) {
    LOGE("zipWriteInFileInZip() failed, zip_err = [%d]", sink.error());
  } else if (!added) {
    LOGE("cannot read %s", path);
  }
  const int closed = zipCloseFileInZipRaw64(zip, totals.plain, totals.crc);
  if (closed != ZIP_OK && added) {
    LOGE("zipCloseFileInZip() failed, zip_err = [%d]", closed);
    added = false;
  }
  if (!added) *error = QUARN_REFUSED;
  return added;
}

/** One open file's bytes as the entry @p name. */
bool add_open_file(zipFile zip, const char *path, const char *name, int fd,
                   const struct stat &status, int *error) {
  const auto size = static_cast<std::uint64_t>(status.st_size);
  FileSource source(fd, size);
  const bool added = add_entry(zip, path, name, &source, size, error);
  // what is written to all the time, a log say, would never be backed up otherwise
  if (added && source.grew()) LOGI("file grew while it was archived : %s", path);
  if (added && source.shrank()) LOGI("file shrank while it was archived : %s", path);
  return added;
}

/** What a walk carries along. */
struct Walk {
  const std::string root;
  const WorkingFiles working;
  zipFile zip;
  file_info_table_h *table;
  int *error;
  const package_user user = user_of_package();
};

bool walk_dir(Walk *walk, DIR *dir, std::string *path, int depth);

/** Whether the archive takes one more member: none after the first that it does not take. */
bool admit(Walk *walk, const std::string &path, off_t size) {
  const std::uint64_t name = path.size() - walk->root.size() - 1;
  if (name <= kMaxNameSize &&
      (packing == nullptr ||
       packing->admit(*walk->table, static_cast<std::uint64_t>(size), name))) {
    return true;
  }
  LOGE("archive is full at %s", path.c_str());
  *walk->error = QUARN_REFUSED;
  return false;
}

/** The same once it is a member of the table. */
void admit_in_table(Walk *walk, const std::string &path) {
  if (packing == nullptr || packing->admit(*walk->table)) return;
  LOGE("archive is full at %s", path.c_str());
  *walk->error = QUARN_REFUSED;
}

/** What lies there, whoever may enter the directory. */
int look_at(int parent, const char *name, struct stat *status) {
  const int found = fstatat(parent, name, status, AT_SYMLINK_NOFOLLOW);
  if (found == 0 || errno != EACCES) return found;
  const ActAsRoot root;
  return fstatat(parent, name, status, AT_SYMLINK_NOFOLLOW);
}

/** Open a regular file with the rights of the application, as safe_open_file_at() does. */
UniqueFd open_file(const Walk &walk, int parent, const char *name, struct stat *status) {
  constexpr int kFlags = O_RDONLY | O_NONBLOCK | O_NOCTTY;
  UniqueFd fd = open_as_package(parent, name, kFlags | O_NOATIME, 0, walk.user, status);
  if (!fd && errno == EPERM) fd = open_as_package(parent, name, kFlags, 0, walk.user, status);
  if (!fd || !S_ISREG(status->st_mode)) return {};
  return fd;
}

/** Walk a directory below another, and record it behind what it holds. */
bool walk_subdir(Walk *walk, int parent, const char *name, std::string *path, int depth) {
  if (depth >= kMaxDirDepth && packing != nullptr && packing->refuses_depth(depth + 1)) {
    LOGE("archive is full at %s", path->c_str());
    *walk->error = QUARN_REFUSED;
    return false;
  }
  struct stat status {};
  const DirPtr dir =
      depth < kMaxDirDepth ? open_directory_as_package(parent, name, walk->user, &status) : nullptr;
  if (dir == nullptr) {
    LOGE("error : cannot open this path %s", path->c_str());
    *walk->error = QUARN_REFUSED;
    return false;
  }
  if (!walk_dir(walk, dir.get(), path, depth)) return false;
  if (packing_ended() || !admit(walk, *path, 0)) return true;
  add_to_file_info_table(walk->table, walk->root.c_str(), path->c_str(), status, walk->error,
                         dirfd(dir.get()));
  admit_in_table(walk, *path);
  return true;
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
  admit_in_table(walk, path);
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
  const UniqueFd fd = open_file(*walk, parent, name, &status);
  if (fd) add_regular(walk, path, fd, status);
  return static_cast<bool>(fd);
}

bool walk_entry(Walk *walk, int parent, const dirent &entry, std::string *path, int depth) {
  const char *name = entry.d_name;
  bool noted = false;
  if (entry.d_type == DT_REG && walk_regular(walk, parent, name, *path, &noted)) return noted;
  struct stat status {};
  const int found = look_at(parent, name, &status);
  if (found != 0) {
    LOGE("error : lstat for %d %s", found, path->c_str());
    *walk->error = QUARN_REFUSED;
    return false;
  }
  if (S_ISDIR(status.st_mode)) return walk_subdir(walk, parent, name, path, depth + 1);
  if (S_ISREG(status.st_mode)) {
    if (!is_backup_file(path->c_str())) return false;
    struct stat opened {};
    const UniqueFd fd = open_file(*walk, parent, name, &opened);
    if (!fd && errno == EACCES && status.st_uid != kAppUid && status.st_nlink == 1) {
      // its other name may be gone, and it then looks like any file
      LOGE("refused : %s is another owner's file, and its application may not read it",
           path->c_str());
      *walk->error = QUARN_REFUSED;
      return true;
    }
    add_regular(walk, *path, fd, fd ? opened : status);
    return true;
  }
  if (S_ISLNK(status.st_mode)) {
    if (!is_backup_file(path->c_str()) || !admit(walk, *path, 0)) return false;
    add_sym_info_to_file_info_table(walk->table, walk->root.c_str(), path->c_str(), status,
                                    walk->error, parent);
    admit_in_table(walk, *path);
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
    if (packing_ended()) break;
    const PathStep step(path, entry->d_name);
    if (walk->working.contain(*path) || (packing != nullptr && *path == packing->path)) continue;
    if (walk_entry(walk, dirfd(dir), *entry, path, depth)) noted = true;
  }
  return noted;
}

UniqueFd create_archive(const char *zip_path) {
  claim_working_file(zip_path);
  struct stat status {};
  // What the application has there is not made way for.
  if (safe_lstat(zip_path, &status) == 0 && is_own_file(status) && S_ISREG(status.st_mode)) {
    delete_file(zip_path);
  }
  return safe_open(zip_path, O_RDWR | O_CREAT | O_EXCL, kArchiveMode);
}

/**
 * A complete snapshot that nobody works with: its restore was cut off, and what
 * lies in the data directories is part of the old and part of the new.
 */
bool is_half_restored(const char *pkg_id, const char *root) {
  const std::string snapshot = WorkingFiles(pkg_id, root).snapshot_place();
  const std::string table = snapshot_files(pkg_id, snapshot).table;
  struct stat status = {};
  // An application can make neither of root's.
  return safe_lstat(snapshot.c_str(), &status) == 0 && S_ISDIR(status.st_mode) &&
         status.st_uid == geteuid() && file_exist(table.c_str());
}

struct ReleaseTable {
  void operator()(file_info_table_h *table) const { release_file_info_table(table); }
};

/**
 * The root of the package that is packed, as it was when that began. Nothing is made in its place
 * once it has gone: half a package, and root's, would be what its next installation finds.
 */
class PackageRoot {
 public:
  explicit PackageRoot(const char *root)
      : path_(root), dir_(safe_open(root, O_PATH | O_DIRECTORY)) {}

  /** Make the directory of a file; below the root only where that still is. */
  void create_directory_of(const char *file) const {
    const std::string path = file;
    const auto slash = path.rfind('/');
    if (path.compare(0, path_.size() + 1, path_ + "/") != 0 || slash <= path_.size()) {
      create_directory_of_file(file);
      return;
    }
    const std::string folder = path.substr(path_.size() + 1, slash - path_.size() - 1);
    if (!dir_ || is_directory(path.substr(0, slash).c_str())) return;
    const UniqueFd made = safe_mkdir_below(dir_.get(), folder.c_str(), kFolderMode);
    if (made && fchownat(made.get(), "", kAppUid, kAppGid, AT_EMPTY_PATH) != 0) {
      LOGE("fail to give %s to its application : %d", folder.c_str(), errno);
    }
  }

  /** True when it was there, and it or one of its data directories is no longer. */
  bool has_gone(const std::vector<UniqueFd> &data_dirs) const {
    struct stat opened {};
    struct stat found {};
    if (!dir_ || fstat(dir_.get(), &opened) != 0) return false;
    if (safe_lstat(path_.c_str(), &found) != 0 || found.st_dev != opened.st_dev ||
        found.st_ino != opened.st_ino) {
      return true;
    }
    return std::any_of(data_dirs.begin(), data_dirs.end(), [](const UniqueFd &dir) {
      struct stat status {};
      return fstat(dir.get(), &status) == 0 && status.st_nlink == 0;
    });
  }

 private:
  std::string path_;
  UniqueFd dir_;
};

bool may_be_packed(const char *pkg_id, const char *root) {
  if (!backup_rules_usable()) {
    LOGE("(%s) is not packed, because its rules file cannot be used: %s", pkg_id,
         rules_state_text(backup_rules_state()));
    return false;
  }
  if (is_half_restored(pkg_id, root)) {
    LOGE("restore of (%s) was interrupted, so its data is not packed", pkg_id);
    return false;
  }
  return true;
}

/** The data directories and the table; without it what went beyond a bound, or was stopped. */
void pack_all(const char *pkg_id, const char *root, zipFile zip, file_info_table_h *table,
              int *error) {
  for (const std::string &dir : package_files(pkg_id, root).data_dirs()) {
    if (packing->ended()) break;
    parse_app_dir_for_zip(pkg_id, root, zip, dir.c_str(), table, error);
  }
  if (packing->ended()) {
    *error = QUARN_REFUSED;
    return;
  }
  insert_file_info_table_to_zip(table, zip, pkg_id, root, error);
}

/** What an archive is to be like, and what came of it. */
struct PackRequest {
  const char *pkg_id;
  const char *root;
  const char *zip_path; /**< empty for an archive without a name */
  int *error;
  const archive_bounds &bounds;
  archive_excess *excess;
  const std::atomic<bool> *stop;
};

/** Pack into the open archive, whose library handle is @p zip. */
void pack_into(const PackRequest &request, const PackageRoot &package, file_info_table_h *table,
               ArchiveFile *file, zipFile zip) {
  const LogScope scope(std::string("the data of ") + request.pkg_id);
  Packing current(file, request.zip_path, request.bounds, request.stop);
  packing = &current;
  pack_all(request.pkg_id, request.root, zip, table, request.error);
  if (package.has_gone(current.data_dirs)) {
    LOGE("(%s) was removed while it was packed", request.pkg_id);
    *request.error = QUARN_REFUSED;
  }
  const int closed = zipClose(zip, nullptr);
  packing = nullptr;
  archive_codec.reset();
  if (closed != ZIP_OK) {
    LOGE("zipClose() failed, zip_err = [%d]", closed);
    *request.error = QUARN_REFUSED;
  }
  if (request.excess != nullptr) *request.excess = current.excess();
}

/** @param archive where it is packed into; made at its name if it is none */
void pack_package(const PackRequest &request, UniqueFd *archive) {
  const PackageDataLock lock(request.pkg_id, PackageUse::kPack);
  if (!may_be_packed(request.pkg_id, request.root)) {
    *request.error = QUARN_REFUSED;
    return;
  }
  const PackageRoot package(request.root);
  if (!*archive) package.create_directory_of(request.zip_path);
  file_info_table_h *made = nullptr;
  ready_file_info_table(&made);
  const std::unique_ptr<file_info_table_h, ReleaseTable> table(made);
  if (table == nullptr) {
    LOGE("file_info_table is NULL");
    *request.error = QUARN_REFUSED;
    return;
  }
  if (!*archive) *archive = create_archive(request.zip_path);
  ArchiveFile file(archive->get());
  zlib_filefunc64_def functions = file.functions();
  zipFile zip = file.is_open()
                    ? zipOpen2_64(request.zip_path, APPEND_STATUS_CREATE, nullptr, &functions)
                    : nullptr;
  if (zip == nullptr) {
    LOGE("zipOpen() failed, zf is NULL");
    *request.error = QUARN_UNREADABLE;
    return;
  }
  pack_into(request, package, table.get(), &file, zip);
}

}  // namespace

UniqueFd make_archive(const char *pkg_id, const char *root, const char *zip_path, int *error,
                      const archive_bounds &bounds, archive_excess *excess,
                      const std::atomic<bool> *stop) {
  UniqueFd archive;
  pack_package({pkg_id, root, zip_path, error, bounds, excess, stop}, &archive);
  return archive;
}

void fill_archive(const char *pkg_id, const char *root, UniqueFd *archive, int *error,
                  const archive_bounds &bounds, archive_excess *excess) {
  pack_package({pkg_id, root, "", error, bounds, excess, nullptr}, archive);
}

void make_zip_data(const char *pkg_id, const char *root, const char *zip_path, int *error,
                   const archive_bounds &bounds, archive_excess *excess,
                   const std::atomic<bool> *stop) {
  make_archive(pkg_id, root, zip_path, error, bounds, excess, stop);
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
  if (packing != nullptr) {
    packing->data_dirs.emplace_back(fcntl(dirfd(opened.get()), F_DUPFD_CLOEXEC, 0));
  }
  std::string path = dir;
  const ActAsPackage acting(walk.user);
  if (!acting) {
    LOGE("cannot act as user %u : %d", walk.user.uid, errno);
    *error = QUARN_REFUSED;
    return false;
  }
  return walk_dir(&walk, opened.get(), &path, 0);
}

bool add_file_to_zip(const char *root, zipFile zip, const char *file, int *error) {
  struct stat status {};
  std::string name;
  const UniqueFd parent = safe_open_parent(file, &name);
  const UniqueFd fd = parent ? open_as_package(parent.get(), name.c_str(), O_RDONLY | O_NONBLOCK, 0,
                                               user_of_package(), &status)
                             : UniqueFd();
  if (!fd || !S_ISREG(status.st_mode)) {
    LOGE("fopen() failed, file is NULL");
    *error = QUARN_REFUSED;
    return false;
  }
  return add_open_file(zip, file, file + std::strlen(root) + 1, fd.get(), status, error);
}

void insert_file_info_table_to_zip(file_info_table_h *table, zipFile zip, const char *pkg_id,
                                   const char *root, int *error) {
  std::size_t size = 0;
  const char *text = json_object_to_json_string_length(table->root, JSON_C_TO_STRING_SPACED, &size);
  const std::string path = package_files(pkg_id, root).table();
  // The table goes into the archive from memory: a file among the data would take the place of one
  // that the application calls the same. A directory in that place is one that no restore removes.
  if (text == nullptr || is_directory(path.c_str())) {
    LOGE("Writing to File %s Failed", path.c_str());
    LOGE("fail. insert_file_info_table_to_zip : %d", QUARN_REFUSED);  // not written
    LOGE("fail. insert_file_info_table_to_zip : %d", QUARN_REFUSED);  // nor there
    *error = QUARN_REFUSED;
  } else {
    MemorySource source(text, size);
    add_entry(zip, path.c_str(), path.c_str() + std::strlen(root) + 1, &source, size, error);
  }
  json_object_put(table->root);
  table->root = nullptr;
  table->symbolic_list = nullptr;
}
