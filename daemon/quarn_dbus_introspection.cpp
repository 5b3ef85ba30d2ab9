#include "quarn_dbus_introspection.h"

#include "constant_text.h"
#include "quarn_common.h"
#include "quarn_d_methods.h"

namespace {

constexpr void write_argument(ConstantTextWriter &to, char type, const char *name,
                              const char *direction) {
  to.put("\t\t\t<arg type='").put(type).put("' name='").put(name);
  to.put("' direction='").put(direction).put("'/>");
}

constexpr void write_method(ConstantTextWriter &to, const quarn_method &method) {
  to.put("\t\t<method name='").put(method.name).put("'>");
  for (const quarn_argument *argument = method.arguments; argument->name != nullptr; ++argument) {
    write_argument(to, argument->type, argument->name, "in");
  }
  if (method.answer.name != nullptr) {
    write_argument(to, method.answer.type, method.answer.name, "out");
  }
  to.put("\t\t</method>");
}

constexpr void write_document(ConstantTextWriter &to) {
  to.put("<node>\t<interface name='").put(kQuarnInterface).put("'>");
  for (const quarn_method &method : kQuarnMethods) write_method(to, method);
  to.put("\t</interface></node>");
}

constexpr ConstantText<write_document> kDocument;

}  // namespace

const char *const quarn_introspection_xml = kDocument.text();
