// Packs, unpacks or restores one application tree with the daemon's own functions, for
// measurements of whole processes; or runs the codec alone over the tree's files.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <vector>

#ifdef QUARN_BENCH_RESTORE
#include "quarn_d_restore/snapshot.h"
#include "quarn_d_restore/walk.h"
#endif
#include "quarn_d_utils/archive.h"
#include "quarn_d_utils/codec.h"

namespace {

using Bytes = std::vector<unsigned char>;

class FromBytes : public ByteSource {
 public:
  explicit FromBytes(const Bytes &bytes) : bytes_(bytes) {}
  long read(unsigned char *data, std::size_t size, bool *end) override {
    const std::size_t count = std::min(size, bytes_.size() - at_);
    std::memcpy(data, bytes_.data() + at_, count);
    at_ += count;
    *end = at_ == bytes_.size();
    return static_cast<long>(count);
  }

 private:
  const Bytes &bytes_;
  std::size_t at_ = 0;
};

class ToBytes : public ByteSink {
 public:
  bool write(const unsigned char *data, std::size_t size) override {
    bytes.insert(bytes.end(), data, data + size);
    return true;
  }
  Bytes bytes;
};

double cpu_seconds() {
  timespec now{};
  clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) / 1e9;
}

bool read_file(const char *path, Bytes *bytes) {
  std::FILE *file = std::fopen(path, "rb");
  if (file == nullptr) return false;
  bytes->resize(std::filesystem::file_size(path));
  const bool whole = std::fread(bytes->data(), 1, bytes->size(), file) == bytes->size();
  std::fclose(file);
  return whole;
}

/** Prints the tree's bytes, and the CPU seconds of deflating and of inflating them in memory. */
int run_codec(const char *root) {
  const auto deflater = make_codec(CodecUse::kDeflate);
  const auto inflater = make_codec(CodecUse::kInflate);
  double times[2] = {};
  std::uint64_t total = 0;
  for (const auto &entry : std::filesystem::recursive_directory_iterator(root)) {
    if (!entry.is_regular_file()) continue;
    Bytes plain;
    if (!read_file(entry.path().c_str(), &plain)) return 1;
    CodecTotals totals;
    ToBytes deflated;
    ToBytes inflated;
    deflated.bytes.reserve(plain.size() + 4096);
    inflated.bytes.reserve(plain.size());
    FromBytes source(plain);
    double start = cpu_seconds();
    if (deflater->deflate(&source, &deflated, &totals) != CodecResult::kDone) return 1;
    times[0] += cpu_seconds() - start;
    FromBytes back(deflated.bytes);
    start = cpu_seconds();
    if (inflater->inflate(&back, &inflated, &totals) != CodecResult::kDone) return 1;
    times[1] += cpu_seconds() - start;
    if (inflated.bytes != plain) return 1;
    total += plain.size();
  }
  std::printf("%llu %.6f %.6f\n", static_cast<unsigned long long>(total), times[0], times[1]);
  return 0;
}

#ifdef QUARN_BENCH_RESTORE
/** The steps of a restore from the cloud that replace data, once the archive is there. */
int restore(const char *pkgid, const char *root, const char *archive) {
  unzip_report report;
  int result = temp_backup_initial_app_data(pkgid, root);
  if (result == 0) result = unzip_data(pkgid, root, archive, &report);
  if (result == 0 && !report.complete()) result = 1;
  if (result == 0 && restore_app_info(pkgid, root) == 0) result = 1;
  return result;
}
#endif

}  // namespace

int main(int argc, char **argv) {
  if (argc == 3 && std::strcmp(argv[1], "codec") == 0) return run_codec(argv[2]);
  if (argc != 5) {
    std::fputs("usage: archive_tool pack|unpack|restore ROOT PKGID ZIP | codec ROOT\n", stderr);
    return 64;
  }
#ifdef QUARN_BENCH_RESTORE
  if (std::strcmp(argv[1], "restore") == 0) return restore(argv[3], argv[2], argv[4]);
#endif
  if (std::strcmp(argv[1], "pack") == 0) {
    int error = 0;
    make_zip_data(argv[3], argv[2], argv[4], &error);
    return error;
  }
  unzip_report report;
  const int result = unzip_data(argv[3], argv[2], argv[4], &report);
  return result == 0 && !report.complete() ? 1 : result;
}
