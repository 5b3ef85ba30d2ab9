#include "quarn_d_utils/table_reader.h"

#include <cstring>

#include "quarn_d_utils/file_attributes.h"

json_object *attributes_in_table(json_object *table, json_object *member) {
  if (json_object_is_type(member, json_type_string) == 0) return member;
  json_object *made = json_tokener_parse(json_object_get_string(member));
  json_object_set_userdata(table, made, [](json_object *, void *old) {
    json_object_put(static_cast<json_object *>(old));
  });
  return made;
}

TableReader::TableReader(TableUse use)
    : tokener_(json_tokener_new()), table_(json_object_new_object()), use_(use) {}

/** @return false when @p text is not one JSON value */
bool TableReader::parse(std::string_view text, JsonPtr *value) {
  if (tokener_ == nullptr) return false;
  json_tokener_reset(tokener_.get());
  value->reset(json_tokener_parse_ex(tokener_.get(), text.data(), static_cast<int>(text.size())));
  if (json_tokener_get_error(tokener_.get()) == json_tokener_continue) {
    // a number is over when something else comes
    value->reset(json_tokener_parse_ex(tokener_.get(), "", 1));
    return json_tokener_get_error(tokener_.get()) == json_tokener_success;
  }
  return json_tokener_get_error(tokener_.get()) == json_tokener_success &&
         json_tokener_get_parse_end(tokener_.get()) == text.size();
}

/** Most files of an application have the same attributes: these are parsed once. */
bool TableReader::attributes(std::string_view text, JsonPtr *value) {
  for (const Known &one : known_) {
    if (one.object != nullptr && one.text == text) {
      value->reset(json_object_get(one.object.get()));
      return true;
    }
  }
  if (!parse(text, value)) return false;
  if (json_object_is_type(value->get(), json_type_object) == 0) {
    // a text is no attributes, and must not be taken for them
    if (use_ != TableUse::all) value->reset(json_object_new_int(0));
    return true;
  }
  Known &next = known_[made_++ % kRemembered];
  if (use_ == TableUse::lookup && made_ > kObjects) {
    value->reset(json_object_new_string_len(text.data(), static_cast<int>(text.size())));
  }
  next.text = text;
  next.object.reset(json_object_get(value->get()));
  return true;
}

/** Only the escapes that paths have are undone here; the rest is the library's. */
bool TableReader::decode_key(std::string_view quoted) {
  key_.clear();
  for (std::size_t i = 1; i + 1 < quoted.size(); ++i) {
    char c = quoted[i];
    if (c == '\\') {
      c = quoted[++i];
      if (std::strchr("/\\\"", c) == nullptr) {
        JsonPtr value;
        if (!parse(quoted, &value)) return false;
        key_ = json_object_get_string(value.get());
        return true;
      }
    }
    key_.push_back(c);
  }
  return true;
}

bool TableReader::member(std::string_view key, std::string_view value) {
  JsonPtr made;
  if (table_ == nullptr || !decode_key(key) || !attributes(value, &made)) return false;
  if (use_ == TableUse::check) return true;
  // one that replaces the list takes it along
  if (key_ == kLinkListKey) links_ = nullptr;
  return json_object_object_add(table_.get(), key_.c_str(), made.release()) == 0;
}

void TableReader::links() {
  links_ = json_object_new_array();
  if (table_ != nullptr && json_object_object_add(table_.get(), kLinkListKey, links_) == 0) return;
  json_object_put(links_);
  links_ = nullptr;
}

bool TableReader::link(std::string_view element) {
  JsonPtr made;
  if (links_ == nullptr || !parse(element, &made)) return false;
  return use_ != TableUse::all || json_object_array_add(links_, made.release()) == 0;
}
