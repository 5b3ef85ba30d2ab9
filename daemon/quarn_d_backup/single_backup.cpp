#include "quarn_d_backup/single_backup.h"

#include <glib.h>

#include "glib_handles.h"
#include "quarn_common.h"
#include "quarn_d_backup/archive_upload.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/package_archive.h"
#include "quarn_d_utils/nested_loop.h"

single_backup::single_backup(const single_backup_subject &subject) : ctx_(new backup_context) {
  ctx_->single_package = true;
  ctx_->cur_pkg_id = subject.pkg_id;
  ctx_->cur_version = subject.version;
  ctx_->cur_pkg_type = subject.type;
  ctx_->cur_root_path = subject.root;
  ctx_->model_name = subject.model;
  ctx_->serial_number = subject.serial;
}

bool single_backup::take_first_application() {
  if (!enabled_ || taken_) return false;
  taken_ = true;
  return true;
}

int single_backup::make_archive(const char *app_id) {
  const int result = make_app_data_zip(ctx_.get(), app_id);
  if (result != QUARN_OK) ctx_->result = result;
  return result;
}

void single_backup::upload() {
  upload_app_data(ctx_.get(), ctx_->cur_pkg_id.c_str(), ctx_->cur_root_path.c_str(),
                  ctx_->cur_version.c_str());
}

bool single_backup::upload_under_way() const { return ctx_->upload_remain > 0; }

int single_backup::wait() {
  const GMainLoopPtr loop(new_wait_loop());
  // Before the look at what remains: the last answer may come on any thread.
  ctx_->wait_loop = g_main_loop_ref(loop.get());
  if (upload_under_way()) run_nested_loop(loop.get());
  const GMainLoopPtr left(ctx_->wait_loop.exchange(nullptr));
  if (upload_under_way()) {
    // Withdrawn, or the daemon ends. The run lives on until its answer comes, if it comes.
    abandon_single_upload(ctx_.get());
    return QUARN_CANCELLED;
  }
  return ctx_->result;
}
