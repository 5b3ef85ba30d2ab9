#include <fcntl.h>
#include <libxml/parser.h>
#include <libxml/tree.h>

#include <cerrno>
#include <cstring>

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

/** The rules file's text; false when it is larger than any real one. */
bool read_rules(const char *path, std::string *text) {
  const UniqueFd fd = safe_open(path, O_RDONLY | O_NONBLOCK | O_NOCTTY);
  struct stat status = {};
  if (!fd || fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) return false;
  if (static_cast<std::size_t>(status.st_size) > kMaxRulesSize) return false;
  text->resize(kMaxRulesSize + 1);
  std::size_t done = 0;
  while (done < text->size()) {
    const ssize_t count = read(fd.get(), text->data() + done, text->size() - done);
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return false;
    if (count == 0) break;
    done += static_cast<std::size_t>(count);
  }
  text->resize(done);
  return done <= kMaxRulesSize;
}

std::string absolute_path(const char *root, const char *value) {
  return value[0] == '/' ? std::string(root) + value : std::string(root) + "/" + value;
}

std::uint64_t measure(DirPtr dir, const WorkingFiles &working, std::string *path, int depth) {
  std::uint64_t sum = 0;
  while (const dirent *entry = readdir(dir.get())) {
    if (is_dot_entry(entry->d_name)) continue;
    const PathStep step(path, entry->d_name);
    if (working.contain(*path)) continue;
    struct stat status = {};
    const int result = fstatat(dirfd(dir.get()), entry->d_name, &status, AT_SYMLINK_NOFOLLOW);
    if (result != 0) {
      LOGE("error : lstat for %d %s", result, path->c_str());
    } else if (S_ISDIR(status.st_mode)) {
      DirPtr child;
      if (depth < kMaxDirDepth) child = safe_opendir_at(dirfd(dir.get()), entry->d_name);
      if (child == nullptr) {
        LOGE("error : cannot open this path %s", path->c_str());
        sum += kUnmeasurableSize;
      } else {
        sum += measure(std::move(child), working, path, depth + 1);
      }
    } else if (S_ISREG(status.st_mode)) {
      if (is_backup_file(path->c_str())) sum += static_cast<std::uint64_t>(status.st_size);
    } else if (S_ISLNK(status.st_mode)) {
      if (is_backup_file(path->c_str())) {
        sum += static_cast<std::uint64_t>(status.st_size);
        LOGI("size of lnk file %s : %d", path->c_str(), static_cast<int>(status.st_size));
      }
    } else {
      LOGE("this is unexpected type : %s", path->c_str());
    }
  }
  return sum;
}

}  // namespace

RulesDoc load_rules(const char *path) {
  std::string text;
  if (!read_rules(path, &text)) return nullptr;
  RulesDoc doc(xmlReadMemory(text.data(), static_cast<int>(text.size()), path, nullptr,
                             XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING));
  // rules need no entities; whoever declares some means the parser
  if (doc != nullptr && doc->intSubset != nullptr && doc->intSubset->children != nullptr) {
    return nullptr;
  }
  return doc;
}

void reset_backup_path_info() {
  backup_include_list.clear();
  backup_exclude_list.clear();
  xml_has_include_field = false;
}

void parse_backup_path_xml(const char *pkg_id, const char *pkg_type, const char *root) {
  reset_backup_path_info();
  const bool is_native = std::strcmp(pkg_type, kNativeType) == 0;
  const std::string path = std::string(root) + (is_native ? kRulesFile : kWebRulesFile);
  if (!file_exist(path.c_str())) return;
  LOGI("(%s) has xml file(for include/exlude path)", pkg_id);

  const RulesDoc doc = load_rules(path.c_str());
  if (doc == nullptr) {
    LOGE("Could not load xml file.\n");
    return;
  }
  const xmlNode *element = xmlDocGetRootElement(doc.get());
  if (element == nullptr) {
    LOGE("empty document.\n");
    return;
  }
  if (!has_name(element, kRootElement)) {
    LOGE("root name %s error!\n", reinterpret_cast<const char *>(element->name));
    return;
  }
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

void add_to_path_info_list(const char *path, std::vector<std::string> *list) {
  struct stat status = {};
  if (safe_lstat(path, &status) == 0) list->emplace_back(path);
}

bool is_child_file(const char *parent, const char *path) {
  const std::size_t length = std::strlen(parent);
  return length > 0 && parent[length - 1] == '/' && std::strncmp(parent, path, length) == 0;
}

bool is_backup_file(const char *path) {
  for (const auto &excluded : backup_exclude_list) {
    if (excluded == path || is_child_file(excluded.c_str(), path)) return false;
  }
  if (!xml_has_include_field) return true;
  for (const auto &included : backup_include_list) {
    if (included == path || is_child_file(included.c_str(), path)) return true;
  }
  return false;
}

std::uint64_t get_dir_backup_size(const char *dir_path, const char *pkg_id, const char *root) {
  DirPtr dir = safe_opendir(dir_path);
  if (dir == nullptr) {
    LOGE("error : cannot open this path %s", dir_path);
    return kUnmeasurableSize;
  }
  const WorkingFiles working(pkg_id, root);
  std::string path = dir_path;
  return measure(std::move(dir), working, &path, 1);
}
