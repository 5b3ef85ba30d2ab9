#include "quarn_d_memps.h"

#include <fcntl.h>
#include <unistd.h>

#include <cctype>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "quarn_d_lifecycle.h"
#include "quarn_d_utils/handles.h"
#include "quarn_log.h"

namespace {

constexpr std::size_t kPathSize = 128;
constexpr std::size_t kBufferStep = 524288;
constexpr double kAtOnce = 0.0;
constexpr char kAnonymous[] = "[anon]";

constexpr char kCountedMajor = '3'; /**< kernels whose entries grew with the minor version */
constexpr int kGrownMinor = 10;
constexpr int kLinesBeforeGrowth = 7;
constexpr int kLinesAfterGrowth = 8;
constexpr int kLinesOfOtherKernels = 4;
constexpr int kMinorDigits = 2;

// Kept between calls and never shrunk, so that repeated checks do not allocate.
CString buffer;
std::size_t buffer_size = 0;
bool verbose = false;

int open_smaps_of(int pid) {
  char path[kPathSize];
  std::snprintf(path, sizeof path, "/proc/%d/smaps", pid);
  return open(path, O_RDONLY | O_CLOEXEC);
}

/** Cut the next line out of the text; null at its end or for an empty line. */
char *take_line(char **cursor) {
  char *line = *cursor;
  if (line == nullptr || *line == '\0') return nullptr;
  char *end = std::strchr(line, '\n');
  if (end != nullptr) {
    *end = '\0';
    *cursor = end + 1;
  } else {
    *cursor = line + std::strlen(line);
  }
  return *line == '\0' ? nullptr : line;
}

/** Whether a mapping's first line, "START-END ...", begins here. */
bool is_header(const char *text) {
  std::size_t digits = 0;
  while (std::isxdigit(static_cast<unsigned char>(text[digits]))) ++digits;
  if (digits == 0 || text[digits] != '-') return false;
  return std::isxdigit(static_cast<unsigned char>(text[digits + 1])) != 0;
}

bool parse_header(const char *line, mapinfo *info) {
  unsigned long long start = 0;
  unsigned long long end = 0;
  char perm[5] = "";
  int name_at = 0;
  if (!is_header(line)) return false;
  // Address range, permissions, offset, device, inode, name.
  if (std::sscanf(line, "%llx-%llx %4s %*s %*s %*s %n", &start, &end, perm, &name_at) != 3) {
    return false;
  }
  info->start = start;
  info->end = end;
  info->perm = perm;
  info->name = name_at > 0 && line[name_at] != '\0' ? line + name_at : kAnonymous;
  return true;
}

/** The counters that an entry has; older kernels have no "Pss". */
class Counters {
 public:
  explicit Counters(mapinfo *info)
      : counters_{{"Size: %d kB", &info->size, true},
                  {"Rss: %d kB", &info->rss, true},
                  {"Pss: %d kB", &info->pss, false},
                  {"Shared_Clean: %d kB", &info->shared_clean, true},
                  {"Shared_Dirty: %d kB", &info->shared_dirty, true},
                  {"Private_Clean: %d kB", &info->private_clean, true},
                  {"Private_Dirty: %d kB", &info->private_dirty, true}} {}

  /** Take a line when it is one of theirs; kernels print others among them. */
  void read(const char *line) {
    for (Counter &counter : counters_) {
      if (counter.missing && std::sscanf(line, counter.format, counter.value) == 1) {
        counter.missing = false;
        return;
      }
    }
  }

  bool complete() const {
    for (const Counter &counter : counters_) {
      if (counter.missing && counter.required) return false;
    }
    return true;
  }

