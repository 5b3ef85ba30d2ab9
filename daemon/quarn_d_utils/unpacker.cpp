#include "quarn_d_utils/unpacker.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstring>
#include <utility>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "quarn_d_utils/archive_entry.h"
#include "quarn_d_utils/entry_reader.h"
#include "quarn_d_utils/unpacked_file.h"
#include "quarn_log.h"

namespace {

constexpr mode_t kTableMode = 0600;
constexpr mode_t kFolderMode = 0755;
// A snapshot holds the data directories: only there can an unpacking be undone.
constexpr char kNoData[] = "it does not belong to the application's data";
constexpr char kWorkingFile[] = "it is a working file of a restore";

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

/** True for what lies in a data directory, and for such a directory and those that hold one. */
static bool is_data_place(const std::string &path) {
  return std::any_of(kDataDirs.begin(), kDataDirs.end(), [&](const std::string &dir) {
    const std::string inside = dir + "/";
    return path.compare(0, inside.size(), inside) == 0 || inside.compare(0, path.size(), path) == 0;
  });
}

Extracted refuse(const char *name, const char *why) {
  LOGE("refused archive entry %s: %s", name, why);
  return Extracted::kRefused;
}

}  // namespace

Unpacker::Unpacker(const char *pkg_id, const char *destination)
    : destination_(destination),
      working_(pkg_id, destination),
      table_(working_.table().substr(destination_.size() + 1)),
      root_(safe_open(destination, O_PATH | O_DIRECTORY)),
      user_(user_of_package()),
      acting_(user_) {}

Extracted Unpacker::extract(ByteSource *source, const unz_file_info64 &info, const char *name) {
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
    return refuse(name,
                  errno == ELOOP ? "its way leads through a link" : "its way leads through a file");
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

/** A folder's own entry, of an archive that another program made: without it nothing is lost. */
void Unpacker::make_folder(const char *name, const unz_file_info64 &info) {
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

const char *Unpacker::refusal(const char *name, const unz_file_info64 &info) const {
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
const char *Unpacker::name_refusal(const std::string &path) const {
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
int Unpacker::open_parent(const std::string &folder) {
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

bool Unpacker::is_link(int dir, const std::string &name) const {
  struct stat status {};
  return status_as_package(dir, name.c_str(), user_, &status) == 0 && S_ISLNK(status.st_mode);
}

/** A file that nobody else has open, whatever lay under its name. */
UniqueFd Unpacker::create(int parent, const std::string &path, std::size_t name_at) {
  if (parent < 0) return {};
  const char *name = path.c_str() + name_at;
  if (path == table_) {  // the daemon's own, until it has been read
    const ActAsRoot root;
    return create_named(parent, name, kTableMode, {0, 0});
  }
  return create_named(parent, name, kUnpackedMode, user_);
}

UniqueFd Unpacker::create_named(int parent, const char *name, mode_t mode,
                                const package_user &owner) {
  constexpr int kFlags = O_WRONLY | O_CREAT | O_EXCL;
  // where one name was taken the next one will be, and then this saves a call
  if (expect_taken_) expect_taken_ = unlink_as_package(parent, name, 0, user_) == 0;
  UniqueFd file = open_as_package(parent, name, kFlags, mode, owner, nullptr);
  if (file || errno != EEXIST) return file;
  expect_taken_ = unlink_as_package(parent, name, 0, user_) == 0;
  if (!expect_taken_) return {};  // a directory stays
  return open_as_package(parent, name, kFlags, mode, owner, nullptr);
}

Extracted Unpacker::write(ByteSource *source, const unz_file_info64 &info, UniqueFd *file,
                          const std::string &path) {
  FileSink sink(file->get(), info.uncompressed_size);
  CodecTotals totals;
  const CodecResult result = is_stored(info) ? copy_stored(source, &sink, &totals)
                                             : codec_->inflate(source, &sink, &totals);
  const bool closed = close(file->release()) == 0;
  if (sink.too_long()) {
    // What stays nobody may open, and the archive counts as incomplete.
    static_cast<void>(
        unlink_as_package(parent_.get(), path.c_str() + path.rfind('/') + 1, 0, user_));
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
