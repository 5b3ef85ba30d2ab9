/**
 * @file state_file.h
 * @brief The small key files that hold an embedded device's state.
 *
 * They lie in DIR/state. A file is only ever replaced whole, so that a reader
 * needs no lock; whoever changes one holds the device's lock from reading to
 * replacing. A missing file is an empty one. Any thread.
 */
#ifndef QUARN_EMBEDDED_STATE_FILE_H
#define QUARN_EMBEDDED_STATE_FILE_H

#include <glib.h>

#include <functional>
#include <memory>
#include <string>
#include <utility>

namespace embedded {

struct KeyFileUnref {
  void operator()(GKeyFile *file) const { g_key_file_unref(file); }
};
struct GFree {
  void operator()(void *memory) const { g_free(memory); }
};
struct StrvFree {
  void operator()(gchar **texts) const { g_strfreev(texts); }
};
using KeyFilePtr = std::unique_ptr<GKeyFile, KeyFileUnref>;
using GText = std::unique_ptr<gchar, GFree>;
using GTexts = std::unique_ptr<gchar *, StrvFree>;

/** Environment variable that names the device directory of a process. */
inline constexpr char kDeviceVariable[] = "QUARN_DEVICE_DIR";

/** The device directory of this process, empty when there is none. */
std::string current_device();

/** DIR/state/@p file. */
std::string state_path(const std::string &device, const std::string &file);

/** Read a state file; null when it is there but cannot be read. */
KeyFilePtr read_state(const std::string &device, const std::string &file);

/** Replace a state file: temporary file, fsync, rename, fsync of the folder. */
bool write_state(const std::string &device, const std::string &file, GKeyFile *content);

/** The same for any text and mode. @p file is relative to DIR/state. */
bool write_state_text(const std::string &device, const std::string &file, const std::string &text,
                      unsigned int mode);

/** The lock of a device's state, held from construction to destruction. */
class StateLock {
 public:
  explicit StateLock(const std::string &device);
  ~StateLock();
  StateLock(const StateLock &) = delete;
  StateLock &operator=(const StateLock &) = delete;
  StateLock(StateLock &&other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
  explicit operator bool() const { return fd_ >= 0; }

 private:
  int fd_;
};

/**
 * Change a state file under the device's lock.
 * @param change returns false to leave the file as it is
 * @return false when the file could not be read or replaced, or was left
 */
bool edit_state(const std::string &device, const std::string &file,
                const std::function<bool(GKeyFile *)> &change);

/**
 * The same, returning when the change is settled: the disk is waited for by a
 * thread, which holds the lock, and by the next change of this process.
 * @return false when the file could not be read, or was left
 */
bool edit_state_behind(const std::string &device, const std::string &file,
                       const std::function<bool(GKeyFile *)> &change);

/** Wait until what edit_state_behind() has settled is on the disk. */
void wait_for_state();

/** Delete what writers that were killed have left; the state itself is whole. */
void sweep_state(const std::string &device);

/** Text of a key, empty when it is missing. */
std::string text_of(GKeyFile *file, const char *group, const char *key);

/** Whole number of a key, @p otherwise when it is missing or no number. */
gint64 number_of(GKeyFile *file, const char *group, const char *key, gint64 otherwise);

/** Milliseconds since the Unix epoch by the clock of this process's device. */
gint64 now_ms();

}  // namespace embedded

#endif
