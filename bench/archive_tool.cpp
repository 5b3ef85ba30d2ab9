// Packs or unpacks one application tree with the daemon's own writer and reader, for measurements
// of whole processes.
#include <cstdio>
#include <cstring>

#include "quarn_d_utils/quarn_d_utils.h"

int main(int argc, char **argv) {
  if (argc != 5) {
    std::fputs("usage: archive_tool pack|unpack ROOT PKGID ZIP\n", stderr);
    return 64;
  }
  if (std::strcmp(argv[1], "pack") == 0) {
    int error = 0;
    make_zip_data(argv[3], argv[2], argv[4], &error);
    return error;
  }
  unzip_report report;
  const int result = unzip_data(argv[3], argv[2], argv[4], &report);
  return result == 0 && !report.complete() ? 1 : result;
}
