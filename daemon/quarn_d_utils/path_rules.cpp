#include <fcntl.h>
#include <libxml/parser.h>
#include <libxml/tree.h>

#include <cerrno>
#include <cstring>
#include <string_view>
#include <unordered_set>

#include "lazy_xml.h"
#include "quarn_d_utils/log_budget.h"
#include "quarn_d_utils/package_directory.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/rules_file.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_d_utils/working_files.h"
#include "quarn_log.h"

thread_local std::vector<std::string> backup_include_list;
thread_local std::vector<std::string> backup_exclude_list;
thread_local bool xml_has_include_field = false;

namespace {

constexpr char kNativeType[] = "tpk";
constexpr char kRulesFile[] = "/res/backup.path.xml";
constexpr char kWebRulesFile[] = "/res/wgt/res/backup.path.xml";
constexpr char kRootElement[] = "backup";
constexpr char kIncludeElement[] = "include";
constexpr char kExcludeElement[] = "exclude";
constexpr char kPathAttribute[] = "path";

struct XmlFree {
  void operator()(xmlChar *text) const { xmlFree(text); }
};
using XmlText = std::unique_ptr<xmlChar, XmlFree>;

bool has_name(const xmlNode *node, const char *name) {
  return std::strcmp(reinterpret_cast<const char *>(node->name), name) == 0;
}

thread_local rules_state loaded_state = rules_state::none;

/**
 * The rules of one list by their text: an application may have thousands of
 * rules and of files, and each file is asked about. It follows its list, which
 * only grows until it is told to forget it.
 */
class RuleIndex {
 public:
  explicit RuleIndex(const std::vector<std::string> *list) : list_(list) {}

  /** The list is being made anew, perhaps in the same place. */
  void forget() {
    rules_.clear();
    first_ = nullptr;
    count_ = 0;
  }

  /** Whether a rule names @p path, or a folder (with its slash) that it lies in. */
  bool names(std::string_view path) {
    follow();
    if (rules_.empty()) return false;
    if (rules_.count(path) != 0) return true;
    for (std::size_t i = 0; i < path.size(); ++i) {
      if (path[i] == '/' && rules_.count(path.substr(0, i + 1)) != 0) return true;
    }
    return false;
  }

 private:
  void follow() {
    if (list_->empty()) return forget();
    if (list_->data() == first_ && list_->size() == count_) return;
    rules_.clear();
    rules_.insert(list_->begin(), list_->end());
    first_ = list_->data();
    count_ = list_->size();
  }

