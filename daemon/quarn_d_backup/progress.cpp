#include "quarn_d_backup/run_private.h"

namespace {

std::atomic<backup_progress_sink> progress_sink{nullptr};

}  // namespace

void set_backup_progress_sink(backup_progress_sink sink) { progress_sink = sink; }

void report_progress(const backup_context *ctx, backup_stage stage, const char *package,
                     backup_outcome outcome, std::uint64_t size, std::uint64_t limit) {
  const backup_progress_sink sink = progress_sink;
  if (sink == nullptr || ctx->for_pellix) return;
  backup_progress progress;
  progress.run = ctx->run_id;
  progress.stage = stage;
  progress.package = package;
  progress.outcome = outcome;
  if (stage == backup_stage::archiving) {
    progress.index = ctx->packages_examined;
  } else if (stage == backup_stage::uploading) {
    progress.index = ctx->uploads_answered;
    progress.count = ctx->uploads_total;
  }
  progress.bytes_done = ctx->bytes_uploaded;
  progress.bytes_total = ctx->bytes_to_upload;
  progress.size = size;
  progress.limit = limit;
  progress.result = ctx->result;
  sink(progress);
}
