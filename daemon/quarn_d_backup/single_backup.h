/**
 * @file single_backup.h
 * @brief The backup of one package for a client's request, without a list. Main thread.
 */
#ifndef QUARN_D_BACKUP_SINGLE_BACKUP_H
#define QUARN_D_BACKUP_SINGLE_BACKUP_H

#include <string>

#include "quarn_d_backup/backup_context_ptr.h"

/** The package, and the device whose backup it is. */
struct single_backup_subject {
  std::string serial;
  std::string model;
  std::string pkg_id;
  std::string version;
  std::string type;
  std::string root;
};

class single_backup {
 public:
  explicit single_backup(const single_backup_subject &subject);

  /** An application of the package does not take part in backups. */
  void disable() { enabled_ = false; }
  [[nodiscard]] bool enabled() const { return enabled_; }

  /** True once, when backups are enabled: the package is packed at its first application. */
  [[nodiscard]] bool take_first_application();
  /** Pack the package. @return as make_app_data_zip(); what is not QUARN_OK is the result, too */
  [[nodiscard]] int make_archive(const char *app_id);
  /** Send the archive that was made. */
  void upload();
  /** Whether the upload has no answer yet. */
  [[nodiscard]] bool upload_under_way() const;
  /**
   * Wait for that answer. When the wait is ended before, the upload is abandoned, and its state
   * lives on until its answer comes.
   * @return the result of all, or QUARN_CANCELLED
   */
  [[nodiscard]] int wait();

 private:
  BackupContextPtr ctx_;
  bool enabled_ = true;
  bool taken_ = false;
};

#endif