  const std::vector<std::string> *list_;
  const std::string *first_ = nullptr;
  std::size_t count_ = 0;
  std::unordered_set<std::string_view> rules_;
};

thread_local RuleIndex included_rules(&backup_include_list);
thread_local RuleIndex excluded_rules(&backup_exclude_list);

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

std::string absolute_path(const char *root, const char *value) {
  return value[0] == '/' ? std::string(root) + value : std::string(root) + "/" + value;
}

void collect_rules(const xmlNode *element, const char *root) {
  for (xmlNode *child = element->children; child != nullptr; child = child->next) {
    if (child->type != XML_ELEMENT_NODE) continue;
    const bool is_include = has_name(child, kIncludeElement);
    if (!is_include && !has_name(child, kExcludeElement)) continue;
    const XmlText value(xmlGetProp(child, reinterpret_cast<const xmlChar *>(kPathAttribute)));
    // an include that names nothing must not shut out everything
    if (value == nullptr) continue;
    if (is_include) xml_has_include_field = true;
    add_to_path_info_list(absolute_path(root, reinterpret_cast<const char *>(value.get())).c_str(),
                          is_include ? &backup_include_list : &backup_exclude_list);
  }
}

/** One walk: an application may have any number of links, and of what cannot be packed. */
struct Walk {
  WorkingFiles working;
  LogBudget links;
  LogBudget failures;
};

/** What lies there, whoever may enter the directory. */
int look_at(int dir, const char *name, struct stat *status) {
  const int found = fstatat(dir, name, status, AT_SYMLINK_NOFOLLOW);
  if (found == 0 || errno != EACCES) return found;
  const ActAsRoot root;
  return fstatat(dir, name, status, AT_SYMLINK_NOFOLLOW);
}

std::uint64_t measure(DirPtr dir, Walk *walk, std::string *path, int depth) {
  std::uint64_t sum = 0;
  while (const dirent *entry = readdir(dir.get())) {
    if (is_dot_entry(entry->d_name)) continue;
    const PathStep step(path, entry->d_name);
    if (walk->working.contain(*path)) continue;
    struct stat status = {};
    const int result = look_at(dirfd(dir.get()), entry->d_name, &status);
    if (result != 0) {
      if (walk->failures.take()) LOGE("error : lstat for %d %s", result, path->c_str());
    } else if (S_ISDIR(status.st_mode)) {
      DirPtr child;
      if (depth < kMaxDirDepth) {
        child = open_directory_as_package(dirfd(dir.get()), entry->d_name, user_of_package());
      }
      if (child == nullptr) {
        if (walk->failures.take()) LOGE("error : cannot open this path %s", path->c_str());
        sum += kUnmeasurableSize;
      } else {
        sum += measure(std::move(child), walk, path, depth + 1);
      }
    } else if (S_ISREG(status.st_mode)) {
      if (is_backup_file(path->c_str())) sum += static_cast<std::uint64_t>(status.st_size);
    } else if (S_ISLNK(status.st_mode)) {
      if (!is_backup_file(path->c_str())) continue;
      sum += static_cast<std::uint64_t>(status.st_size);
      if (walk->links.take()) {
        LOGI("size of lnk file %s : %d", path->c_str(), static_cast<int>(status.st_size));
      }
    } else if (walk->failures.take()) {
      LOGE("this is unexpected type : %s", path->c_str());
    }
  }
  return sum;
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

rules_state backup_rules_state() { return loaded_state; }

bool backup_rules_usable() { return rules_usable(loaded_state); }

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

void reset_backup_path_info() {
  backup_include_list.clear();
  backup_exclude_list.clear();
  included_rules.forget();
  excluded_rules.forget();
  xml_has_include_field = false;
  loaded_state = rules_state::none;
}

void parse_backup_path_xml(const char *pkg_id, const char *pkg_type, const char *root) {
  reset_backup_path_info();
  const bool is_native = std::strcmp(pkg_type, kNativeType) == 0;
  const std::string path = std::string(root) + (is_native ? kRulesFile : kWebRulesFile);
  if (!file_exist(path.c_str())) return;
  LOGI("(%s) has xml file(for include/exlude path)", pkg_id);

  const RulesDoc doc = load_rules(path.c_str(), &loaded_state);
  if (doc == nullptr) {
    LOGE("Could not load xml file.\n");
    if (!backup_rules_usable()) {
      LOGE("rules file of (%s) cannot be used: %s", pkg_id, rules_state_text(loaded_state));
    }
    return;
  }
  const xmlNode *element = xmlDocGetRootElement(doc.get());
  if (element == nullptr) {
    LOGE("empty document.\n");
    loaded_state = rules_state::ignored;
    return;
  }
  if (!has_name(element, kRootElement)) {
    LOGE("root name %s error!\n", reinterpret_cast<const char *>(element->name));
    loaded_state = rules_state::ignored;
    return;
  }
  collect_rules(element, root);
}

void add_to_path_info_list(const char *path, std::vector<std::string> *list) {
  struct stat status = {};
  if (safe_lstat(path, &status) == 0) list->emplace_back(path);
}

bool is_child_file(const char *parent, const char *path) {
  const std::size_t length = std::strlen(parent);
  return length > 0 && parent[length - 1] == '/' && std::strncmp(parent, path, length) == 0;
}

bool is_backup_file(const char *path) {
  if (excluded_rules.names(path)) return false;
  return !xml_has_include_field || included_rules.names(path);
}

std::uint64_t get_dir_backup_size(const char *dir_path, const char *pkg_id, const char *root) {
  DirPtr dir = safe_opendir(dir_path);
  if (dir == nullptr) {
    LOGE("error : cannot open this path %s", dir_path);
    return kUnmeasurableSize;
  }
  Walk walk{WorkingFiles(pkg_id, root), LogBudget(dir_path), LogBudget(dir_path)};
  std::string path = dir_path;
  const ActAsPackage acting;
  return acting ? measure(std::move(dir), &walk, &path, 1) : kUnmeasurableSize;
}
