/**
 * @file table_reader.h
 * @brief Makes a file-info table of its text, member by member.
 */
#ifndef QUARN_D_UTILS_TABLE_READER_H
#define QUARN_D_UTILS_TABLE_READER_H

#include <json-c/json_tokener.h>

#include "json_ptr.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/table_text.h"

/** What is kept of a table. */
enum class TableUse {
  check,  /**< nothing: every value is made, and released */
  lookup, /**< attributes, to be looked up with attributes_in_table(); no links */
  all
};

/**
 * A member of a table that was read to be looked up. It is the table's, until
 * the next is looked up.
 */
[[nodiscard]] json_object *attributes_in_table(json_object *table, json_object *member);

/** The JSON values of a table, each made by the library on its own. One thread at a time. */
class TableReader : public TableSink {
 public:
  explicit TableReader(TableUse use = TableUse::all);
  bool member(std::string_view key, std::string_view value) override;
  bool link(std::string_view element) override;
  void links() override;

  /** The table so far; entries with equal attributes share them. Null when memory is out. */
  [[nodiscard]] JsonPtr take() { return std::move(table_); }

 private:
  /** So many different attributes are remembered. */
  static constexpr std::size_t kRemembered = 8;
  /** After so many different ones, to be looked up, the others stay texts: a tenth of the memory.
   */
  static constexpr std::size_t kObjects = 512;
  struct Known {
    std::string text;
    JsonPtr object;
  };

  bool parse(std::string_view text, JsonPtr *value);
  bool attributes(std::string_view text, JsonPtr *value);
  bool decode_key(std::string_view quoted);

  Handle<json_tokener, &json_tokener_free> tokener_;
  JsonPtr table_;
  json_object *links_ = nullptr;  // the table's
  Known known_[kRemembered];
  std::size_t made_ = 0;
  std::string key_;
  const TableUse use_;
};

#endif
