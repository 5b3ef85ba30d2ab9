/**
 * @file table_text.h
 * @brief A file-info table's text, taken piece by piece and held to its bounds.
 *
 * What an archive brings is a stranger's: it is looked at byte by byte, and
 * nothing is made of it but what a member within its own bounds needs.
 */
#ifndef QUARN_D_UTILS_TABLE_TEXT_H
#define QUARN_D_UTILS_TABLE_TEXT_H

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "quarn_d_utils/bounds.h"

/** How much of a table is taken. */
struct table_bounds {
  std::uint64_t text;    /**< bytes */
  std::uint64_t members; /**< files, directories and links */
};

/**
 * Those of a table from an archive. Earlier releases counted neither: they made
 * one as long as the archive unpacked to kMaxUnpackedSize, with the entries of
 * an archive, and about as many directories and links, which are none.
 */
inline constexpr table_bounds kArchiveTableBounds = {kMaxUnpackedSize - kMaxBackupSize,
                                                     2 * kMaxArchiveEntries};
/** None, for a table that this process has written. */
inline constexpr table_bounds kNoTableBounds = {UINT64_MAX, UINT64_MAX};

static_assert(kBackupBounds.table <= kArchiveTableBounds.text &&
                  kBackupBounds.members <= kArchiveTableBounds.members,
              "what is backed up can be restored");

/** What a text came to. */
enum class table_state {
  whole,
  malformed, /**< no JSON object, or one that breaks off */
  beyond     /**< a bound is broken; also that of a single value, which would be no attributes */
};

/** Gets a table's members, one at a time, as JSON texts that are valid during the call. */
class TableSink {
 public:
  virtual ~TableSink() = default;
  /** @param key with its quotes. @return false when it is not JSON, which ends the reading */
  virtual bool member(std::string_view key, std::string_view value) = 0;
  /** One element of the list of links. */
  virtual bool link(std::string_view element) = 0;
  /** That list begins; it may stay empty. */
  virtual void links() = 0;
};

/** Takes one text. One thread at a time. */
class TableText {
 public:
  /** Where in a table the next byte is; for its own use. */
  enum class Place {
    start,
    first_key,
    key,
    colon,
    value,
    behind,
    first_link,
    link,
    behind_link,
    done,
    ended
  };

  /** @param sink may be null: the text is only looked at */
  explicit TableText(const table_bounds &bounds, TableSink *sink = nullptr)
      : bounds_(bounds), sink_(sink) {}

  /** The next bytes. @return false when nothing further can make it whole */
  bool take(const char *data, std::size_t size);
  /** What it came to, behind its last bytes. */
  [[nodiscard]] table_state end() const;

 private:
  bool refuse(table_state why);
  bool take_sign(char c);
  bool begin_item(char c, Place place);
  std::size_t take_item(const char *data, std::size_t size);
  std::size_t take_quoted(const char *data, std::size_t size);
  bool take_structure(char c);
  bool end_item();
  bool count_member();

  const table_bounds bounds_;
  TableSink *const sink_;
  table_state state_ = table_state::malformed;
  Place place_ = Place::start;
  std::uint64_t size_ = 0;
  std::uint64_t members_ = 0;

  // the key or value that is being taken
  bool in_item_ = false;
  bool in_string_ = false;
  bool escaped_ = false;
  std::string open_;  // the brackets that are open, outermost first
  unsigned int values_ = 0;
  std::string item_;
  std::string key_;
};

#endif
