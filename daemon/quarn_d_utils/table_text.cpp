#include "quarn_d_utils/table_text.h"

#include <cstring>

#include "quarn_d_utils/bounds.h"
#include "quarn_d_utils/file_attributes.h"

namespace {

/** Brackets in one another within one member: a link has one pair, and its attributes another. */
constexpr std::size_t kMaxDepth = 4;
/** Values of one member, keys counted: a link has seven beside its own, and as many keys. */
constexpr unsigned int kMaxValues = 32;
/** Bytes of a text in quotes, of which each may be written as six. */
constexpr std::size_t kMaxQuoted = 6 * kMaxNameSize + 2;
/** Bytes of a link, with its name and its target. */
constexpr std::size_t kMaxLink = 2 * kMaxQuoted;
/** Bytes of attributes: three numbers and a label of at most 255 bytes. */
constexpr std::size_t kMaxAttributes = 2048;

bool is_space(char c) { return c == ' ' || c == '\t' || c == '\r' || c == '\n'; }

/** The most that is taken of one item, which is in memory meanwhile. */
std::size_t most_of(TableText::Place place) {
  switch (place) {
    case TableText::Place::key:
      return kMaxQuoted;
    case TableText::Place::value:
      return kMaxAttributes;
    default:
      return kMaxLink;
  }
}

bool ends_scalar(char c) { return is_space(c) || c == ',' || c == '}' || c == ']'; }

}  // namespace

bool TableText::refuse(table_state why) {
  state_ = why;
  place_ = Place::ended;
  return false;
}

table_state TableText::end() const {
  if (place_ == Place::done) return table_state::whole;
  return place_ == Place::ended ? state_ : table_state::malformed;
}

bool TableText::take(const char *data, std::size_t size) {
  if (place_ == Place::ended) return false;
  size_ += size;
  if (size_ > bounds_.text) return refuse(table_state::beyond);
  // what follows the table is nobody's
  for (std::size_t at = 0; at < size && place_ != Place::done;) {
    if (in_item_) {
      const std::size_t taken = take_item(data + at, size - at);
      if (place_ == Place::ended) return false;
      at += taken;
    } else {
      if (!is_space(data[at]) && !take_sign(data[at])) return false;
      // what begins an item is left to it
      if (!in_item_) ++at;
    }
  }
  return true;
}

/** A sign between keys and values; one that begins such a one is left to it. */
bool TableText::take_sign(char c) {
  const auto go_on = [&](bool right, Place next) {
    if (!right) return refuse(table_state::malformed);
    place_ = next;
    return true;
  };
  switch (place_) {
    case Place::start:
      return go_on(c == '{', Place::first_key);
    case Place::first_key:
      if (c == '}') return go_on(true, Place::done);
      return begin_item(c, Place::key);
    case Place::key:
      return begin_item(c, Place::key);
    case Place::colon:
      return go_on(c == ':', Place::value);
    case Place::value:
      if (c == '[' && key_.size() == sizeof kLinkListKey + 1 &&
          key_.compare(1, sizeof kLinkListKey - 1, kLinkListKey) == 0) {
        if (sink_ != nullptr) sink_->links();
        return go_on(true, Place::first_link);
      }
      return begin_item(c, Place::value);
    case Place::behind:
      return c == '}' ? go_on(true, Place::done) : go_on(c == ',', Place::key);
    case Place::first_link:
      if (c == ']') return go_on(true, Place::behind);
      return begin_item(c, Place::link);
    case Place::link:
      return begin_item(c, Place::link);
    case Place::behind_link:
      return c == ']' ? go_on(true, Place::behind) : go_on(c == ',', Place::link);
    case Place::done:
    case Place::ended:
      break;
  }
  return false;
}

bool TableText::begin_item(char c, Place place) {
  if (place == Place::key ? c != '"' : (ends_scalar(c) || c == ':')) {
    return refuse(table_state::malformed);
  }
  if (place != Place::key && !count_member()) return false;
  place_ = place;
  in_item_ = true;
  in_string_ = false;
  open_.clear();
  values_ = 0;
  item_.clear();
  return true;
}

bool TableText::count_member() {
  return ++members_ <= bounds_.members || refuse(table_state::beyond);
}

/** The bytes of a key or value. @return how many were taken */
std::size_t TableText::take_item(const char *data, std::size_t size) {
  if (in_string_) return take_quoted(data, size);
  const char c = *data;
  // a number or a word ends before what ends it
  if (open_.empty() && !item_.empty() && ends_scalar(c)) {
    end_item();
    return 0;
  }
  item_ += c;
  if (item_.size() > most_of(place_)) {
    refuse(table_state::beyond);
  } else if (c == '"') {
    in_string_ = true;
    escaped_ = false;
  } else if (take_structure(c) && open_.empty() && (c == '}' || c == ']')) {
    end_item();
  }
  return 1;
}

/** A sign outside of a text in quotes; those that only some readers understand are refused. */
bool TableText::take_structure(char c) {
  switch (c) {
    case '{':
    case '[':
      open_ += c;
      if (open_.size() > kMaxDepth) return refuse(table_state::beyond);
      break;
    case '}':
    case ']':
      if (open_.empty() || (open_.back() == '{') != (c == '}')) {
        return refuse(table_state::malformed);
      }
      open_.pop_back();
      return true;
    case ',':
    case ':':
      break;
    case '\'':
    case '/':
    case '\0':
      return refuse(table_state::malformed);
    default:
      return true;
  }
  return ++values_ <= kMaxValues || refuse(table_state::beyond);
}

std::size_t TableText::take_quoted(const char *data, std::size_t size) {
  std::size_t taken = 0;
  while (taken < size && in_string_) {
    const char c = data[taken++];
    if (escaped_) {
      escaped_ = false;
    } else if (c == '\\') {
      escaped_ = true;
    } else if (c == '"') {
      in_string_ = false;
    } else if (c == '\0') {
      refuse(table_state::malformed);
      return taken;
    }
  }
  item_.append(data, taken);
  if (item_.size() > most_of(place_)) {
    refuse(table_state::beyond);
  } else if (!in_string_ && open_.empty()) {
    end_item();
  }
  return taken;
}

bool TableText::end_item() {
  in_item_ = false;
  bool taken = true;
  switch (place_) {
    case Place::key:
      key_.swap(item_);
      place_ = Place::colon;
      return true;
    case Place::value:
      if (sink_ != nullptr) taken = sink_->member(key_, item_);
      place_ = Place::behind;
      break;
    default:
      if (sink_ != nullptr) taken = sink_->link(item_);
      place_ = Place::behind_link;
      break;
  }
  return taken || refuse(table_state::malformed);
}
