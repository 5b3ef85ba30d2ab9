#include "fault.h"

#include <fcntl.h>
#include <glib.h>
#include <isa-l/igzip_lib.h>
#include <json-c/json.h>
#include <libxml/tree.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>
#include <unzip.h>
#include <zip.h>
#include <zlib.h>

#include <cerrno>
#include <cstdarg>
#include <cstring>
#include <new>

#include "quarn_d_utils/package_identity.h"

namespace {

struct Armed {
  const char *function = nullptr;
  int error = 0;
  int skipped = 0;
  int times = 0;
  int hits = 0;
};
thread_local Armed armed;

struct Hook {
  const char *function = nullptr;
  void (*call)() = nullptr;
};
thread_local Hook hook;

bool is_faulty(const char *function) {
  if (hook.call != nullptr && std::strcmp(hook.function, function) == 0) {
    void (*const call)() = hook.call;
    hook.call = nullptr;  // what it calls is not hooked
    {
      const ActAsRoot others;  // whoever the code under test acts as
      call();
    }
    if (hook.function != nullptr) hook.call = call;
  }
  if (armed.function == nullptr || std::strcmp(armed.function, function) != 0) return false;
  if (armed.skipped > 0) {
    --armed.skipped;
    return false;
  }
  if (armed.times == 0) return false;
  --armed.times;
  ++armed.hits;
  errno = armed.error;
  return true;
}

}  // namespace

Fault::Fault(const char *function, int error, int skipped, int times) {
  armed = {function, error, skipped, times, 0};
}
Fault::~Fault() { armed = {}; }
int Fault::hits() const { return armed.hits; }

void set_call_hook(const char *function, void (*call)()) {
  hook = {call == nullptr ? nullptr : function, call};
}

// the linker calls __wrap_X for X, and X for __real_X
#define WRAP(result, name, failure, parameters, arguments) \
  result __real_##name parameters;                         \
  result __wrap_##name parameters {                        \
    if (is_faulty(#name)) return failure;                  \
    return __real_##name arguments;                        \
  }

extern "C" {

WRAP(void *, calloc, nullptr, (size_t count, size_t size), (count, size))
WRAP(ssize_t, read, -1, (int fd, void *data, size_t size), (fd, data, size))
WRAP(ssize_t, write, -1, (int fd, const void *data, size_t size), (fd, data, size))
WRAP(ssize_t, pread, -1, (int fd, void *data, size_t size, off_t at), (fd, data, size, at))
WRAP(ssize_t, pwrite, -1, (int fd, const void *data, size_t size, off_t at), (fd, data, size, at))
WRAP(int, close, -1, (int fd), (fd))
WRAP(int, unlinkat, -1, (int dir, const char *name, int flags), (dir, name, flags))
WRAP(int, linkat, -1, (int from, const char *old_name, int to, const char *name, int flags),
     (from, old_name, to, name, flags))
WRAP(int, mkdirat, -1, (int dir, const char *name, mode_t mode), (dir, name, mode))
WRAP(int, fstatat, -1, (int dir, const char *name, struct stat *status, int flags),
     (dir, name, status, flags))
WRAP(int, fstat, -1, (int fd, struct stat *status), (fd, status))
WRAP(ssize_t, copy_file_range, -1,
     (int from, off_t *from_at, int to, off_t *to_at, size_t size, unsigned int flags),
     (from, from_at, to, to_at, size, flags))
WRAP(gchar *, g_path_get_dirname, nullptr, (const gchar *path), (path))
WRAP(json_object *, json_object_new_object, nullptr, (), ())
WRAP(xmlNodePtr, xmlDocGetRootElement, nullptr, (const xmlDoc *doc), (doc))
WRAP(int, zipWriteInFileInZip, ZIP_ERRNO, (zipFile zip, const void *data, unsigned int size),
     (zip, data, size))
WRAP(int, zipCloseFileInZipRaw64, ZIP_ERRNO, (zipFile zip, ZPOS64_T size, uLong crc),
     (zip, size, crc))
WRAP(int, unzOpenCurrentFile2, UNZ_BADZIPFILE, (unzFile zip, int *method, int *level, int raw),
     (zip, method, level, raw))
WRAP(int, unzGetCurrentFileInfo64, UNZ_BADZIPFILE,
     (unzFile zip, unz_file_info64 *info, char *name, uLong name_size, void *extra,
      uLong extra_size, char *comment, uLong comment_size),
     (zip, info, name, name_size, extra, extra_size, comment, comment_size))
WRAP(zipFile, zipOpen2_64, nullptr,
     (const void *path, int append, zipcharpc *comment, zlib_filefunc64_def *functions),
     (path, append, comment, functions))
WRAP(int, zipClose, ZIP_ERRNO, (zipFile zip, const char *comment), (zip, comment))
WRAP(int, zipOpenNewFileInZip4_64, ZIP_PARAMERROR,
     (zipFile zip, const char *name, const zip_fileinfo *info, const void *local, uInt local_size,
      const void *global, uInt global_size, const char *comment, int method, int level, int raw,
      int window, int memory, int strategy, const char *password, uLong password_crc, uLong made_by,
      uLong flags, int zip64),
     (zip, name, info, local, local_size, global, global_size, comment, method, level, raw, window,
      memory, strategy, password, password_crc, made_by, flags, zip64))
WRAP(void *, mmap, MAP_FAILED, (void *at, size_t size, int access, int flags, int fd, off_t from),
     (at, size, access, flags, fd, from))
WRAP(int, isal_deflate, INVALID_FLUSH, (isal_zstream * stream), (stream))
WRAP(int, deflate, Z_STREAM_ERROR, (z_stream * stream, int flush), (stream, flush))
WRAP(int, deflateInit2_, Z_MEM_ERROR,
     (z_stream * stream, int level, int method, int window, int memory, int strategy,
      const char *version, int size),
     (stream, level, method, window, memory, strategy, version, size))
WRAP(int, inflateInit2_, Z_MEM_ERROR,
     (z_stream * stream, int window, const char *version, int size),
     (stream, window, version, size))

int __real_openat(int dir, const char *name, int flags, ...);
int __wrap_openat(int dir, const char *name, int flags, ...) {
  mode_t mode = 0;
  if ((flags & (O_CREAT | O_TMPFILE)) != 0) {
    va_list arguments;
    va_start(arguments, flags);
    mode = va_arg(arguments, mode_t);
    va_end(arguments);
  }
  if (is_faulty((flags & O_TMPFILE) == O_TMPFILE ? "openat O_TMPFILE" : "openat")) return -1;
  return __real_openat(dir, name, flags, mode);
}

int __real_ioctl(int fd, unsigned long request, ...);
int __wrap_ioctl(int fd, unsigned long request, ...) {
  va_list arguments;
  va_start(arguments, request);
  void *const argument = va_arg(arguments, void *);
  va_end(arguments);
  if (is_faulty("ioctl")) return -1;
  return __real_ioctl(fd, request, argument);
}

}  // extern "C"

// A program may bring its own of these; what it gives is deleted as any other memory.
void *operator new(std::size_t size, const std::nothrow_t &) noexcept {
  if (is_faulty("new")) return nullptr;
  try {
    return ::operator new(size);
  } catch (const std::bad_alloc &) {
    return nullptr;
  }
}
