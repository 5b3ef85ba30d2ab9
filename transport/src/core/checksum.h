/**
 * @file checksum.h
 * @brief A checksum over bytes as they come.
 */
#ifndef BACKUP_TRANSPORT_CHECKSUM_H
#define BACKUP_TRANSPORT_CHECKSUM_H

#include <glib.h>

#include <memory>
#include <string>

namespace transport {

/**
 * Count with libcrypto from now on, where @p library, which stays loaded, depends on it and its
 * exit handler is off. It has the processor's own instructions for it and is several times as fast
 * as GLib, which counts else; to load it for that alone would take more memory than it is worth.
 * Any thread, once.
 */
void count_checksums_with(void *library);

/** MD5 or SHA-256. One thread at a time. After hex() nothing more can be added. */
class Checksum {
 public:
  explicit Checksum(GChecksumType type);
  ~Checksum();
  Checksum(const Checksum &) = delete;
  Checksum &operator=(const Checksum &) = delete;

  void add(const char *data, std::size_t size);
  std::string hex();

 private:
  struct Free {
    void operator()(GChecksum *checksum) const { g_checksum_free(checksum); }
  };

  void *context_ = nullptr;                    // libcrypto's, or
  std::unique_ptr<GChecksum, Free> checksum_;  // GLib's
  std::string hex_;                            // once it was asked for
};

}  // namespace transport

#endif
