#include "quarn_d_backup/model_entries.h"

#include <cstring>

#include "json_ptr.h"
#include "quarn_d_utils/handles.h"

namespace {

constexpr char kEntryPlaceholder[] = "null";
// No list that a device wrote comes near these; one that does would not fit the daemon's memory.
constexpr std::size_t kMaxEntries = 200000;
constexpr std::size_t kMaxParsedSize = std::size_t{8} << 20;
// What json-c takes for a value, about: a table of members, a member with its key, a place.
constexpr std::size_t kContainerSize = 1024;
constexpr std::size_t kValueSize = 256;
constexpr std::size_t kNullSize = 48;

using TokenerPtr = Handle<json_tokener, &json_tokener_free>;

/** Steps over JSON values without recursion, however deep they are. */
class value_scanner {
 public:
  explicit value_scanner(std::string_view text) : text_(text) {}

  std::size_t position() const { return position_; }

  void skip_space() {
    while (position_ < text_.size() && std::strchr(" \t\r\n", text_[position_]) != nullptr) {
      ++position_;
    }
  }

  bool take(char c) {
    skip_space();
    if (position_ >= text_.size() || text_[position_] != c) return false;
    ++position_;
    return true;
  }

  bool at(char c) {
    skip_space();
    return position_ < text_.size() && text_[position_] == c;
  }

  /** One value; @p value receives its text. */
  bool take_value(std::string_view *value) {
    skip_space();
    const std::size_t begin = position_;
    std::string closing;
    do {
      if (position_ >= text_.size()) return false;
      const char c = text_[position_];
      if (c == '"') {
        if (!skip_string()) return false;
        continue;
      }
      if (c == '{' || c == '[') {
        closing.push_back(c == '{' ? '}' : ']');
      } else if (c == '}' || c == ']') {
        if (closing.empty() || closing.back() != c) return false;
        closing.pop_back();
      } else if (closing.empty()) {
        skip_word();
        continue;
      }
      ++position_;
    } while (!closing.empty());
    *value = text_.substr(begin, position_ - begin);
    return !value->empty();
  }

 private:
  bool skip_string() {
    for (++position_; position_ < text_.size(); ++position_) {
      if (text_[position_] == '\\') {
        ++position_;
      } else if (text_[position_] == '"') {
        ++position_;
        return true;
      }
    }
    return false;
  }

  void skip_word() {
    const std::size_t end = text_.find_first_of(",:]}[{\" \t\r\n", position_);
    position_ = end == std::string_view::npos ? text_.size() : end;
  }

  std::string_view text_;
  std::size_t position_ = 0;
};

bool is_key(std::string_view text, const char *key) {
  if (text.find('\\') == std::string_view::npos) return text == std::string("\"") + key + "\"";
  const JsonPtr name(parse_whole_json(text, 1, nullptr));
  return json_object_is_type(name.get(), json_type_string) != 0 &&
         std::strcmp(json_object_get_string(name.get()), key) == 0;
}

bool split_array(std::string_view array, std::vector<std::string_view> *elements) {
  value_scanner scanner(array);
  if (!scanner.take('[') || scanner.at(']')) return false;
  do {
    std::string_view element;
    if (elements->size() == kMaxEntries || !scanner.take_value(&element)) return false;
    elements->push_back(element);
  } while (scanner.take(','));
  return scanner.take(']');
}

/** The last value under the key, as a parser would have it. */
std::string_view find_value(std::string_view text, const char *wanted) {
  value_scanner scanner(text);
  std::string_view found;
  if (!scanner.take('{') || scanner.at('}')) return {};
  do {
    std::string_view key;
    std::string_view value;
    if (!scanner.at('"') || !scanner.take_value(&key) || !scanner.take(':') ||
        !scanner.take_value(&value)) {
      return {};
    }
    if (is_key(key, wanted)) found = value;
  } while (scanner.take(','));
  return found;
}

/** Whether a text's values fit into memory; the bytes of its strings are those of the text. */
bool fits_memory(std::string_view text) {
  std::size_t size = 0;
  bool in_string = false;
  for (std::size_t i = 0; i < text.size() && size <= kMaxParsedSize; ++i) {
    const char c = text[i];
    if (in_string && c == '\\') {
      ++i;
    } else if (c == '"') {
      in_string = !in_string;
    } else if (!in_string && (c == '{' || c == '[')) {
      size += kContainerSize;
    } else if (!in_string && c == ',') {
      const std::size_t next = text.find_first_not_of(" \t\r\n", i + 1);
      const bool is_null = next != std::string_view::npos && text[next] == 'n';
      size += is_null ? kNullSize : kValueSize;
    }
  }
  return size <= kMaxParsedSize;
}

}  // namespace

list_text take_list_apart(std::string_view text, const char *key) {
  list_text result;
  const std::string_view array = find_value(text, key);
  if (array.empty() || !split_array(array, &result.entries)) {
    result.entries.clear();
    result.frame = text;
    return result;
  }
  const char *copied = text.data();
  for (const std::string_view &entry : result.entries) {
    result.frame.append(copied, entry.data());
    result.frame += kEntryPlaceholder;
    copied = entry.data() + entry.size();
  }
  result.frame.append(copied, text.data() + text.size());
  return result;
}

json_object *parse_whole_json(std::string_view text, int depth, bool *beyond) {
  const bool fits = fits_memory(text);
  if (beyond != nullptr) *beyond = !fits;
  if (!fits) return nullptr;
  const TokenerPtr tokener(json_tokener_new_ex(depth));
  if (!tokener) return nullptr;
  json_tokener_set_flags(tokener.get(), JSON_TOKENER_STRICT);
  // with its terminator, so that a number at the end is complete
  const std::string whole(text);
  JsonPtr value(
      json_tokener_parse_ex(tokener.get(), whole.c_str(), static_cast<int>(whole.size() + 1)));
  const json_tokener_error error = json_tokener_get_error(tokener.get());
  if (beyond != nullptr) *beyond = error == json_tokener_error_depth;
  if (error != json_tokener_success) return nullptr;
  return value.release();
}

json_object *new_json_from_text(std::string_view text) {
  json_object *value = json_object_new_boolean(0);  // the smallest there is
  char *copy = strndup(text.data(), text.size());
  if (value == nullptr || copy == nullptr) {
    std::free(copy);
    json_object_put(value);
    return nullptr;
  }
  json_object_set_serializer(value, json_object_userdata_to_json_string, copy,
                             json_object_free_userdata);
  return value;
}
