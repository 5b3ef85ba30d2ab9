/**
 * @file table_reader.h
 * @brief Makes a file-info table of its text, member by member.
 */
#ifndef QUARN_D_UTILS_TABLE_READER_H
#define QUARN_D_UTILS_TABLE_READER_H

#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/table_text.h"

/** The JSON values of a table, each made by the library on its own. One thread at a time. */
class TableReader : public TableSink {
 public:
  /** @param kept false: every value is made, and nothing of it is kept */
  explicit TableReader(bool kept = true);
  bool member(std::string_view key, std::string_view value) override;
  bool link(std::string_view element) override;
  void links() override;

  /** The table so far; entries with equal attributes share them. Null when memory is out. */
  JsonPtr take() { return std::move(table_); }

 private:
  /** So many different attributes are remembered. */
  static constexpr std::size_t kRemembered = 8;
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
  std::size_t next_ = 0;
  std::string key_;
  const bool kept_;
};

#endif
