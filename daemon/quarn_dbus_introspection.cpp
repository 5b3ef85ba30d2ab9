#include "quarn_dbus_introspection.h"

#include <cstddef>

#include "quarn_common.h"
#include "quarn_d_methods.h"

namespace {

/** Counts what is written, and keeps it where there is room. */
class Writer {
 public:
  constexpr Writer(char *text, std::size_t room) : text_(text), room_(room) {}

  constexpr Writer &put(const char *piece) {
    for (; *piece != '\0'; ++piece) put(*piece);
    return *this;
  }
  constexpr Writer &put(char c) {
    if (size_ < room_) text_[size_] = c;
    ++size_;
    return *this;
  }
  constexpr std::size_t size() const { return size_; }

 private:
  char *text_;
  std::size_t room_;
  std::size_t size_ = 0;
};

constexpr void write_argument(Writer &to, char type, const char *name, const char *direction) {
  to.put("\t\t\t<arg type='").put(type).put("' name='").put(name);
  to.put("' direction='").put(direction).put("'/>");
}

constexpr void write_method(Writer &to, const quarn_method &method) {
  to.put("\t\t<method name='").put(method.name).put("'>");
  for (const quarn_argument *argument = method.arguments; argument->name != nullptr; ++argument) {
    write_argument(to, argument->type, argument->name, "in");
  }
  if (method.answer.name != nullptr) {
    write_argument(to, method.answer.type, method.answer.name, "out");
  }
  to.put("\t\t</method>");
}

constexpr void write_document(Writer &to) {
  to.put("<node>\t<interface name='").put(kQuarnInterface).put("'>");
  for (const quarn_method &method : kQuarnMethods) write_method(to, method);
  to.put("\t</interface></node>");
}

constexpr std::size_t size_of_document() {
  Writer counter(nullptr, 0);
  write_document(counter);
  return counter.size();
}

struct Document {
  char text[size_of_document() + 1] = {};
};

constexpr Document make_document() {
  Document document;
  Writer writer(document.text, size_of_document());
  write_document(writer);
  return document;
}

constexpr Document kDocument = make_document();

}  // namespace

const char *const quarn_introspection_xml = kDocument.text;
