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

/** One thread at a time. After hex() nothing more can be added. */
class Checksum {
 public:
  explicit Checksum(GChecksumType type) : checksum_(g_checksum_new(type)) {}

  void add(const char *data, std::size_t size) {
    g_checksum_update(checksum_.get(), reinterpret_cast<const guchar *>(data),
                      static_cast<gssize>(size));
  }

  std::string hex() const { return g_checksum_get_string(checksum_.get()); }

 private:
  struct Free {
    void operator()(GChecksum *checksum) const { g_checksum_free(checksum); }
  };
  std::unique_ptr<GChecksum, Free> checksum_;
};

}  // namespace transport

#endif
