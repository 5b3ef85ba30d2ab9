#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "quarn_common.h"
#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kFileMode = 0600;
constexpr mode_t kFolderMode = 0755;
constexpr int kStored = 0;
constexpr int kRaw = 1;
// What a snapshot holds: only there can an unpacking be undone.
constexpr const char *kDataDirs[] = {"data/", "shared/data/", "shared/trusted/"};

enum class Extracted { kDone, kRefused, kFailed };

zlib_filefunc64_def archive_functions() {
  zlib_filefunc64_def table = {};
  fill_fopen64_filefunc(&table);
  // The archive was opened safely beforehand; minizip gets that file whatever its name.
  table.zopen64_file = [](voidpf file, const void *, int) { return file; };
  return table;
}

class EntrySource : public ByteSource {
 public:
  explicit EntrySource(unzFile archive) : archive_(archive) {}
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

/** Puts the entries of one archive below one root. */
class Unpacker {
 public:
  Unpacker(const char *pkg_id, const char *destination)
      : destination_(destination),
        working_(pkg_id, destination),
        root_(safe_open(destination, O_PATH | O_DIRECTORY)) {}

  Extracted extract(unzFile archive, const char *name) {
    unz_file_info64 info = {};
    if (unzGetCurrentFileInfo64(archive, &info, nullptr, 0, nullptr, 0, nullptr, 0) != UNZ_OK) {
      return Extracted::kFailed;
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
    UniqueFd file(parent < 0 ? -1 : create(parent, path.c_str() + slash + 1));
    if (!file) {
      LOGE("fopen() failed, file is NULL %s", (destination_ + "/" + path).c_str());
      return Extracted::kFailed;
    }
    return write(archive, info, &file, path);
  }

 private:
  static Extracted refuse(const char *name, const char *why) {
    LOGE("refused archive entry %s: %s", name, why);
    return Extracted::kRefused;
  }

  const char *refusal(const char *name, const unz_file_info64 &info) const {
    const std::string path = name;
    if (path.size() != info.size_filename) return "its name holds a NUL";
    if (path.empty() || path.front() == '/') return "its name is absolute or empty";
    if (path.back() == '/') return "it is a directory";
    for (std::size_t start = 0; start <= path.size();) {
      const std::size_t end = std::min(path.find('/', start), path.size());
      if (!is_safe_path_component(path.substr(start, end - start))) {
        return "its name leaves its place";
      }
      start = end + 1;
    }
    bool in_data = false;
    for (const char *dir : kDataDirs)
      in_data = in_data || path.compare(0, std::strlen(dir), dir) == 0;
    if (!in_data) return "it does not belong to the application's data";
    if (working_.contain(destination_ + "/" + path)) return "it is a working file of a restore";
    if (info.compression_method != Z_DEFLATED && info.compression_method != kStored) {
      return "its compression is not known";
    }
    if ((info.flag & 1U) != 0) return "it is encrypted";
    return nullptr;
  }

  /** The folder of an entry, made when missing; the last one is kept open. -1 with errno. */
  int open_parent(const std::string &folder) {
    if (parent_ && folder == parent_name_) return parent_.get();
    UniqueFd at(root_ ? fcntl(root_.get(), F_DUPFD_CLOEXEC, 0) : -1);
    for (std::size_t start = 0; at && start <= folder.size();) {
      const std::size_t end = std::min(folder.find('/', start), folder.size());
      const std::string name = folder.substr(start, end - start);
      if (mkdirat(at.get(), name.c_str(), kFolderMode) != 0 && errno != EEXIST) return -1;
      UniqueFd next(
          openat(at.get(), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
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

  static bool is_link(int dir, const std::string &name) {
    struct stat status {};
    return fstatat(dir, name.c_str(), &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISLNK(status.st_mode);
  }

  /** A file that nobody else has open, whatever lay under its name. */
  static int create(int parent, const char *name) {
    constexpr int kFlags = O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC;
    const int fd = openat(parent, name, kFlags, kFileMode);
    if (fd >= 0 || errno != EEXIST) return fd;
    if (unlinkat(parent, name, 0) != 0) return -1;  // a directory stays
    return openat(parent, name, kFlags, kFileMode);
  }

  Extracted write(unzFile archive, const unz_file_info64 &info, UniqueFd *file,
                  const std::string &path) {
    EntrySource source(archive);
    FileSink sink(file->get(), info.uncompressed_size);
    CodecTotals totals;
    const CodecResult result = info.compression_method == kStored
                                   ? copy_stored(&source, &sink, &totals)
                                   : codec_->inflate(&source, &sink, &totals);
    const bool closed = close(file->release()) == 0;
    if (sink.too_long()) {
      unlinkat(parent_.get(), path.c_str() + path.rfind('/') + 1, 0);
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
  UniqueFd root_;
  UniqueFd parent_;
  std::string parent_name_;
  std::unique_ptr<Codec> codec_;
};

struct CloseArchive {
  void operator()(void *archive) const { unzClose(archive); }
};
using Archive = std::unique_ptr<void, CloseArchive>;

Archive open_archive(const char *zip_path) {
  UniqueFd fd = safe_open(zip_path, O_RDONLY | O_NONBLOCK);
  if (!fd) return nullptr;
  struct stat status {};
  if (fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) return nullptr;
  std::FILE *file = fdopen(fd.get(), "rb");
  if (file == nullptr) return nullptr;
  fd.release();
  zlib_filefunc64_def functions = archive_functions();
  functions.opaque = file;
  Archive archive(unzOpen2_64(zip_path, &functions));
  // minizip closes the file only once it has accepted it as an archive, or has failed after opening
  return archive;
}

/** What an archive announces must be what a backup can hold; the entries are held to it later. */
bool announces_too_much(unzFile archive) {
  std::uint64_t entries = 0;
  std::uint64_t size = 0;
  for (int at = unzGoToFirstFile(archive); at == UNZ_OK; at = unzGoToNextFile(archive)) {
    unz_file_info64 info = {};
    if (unzGetCurrentFileInfo64(archive, &info, nullptr, 0, nullptr, 0, nullptr, 0) != UNZ_OK) {
      break;
    }
    ++entries;
    size += std::min<std::uint64_t>(info.uncompressed_size, kMaxUnpackedSize + 1);
    if (entries > kMaxArchiveEntries || size > kMaxUnpackedSize) return true;
  }
  return false;
}

/** One entry, under the names and with the messages of its steps. 14 when memory is out. */
int unpack_entry(Unpacker *unpacker, unzFile archive, CString *name, unzip_report *report) {
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
  switch (unpacker->extract(archive, name->get())) {
    case Extracted::kDone:
      ++report->extracted;
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

}  // namespace

int unzip_data(const char *pkg_id, const char *destination, const char *zip_path,
               unzip_report *report) {
  *report = {};
  const Archive archive = open_archive(zip_path);
  if (archive == nullptr) {
    LOGE("unzOpen() failed, unzf is NULL");
    return QUARN_UNREADABLE;
  }
  if (announces_too_much(archive.get())) {
    LOGE("refused archive %s: it unpacks to more than a backup can hold", zip_path);
    return QUARN_UNREADABLE;
  }
  int at = unzGoToFirstFile(archive.get());
  if (at != UNZ_OK) {
    LOGE("unzGoToFirstFile() failed, unz_err = [%d]", at);
    return QUARN_UNREADABLE;
  }
  Unpacker unpacker(pkg_id, destination);
  CString name;
  unz_global_info64 global = {};
  unzGetGlobalInfo64(archive.get(), &global);
  std::uint64_t visited = 0;
  for (; at == UNZ_OK; at = unzGoToNextFile(archive.get())) {
    ++visited;
    const int result = unpack_entry(&unpacker, archive.get(), &name, report);
    unzCloseCurrentFile(archive.get());
    if (result != QUARN_OK) return result;
  }
  // a directory that breaks off hides entries
  if (visited < global.number_entry) ++report->failed;
  return QUARN_OK;
}

int unzip_data(const char *pkg_id, const char *destination, const char *zip_path) {
  unzip_report report;
  return unzip_data(pkg_id, destination, zip_path, &report);
}

bool extract_file_from_zip(const char *pkg_id, const char *destination, unzFile archive,
                           const char *name) {
  return Unpacker(pkg_id, destination).extract(archive, name) == Extracted::kDone;
}
