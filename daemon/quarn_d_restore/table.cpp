#include "quarn_d_restore/archive_table.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <cstring>

#include "files/safe_path.h"
#include "quarn_d_utils/table_reader.h"

json_object *parse_file_info_table(const char *text) {
  TableReader reader;
  TableText table(kNoTableBounds, &reader);
  table.take(text, std::strlen(text));
  return table.end() == table_state::whole ? reader.take().release() : nullptr;
}

archive_table read_archive_table(const char *path) {
  constexpr std::size_t kPiece = 16U << 10;
  archive_table read;
  const UniqueFd file = safe_open(path, O_RDONLY | O_NONBLOCK);
  struct stat status = {};
  if (!file || fstat(file.get(), &status) != 0 || !S_ISREG(status.st_mode)) return read;
  TableReader reader(TableUse::lookup);
  TableText table(kArchiveTableBounds, &reader);
  char piece[kPiece];
  ssize_t count = 0;
  do {
    count = TEMP_FAILURE_RETRY(::read(file.get(), piece, sizeof piece));
  } while (count > 0 && table.take(piece, static_cast<std::size_t>(count)));
  read.readable = count >= 0;
  if (read.readable && table.end() == table_state::whole) read.table = reader.take();
  return read;
}
