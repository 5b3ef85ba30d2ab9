#include "rules/rules_file.h"

#include <fcntl.h>
#include <libxml/parser.h>
#include <libxml/tree.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "files/safe_path.h"
#include "lazy_xml.h"
#include "quarn_handles.h"

namespace {

constexpr char kRootElement[] = "backup";
constexpr char kIncludeElement[] = "include";
constexpr char kExcludeElement[] = "exclude";
constexpr char kPathAttribute[] = "path";

struct XmlFree {
  void operator()(xmlChar *text) const { xmlFree(text); }
};
using XmlText = std::unique_ptr<xmlChar, XmlFree>;
using RulesDoc = Handle<xmlDoc, &xmlFreeDoc>;

const char *text_of(const xmlChar *text) { return reinterpret_cast<const char *>(text); }

/** The rules file's text; no more of it than kMaxRulesSize. @return loaded, ignored or too_large */
rules_state read_rules(const char *path, std::string *text) {
  const UniqueFd fd = safe_open(path, O_RDONLY | O_NONBLOCK | O_NOCTTY);
  struct stat status = {};
  if (!fd || fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) return rules_state::ignored;
  if (static_cast<std::size_t>(status.st_size) > kMaxRulesSize) return rules_state::too_large;
  text->resize(kMaxRulesSize + 1);
  std::size_t done = 0;
  while (done < text->size()) {
    const ssize_t count = read(fd.get(), text->data() + done, text->size() - done);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return rules_state::ignored;
    if (count == 0) break;
    done += static_cast<std::size_t>(count);
  }
  text->resize(done);
  return done <= kMaxRulesSize ? rules_state::loaded : rules_state::too_large;
}

RulesDoc parse(const std::string &text, const char *path, int more_options) {
  return RulesDoc(
      xmlReadMemory(text.data(), static_cast<int>(text.size()), path, nullptr,
                    XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING | more_options));
}

bool defines_entities(const xmlDoc *doc) {
  const xmlNode *declaration = doc->intSubset == nullptr ? nullptr : doc->intSubset->children;
  while (declaration != nullptr && declaration->type != XML_ENTITY_DECL) {
    declaration = declaration->next;
  }
  return declaration != nullptr;
}

/** Whether a rule's text holds an entity that only a file which is never read could define. */
bool lacks_entities(const xmlDoc *doc) {
  const xmlNode *root = doc->children;
  while (root != nullptr && root->type != XML_ELEMENT_NODE) root = root->next;
  if (root == nullptr) return false;
  for (const xmlNode *rule = root->children; rule != nullptr; rule = rule->next) {
    if (rule->type == XML_ENTITY_REF_NODE) return true;
    if (rule->type != XML_ELEMENT_NODE) continue;
    for (const xmlAttr *attribute = rule->properties; attribute != nullptr;
         attribute = attribute->next) {
      for (const xmlNode *part = attribute->children; part != nullptr; part = part->next) {
        if (part->type == XML_ENTITY_REF_NODE) return true;
      }
    }
  }
  return false;
}

rules_state why_not_parsed(const std::string &text, const char *path) {
  if (missing_xml_library() != nullptr) return rules_state::no_library;
  // Entities that expand without end are malformed as well; they are looked for first.
  const RulesDoc remains = parse(text, path, XML_PARSE_RECOVER);
  return remains != nullptr && defines_entities(remains.get()) ? rules_state::entities
                                                               : rules_state::ignored;
}

std::string absolute_path(const std::string &root, const char *value) {
  return value[0] == '/' ? root + value : root + "/" + value;
}

/** The document, or none and why. */
RulesDoc load_rules(const char *path, rules_state *state) {
  std::string text;
  *state = read_rules(path, &text);
  if (*state != rules_state::loaded) return nullptr;
  RulesDoc doc = parse(text, path, 0);
  if (doc == nullptr) {
    *state = why_not_parsed(text, path);
  } else if (defines_entities(doc.get()) || lacks_entities(doc.get())) {
    // rules need no entities; whoever declares some means the parser
    *state = rules_state::entities;
    doc.reset();
  }
  return doc;
}

rules_element describe(const xmlNode *node, const std::string &root) {
  rules_element element;
  element.name = text_of(node->name);
  element.line = static_cast<int>(xmlGetLineNo(node));
  element.include = element.name == kIncludeElement;
  element.is_rule = element.include || element.name == kExcludeElement;
  if (!element.is_rule) return element;
  const XmlText value(xmlGetProp(node, reinterpret_cast<const xmlChar *>(kPathAttribute)));
  if (value == nullptr) return element;
  element.has_path = true;
  element.given = text_of(value.get());
  element.path = absolute_path(root, element.given.c_str());
  return element;
}

}  // namespace

const char *rules_state_text(rules_state state) {
  static_assert(kMaxRulesSize == 262144, "the text names it");
  switch (state) {
    case rules_state::too_large:
      return "it is larger than 262144 bytes";
    case rules_state::entities:
      return "it needs entities";
    case rules_state::no_library:
      return "libxml2.so.2 cannot be loaded";
    case rules_state::none:
    case rules_state::loaded:
    case rules_state::ignored:
      break;
  }
  return "";
}

struct RulesFile::Document {
  RulesDoc text;
  const xmlNode *root = nullptr;
};

RulesFile::RulesFile(const std::string &path) : state_(rules_state::none) {
  RulesDoc text = load_rules(path.c_str(), &state_);
  if (text == nullptr) return;
  const xmlNode *root = xmlDocGetRootElement(text.get());
  document_ = std::make_unique<Document>(Document{std::move(text), root});
}

RulesFile::~RulesFile() = default;

const char *RulesFile::root_name() const {
  const bool has_root = document_ != nullptr && document_->root != nullptr;
  return has_root ? text_of(document_->root->name) : nullptr;
}

int RulesFile::root_line() const {
  return root_name() == nullptr ? 0 : static_cast<int>(xmlGetLineNo(document_->root));
}

bool RulesFile::has_rules() const {
  const char *name = root_name();
  return name != nullptr && std::strcmp(name, kRootElement) == 0;
}

void RulesFile::for_each(const std::string &root,
                         const std::function<void(const rules_element &)> &take) const {
  if (!has_rules()) return;
  for (const xmlNode *node = document_->root->children; node != nullptr; node = node->next) {
    if (node->type == XML_ELEMENT_NODE) take(describe(node, root));
  }
}
