#include <atomic>
#include <cstdint>

#include "quarn_common.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/progress_report.h"
#include "quarn_d_backup/run_notes.h"

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
  if (stage == backup_stage::finished) {
    const run_notes &notes = notes_of(ctx);
    if (ctx->result != QUARN_OK) progress.cause = request_cause_word(notes.cause);
    progress.list_written = notes.list_written;
  }
  sink(progress);
}

void report_notice(const backup_context *ctx, const char *notice, std::uint64_t size,
                   std::uint64_t limit) {
  const backup_progress_sink sink = progress_sink;
  if (sink == nullptr || ctx->for_pellix) return;
  backup_progress progress;
  progress.run = ctx->run_id;
  progress.stage = backup_stage::archiving;
  progress.index = ctx->packages_examined;
  progress.notice = notice;
  progress.size = size;
  progress.limit = limit;
  sink(progress);
}
