// Packs, unpacks or restores one application tree with the daemon's own functions, for
// measurements of whole processes.
#include <cstdio>
#include <cstring>

#ifdef QUARN_BENCH_RESTORE
#include "quarn_d_restore/quarn_d_restore.h"
#endif
#include "quarn_d_utils/quarn_d_utils.h"

namespace {

#ifdef QUARN_BENCH_RESTORE
/** The steps of a restore from the cloud that replace data, once the archive is there. */
int restore(const char *pkgid, const char *root, const char *archive) {
  unzip_report report;
  int result = temp_backup_initial_app_data(pkgid, root);
  if (result == 0) result = unzip_data(pkgid, root, archive, &report);
  if (result == 0 && !report.complete()) result = 1;
  if (result == 0 && restore_app_info(pkgid, root) == 0) result = 1;
  return result;
}
#endif

}  // namespace

int main(int argc, char **argv) {
  if (argc != 5) {
    std::fputs("usage: archive_tool pack|unpack|restore ROOT PKGID ZIP\n", stderr);
    return 64;
  }
#ifdef QUARN_BENCH_RESTORE
  if (std::strcmp(argv[1], "restore") == 0) return restore(argv[3], argv[2], argv[4]);
#endif
  if (std::strcmp(argv[1], "pack") == 0) {
    int error = 0;
    make_zip_data(argv[3], argv[2], argv[4], &error);
    return error;
  }
  unzip_report report;
  const int result = unzip_data(argv[3], argv[2], argv[4], &report);
  return result == 0 && !report.complete() ? 1 : result;
}
