#include <cstring>
#include <string_view>

#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_utils/handles.h"

namespace {

using Tokener = Handle<json_tokener, &json_tokener_free>;

/** So many different attributes are remembered. */
constexpr std::size_t kRemembered = 8;

/**
 * Objects by the text they were read from. Most files of an application have
 * the same attributes: these share one object, and are parsed once.
 */
class SharedObjects {
 public:
  json_object *find(std::string_view text) const {
    for (const auto &one : known_) {
      if (one.object != nullptr && one.text == text) return json_object_get(one.object.get());
    }
    return nullptr;
  }
  void remember(std::string_view text, json_object *object) {
    known_[next_].text = text;
    known_[next_].object.reset(json_object_get(object));
    next_ = (next_ + 1) % kRemembered;
  }

 private:
  struct Known {
    std::string_view text;
    JsonPtr object;
  };
  Known known_[kRemembered];
  std::size_t next_ = 0;
};

/** The object that @p text begins with, as far as its last brace; empty when it has none. */
std::string_view leading_object(std::string_view text) {
  if (text.empty() || text.front() != '{') return {};
  int depth = 0;
  bool in_string = false;
  for (std::size_t i = 0; i < text.size(); ++i) {
    const char c = text[i];
    if (in_string) {
      if (c == '\\') ++i;
      if (c == '"') in_string = false;
    } else if (c == '"') {
      in_string = true;
    } else if (c == '{') {
      ++depth;
    } else if (c == '}' && --depth == 0) {
      return text.substr(0, i + 1);
    }
  }
  return {};
}

/** Reads a text value by value. */
class Reader {
 public:
  explicit Reader(std::string_view text) : text_(text), tokener_(json_tokener_new()) {}

  /** Take @p wanted, after white space; false when something else follows. */
  bool take(char wanted) {
    skip_space();
    if (text_.empty() || text_.front() != wanted) return false;
    text_.remove_prefix(1);
    return true;
  }

  /** Take a text. Only the escapes that paths have are undone here; the rest is the library's. */
  bool take_key(std::string *key) {
    skip_space();
    key->clear();
    for (std::size_t i = 1; i < text_.size() && text_.front() == '"'; ++i) {
      char c = text_[i];
      if (c == '"') {
        text_.remove_prefix(i + 1);
        return true;
      }
      if (c == '\\') {
        if (++i == text_.size() || std::strchr("/\\\"", text_[i]) == nullptr) break;
        c = text_[i];
      }
      key->push_back(c);
    }
    JsonPtr value;
    if (!parse(&value) || !json_object_is_type(value.get(), json_type_string)) return false;
    *key = json_object_get_string(value.get());
    return true;
  }

  /** Take one value of any type. @return false when there is none */
  bool take_value(JsonPtr *value) {
    skip_space();
    const std::string_view object = leading_object(text_);
    value->reset(shared_.find(object));
    if (*value != nullptr) {
      text_.remove_prefix(object.size());
      return true;
    }
    const std::size_t before = text_.size();
    if (!parse(value)) return false;
    if (before - text_.size() == object.size()) shared_.remember(object, value->get());
    return true;
  }

 private:
  void skip_space() {
    while (!text_.empty() && std::strchr(" \t\r\n", text_.front()) != nullptr) {
      text_.remove_prefix(1);
    }
  }
  bool parse(JsonPtr *value) {
    if (tokener_ == nullptr) return false;
    json_tokener_reset(tokener_.get());
    value->reset(
        json_tokener_parse_ex(tokener_.get(), text_.data(), static_cast<int>(text_.size())));
    if (json_tokener_get_error(tokener_.get()) != json_tokener_success) return false;
    text_.remove_prefix(json_tokener_get_parse_end(tokener_.get()));
    return true;
  }

  std::string_view text_;
  Tokener tokener_;
  SharedObjects shared_;
};

}  // namespace

json_object *parse_file_info_table(const char *text) {
  Reader reader(text);
  JsonPtr table(json_object_new_object());
  if (table == nullptr || !reader.take('{')) return nullptr;
  if (reader.take('}')) return table.release();
  std::string key;
  do {
    JsonPtr value;
    if (!reader.take_key(&key) || !reader.take(':') || !reader.take_value(&value)) return nullptr;
    json_object_object_add(table.get(), key.c_str(), value.release());
  } while (reader.take(','));
  return reader.take('}') ? table.release() : nullptr;
}
