#include "quarn_d_utils/entry_writer.h"

#include <fcntl.h>
#include <glib.h>
#include <json-c/json.h>
#include <unistd.h>

#include <algorithm>
#include <cstdint>
#include <cstring>
#include <memory>
#include <string>

#include "files/package_files.h"
#include "files/safe_path.h"
#include "quarn_common.h"
#include "quarn_d_utils/archive_entry.h"
#include "quarn_d_utils/archive_output.h"
#include "quarn_d_utils/codec.h"
#include "quarn_d_utils/file.h"
#include "quarn_d_utils/package_identity.h"
#include "quarn_d_utils/packing.h"
#include "quarn_log.h"

namespace {

constexpr int kLevel = 1;
/** Name flag of the zip format: the entry's name is UTF-8. */
constexpr uLong kUtf8Name = 1UL << 11;
constexpr uLong kMadeByDefault = 0;

thread_local std::unique_ptr<Codec> archive_codec;

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

}  // namespace

void release_entry_codec() { archive_codec.reset(); }

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