 private:
  struct Counter {
    const char *format;
    int *value;
    bool required;
    bool missing = true;
  };
  Counter counters_[7];
};

/** Read the whole of a process's smaps into the buffer. */
bool read_smaps(int pid) {
  const UniqueFd smaps(memps_facts.open_smaps(pid));
  if (!smaps) return false;
  std::size_t used = 0;
  for (;;) {
    // One byte is the terminator's.
    if (used + 1 >= buffer_size) {
      auto *grown = static_cast<char *>(std::realloc(buffer.get(), buffer_size + kBufferStep));
      if (grown == nullptr) return false;
      static_cast<void>(buffer.release());
      buffer.reset(grown);
      buffer_size += kBufferStep;
    }
    const ssize_t got =
        TEMP_FAILURE_RETRY(read(smaps.get(), buffer.get() + used, buffer_size - used - 1));
    if (got < 0) return false;
    if (got == 0) break;
    used += static_cast<std::size_t>(got);
  }
  buffer.get()[used] = '\0';
  return true;
}

/** Mappings of one file in a row count as one; labelled ones stay apart. */
bool belongs_to(const mapinfo &front, const mapinfo &info) {
  return info.name[0] != '[' && info.name == front.name;
}

void merge_into(mapinfo *front, const mapinfo &info) {
  front->size += info.size;
  front->rss += info.rss;
  front->pss += info.pss;
  front->shared_clean += info.shared_clean;
  front->shared_dirty += info.shared_dirty;
  front->private_clean += info.private_clean;
  front->private_dirty += info.private_dirty;
  front->end = info.end;
  front->perm = info.perm;
}

}  // namespace

memps_source memps_facts = {uname, open_smaps_of};
int smaps_lines = 0;

void check_memps_status() {
  const int usage = get_memory_usage(getpid());
  if (usage <= kMempsCeilingKb) return;
  LOGI("=== memps(%dKB) exceed %dKB, so quarn will restart ===", usage, kMempsCeilingKb);
  request_quarn_terminate(kAtOnce, true);
}

int get_memory_usage(int pid) {
  verbose = true;
  check_kernel_version();
  mapinfo *const maps = load_maps(pid);
  int usage = 0;
  for (const mapinfo *info = maps; info != nullptr; info = info->next) usage += info->pss;
  free_maps(maps);
  return usage;
}

mapinfo *load_maps(int pid) {
  if (!read_smaps(pid)) return nullptr;
  char *cursor = buffer.get();
  mapinfo *maps = nullptr;
  int count = 0;
  while (mapinfo *read = read_mapinfo(&cursor, smaps_lines)) {
    std::unique_ptr<mapinfo> info(read);
    ++count;
    if (maps != nullptr && belongs_to(*maps, *info)) {
      merge_into(maps, *info);
    } else {
      info->next = maps;
      maps = info.release();
    }
  }
  if (verbose) LOGD("%d mappings of process %d", count, pid);
  return maps;
}

void free_maps(mapinfo *maps) {
  while (maps != nullptr) {
    const std::unique_ptr<mapinfo> info(maps);
    maps = info->next;
  }
}

mapinfo *read_mapinfo(char **cursor, int /*extra*/) {
  const char *line = take_line(cursor);
  if (line == nullptr) return nullptr;
  auto info = std::make_unique<mapinfo>();
  Counters counters(info.get());
  const bool header_is_good = parse_header(line, info.get());
  while (**cursor != '\0' && **cursor != '\n' && !is_header(*cursor)) {
    counters.read(take_line(cursor));
  }
  if (!header_is_good || !counters.complete()) {
    std::printf("mi get error\n");
    return nullptr;
  }
  return info.release();
}

void check_kernel_version() {
  struct utsname name {};
  if (memps_facts.kernel_name(&name) != 0) return;
  if (name.release[0] != kCountedMajor) {
    smaps_lines = kLinesOfOtherKernels;
    return;
  }
  const char *dot = std::strchr(name.release, '.');
  const std::string minor = dot != nullptr ? std::string(dot + 1).substr(0, kMinorDigits) : "";
  smaps_lines = std::atoi(minor.c_str()) < kGrownMinor ? kLinesBeforeGrowth : kLinesAfterGrowth;
}
