// Stands in for the journal's library: what is sent is written to $FAKE_JOURNAL.
#include <sys/uio.h>

#include <cstdlib>
#include <fstream>

extern "C" __attribute__((visibility("default"))) int sd_journal_sendv(const iovec *fields,
                                                                       int count) {
  const char *path = std::getenv("FAKE_JOURNAL");
  if (path == nullptr) return -1;
  std::ofstream journal(path, std::ios::app);
  for (int i = 0; i < count; ++i) {
    journal.write(static_cast<const char *>(fields[i].iov_base),
                  static_cast<std::streamsize>(fields[i].iov_len));
    journal << "\n";
  }
  return 0;
}
