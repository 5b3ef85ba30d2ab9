// Uploads every file of a folder through the cloud transport, as the daemon does: all requests are
// made at once, in the order of their names. The store is that of $QUARN_CLOUD_CONFIG.
#include <glib.h>

#include <algorithm>
#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include "backup_transport.h"

namespace {

namespace fs = std::filesystem;

constexpr gint64 kMicrosecondsPerMillisecond = 1000;

struct Run {
  GMainLoop *loop = g_main_loop_new(nullptr, FALSE);
  std::vector<std::string> files;
  std::string folder;
  std::size_t left = 0;
  int failed = 0;
};

void ended(Run *run, int code) {
  if (code != BACKUP_TRANS_ERROR_NONE) ++run->failed;
  if (--run->left == 0) g_main_loop_quit(run->loop);
}

void on_uploaded(backup_trans_error_code code, void *data, const backup_trans_file_info_s *) {
  ended(static_cast<Run *>(data), code);
}

void on_started(backup_trans_error_code code, void *data) {
  auto *run = static_cast<Run *>(data);
  if (code != BACKUP_TRANS_ERROR_NONE) return ended(run, code);
  backup_trans_handle_h handle = backup_trans_create_handle();
  run->left = run->files.size();
  for (const std::string &file : run->files) {
    const std::string remote = run->folder + "/" + fs::path(file).filename().string();
    const int refused = backup_trans_upload_file_ors_async(
        handle, file.c_str(), remote.c_str(), on_uploaded,
        g_get_real_time() / kMicrosecondsPerMillisecond, BACKUP_TRANS_OPTION_NONE, run, nullptr);
    if (refused != BACKUP_TRANS_ERROR_NONE) ended(run, refused);
  }
}

}  // namespace

int main(int argc, char **argv) {
  if (argc != 3) {
    std::fputs("usage: upload_tool DIR REMOTE-FOLDER\n", stderr);
    return 64;
  }
  Run run;
  run.folder = argv[2];
  run.left = 1;
  for (const fs::directory_entry &entry : fs::directory_iterator(argv[1]))
    run.files.push_back(entry.path());
  std::sort(run.files.begin(), run.files.end());
  if (backup_trans_init(&run, on_started) != BACKUP_TRANS_ERROR_NONE) return 1;
  g_main_loop_run(run.loop);
  if (run.failed != 0) std::fprintf(stderr, "upload_tool: %d uploads failed\n", run.failed);
  return run.failed == 0 ? 0 : 1;
}
