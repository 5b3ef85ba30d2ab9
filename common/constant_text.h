/**
 * @file constant_text.h
 * @brief Texts that the compiler puts together from tables.
 */
#ifndef CONSTANT_TEXT_H
#define CONSTANT_TEXT_H

#include <cstddef>

/** Counts what is written, and keeps what there is room for. */
class ConstantTextWriter {
 public:
  constexpr ConstantTextWriter(char *text, std::size_t room) : text_(text), room_(room) {}

  constexpr ConstantTextWriter &put(char c) {
    if (size_ < room_) text_[size_] = c;
    ++size_;
    return *this;
  }
  constexpr ConstantTextWriter &put(const char *piece) {
    for (; *piece != '\0'; ++piece) put(*piece);
    return *this;
  }
  constexpr std::size_t size() const { return size_; }

 private:
  char *text_;
  std::size_t room_;
  std::size_t size_ = 0;
};

/** The text that @p Write writes, a constexpr function that writes the same each time. */
template <void (*Write)(ConstantTextWriter &to)>
class ConstantText {
 public:
  constexpr ConstantText() {
    ConstantTextWriter writer(text_, kSize);
    Write(writer);
  }
  constexpr const char *text() const { return text_; }

 private:
  static constexpr std::size_t size_of_text() {
    ConstantTextWriter counter(nullptr, 0);
    Write(counter);
    return counter.size();
  }
  static constexpr std::size_t kSize = size_of_text();

  char text_[kSize + 1] = {};
};

#endif
