#include "rules.h"

#include <dirent.h>
#include <fcntl.h>
#include <json-c/json.h>
#include <libxml/parser.h>
#include <libxml/tree.h>
#include <sys/stat.h>

#include <algorithm>
#include <climits>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/rules_file.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_d_utils/working_files.h"

namespace {

constexpr char kTpkRules[] = "res/backup.path.xml";
constexpr char kOtherRules[] = "res/wgt/res/backup.path.xml";
constexpr const char *kDataDirs[] = {"data", "shared/data", "shared/trusted"};
constexpr std::size_t kLargestShown = 10;
constexpr int kUsageError = 64;

using XmlText = std::unique_ptr<xmlChar, void (*)(xmlChar *)>;

void free_xml_text(xmlChar *text) { xmlFree(text); }

std::string cleaned(const std::string &text) {
  // File names are data: their control characters must not reach the terminal.
  std::string result;
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    if (byte < 0x20 || byte == 0x7f) {
      char escape[8];
      std::snprintf(escape, sizeof escape, "\\x%02x", byte);
      result += escape;
    } else {
      result += c;
    }
  }
  return result;
}

bool begins_with(const std::string &text, const std::string &start) {
  return text.compare(0, start.size(), start) == 0;
}

std::string joined(const std::string &root, const std::string &value) {
  return begins_with(value, "/") ? root + value : root + "/" + value;
}

// The daemon's loader keeps what exists; a report also needs what it dropped, and line numbers.
void read_elements(rules_report *report) {
  const std::string path = report->root + "/" + report->file;
  const RulesDoc document = load_rules(path.c_str());
  if (!document) {
    report->ignored = true;
    struct stat status {};
    if (safe_lstat(path.c_str(), &status) == 0 &&
        static_cast<std::size_t>(status.st_size) > kMaxRulesSize) {
      report->problems.push_back(
          {"too-large", 0, report->file,
           "larger than " + std::to_string(kMaxRulesSize) + " bytes: the file is ignored"});
      return;
    }
    report->problems.push_back(
        {"malformed", 0, report->file, "not readable as XML: the file is ignored"});
    return;
  }
  xmlNode *root = xmlDocGetRootElement(document.get());
  if (root == nullptr || std::strcmp(reinterpret_cast<const char *>(root->name), "backup") != 0) {
    report->ignored = true;
    const std::string name = root == nullptr ? "" : reinterpret_cast<const char *>(root->name);
    report->problems.push_back(
        {"root-element", root == nullptr ? 0 : static_cast<int>(xmlGetLineNo(root)), name,
         "the root element is \"" + name + "\", not \"backup\": the file is ignored"});
    return;
  }
  for (xmlNode *node = root->children; node != nullptr; node = node->next) {
    if (node->type != XML_ELEMENT_NODE) continue;
    const std::string name = reinterpret_cast<const char *>(node->name);
    if (name != "include" && name != "exclude") {
      report->problems.push_back({"unknown-element", static_cast<int>(xmlGetLineNo(node)), name,
                                  "element \"" + name + "\" is not known and is ignored"});
      continue;
    }
    rule_element element;
    element.include = name == "include";
    element.line = static_cast<int>(xmlGetLineNo(node));
    const XmlText value(xmlGetProp(node, reinterpret_cast<const xmlChar *>("path")), free_xml_text);
    if (value) {
      element.has_path = true;
      element.given = reinterpret_cast<const char *>(value.get());
      element.path = joined(report->root, element.given);
    } else {
      report->problems.push_back(
          {"no-path", element.line, name, "element \"" + name + "\" has no attribute \"path\""});
    }
    report->elements.push_back(element);
  }
}

// Which element decided: the first one of the daemon's order that covers the path.
int deciding_element(const rules_report &report, const std::string &path, bool in) {
  for (std::size_t i = 0; i < report.elements.size(); ++i) {
    const rule_element &element = report.elements[i];
    if (!element.has_path || element.include != in) continue;
    if (element.path == path || is_child_file(element.path.c_str(), path.c_str())) {
      return static_cast<int>(i);
    }
  }
  return -1;
}

void walk(rules_report *report, const std::string &folder) {
  const WorkingFiles working(report->package, report->root);
  const DirPtr dir = safe_opendir(folder.c_str());
  if (!dir) {
    report->problems.push_back({"unreadable", 0, folder.substr(report->root.size() + 1),
                                "the directory cannot be read: the application would be skipped"});
    return;
  }
  std::vector<std::string> names;
  while (const dirent *entry = readdir(dir.get())) names.emplace_back(entry->d_name);
  std::sort(names.begin(), names.end());
  for (const std::string &name : names) {
    if (name == "." || name == "..") continue;
    const std::string path = folder + "/" + name;
    struct stat status {};
    if (working.contain(path) || safe_lstat(path.c_str(), &status) != 0) continue;
    if (S_ISDIR(status.st_mode)) {
      walk(report, path);
      continue;
    }
    rule_entry entry;
    entry.path = path.substr(report->root.size() + 1);
    if (!S_ISREG(status.st_mode) && !S_ISLNK(status.st_mode)) {
      report->problems.push_back({"special-file", 0, entry.path,
                                  "neither file, directory nor link: its application's backup "
                                  "fails"});
      continue;
    }
    entry.link = S_ISLNK(status.st_mode);
    entry.size = static_cast<std::uint64_t>(status.st_size);
    entry.in = is_backup_file(path.c_str());
    entry.element = deciding_element(*report, path, entry.in);
    if (entry.element >= 0) ++report->elements[entry.element].matches;
    report->entries.push_back(entry);
  }
}

// Mistakes that only show once it is known what the elements matched.
void find_mistakes(rules_report *report) {
  for (const rule_element &element : report->elements) {
    if (!element.has_path) continue;
    struct stat status {};
    const bool exists = safe_lstat(element.path.c_str(), &status) == 0;
    const std::string name = element.include ? "include" : "exclude";
    if (!exists) {
      report->problems.push_back(
          {"nothing-there", element.line, element.given,
           name + " \"" + element.given + "\" names nothing: it is dropped"});
    } else if (S_ISDIR(status.st_mode) && element.path.back() != '/') {
      report->problems.push_back({"no-trailing-slash", element.line, element.given,
                                  name + " \"" + element.given +
                                      "\" names a directory without a trailing slash: it covers "
                                      "nothing inside"});
    } else if (element.matches == 0) {
      report->problems.push_back({"matches-nothing", element.line, element.given,
                                  name + " \"" + element.given + "\" matches nothing"});
    }
  }
}

std::string human(std::uint64_t bytes) {
  char text[32];
  if (bytes < 1000) {
    std::snprintf(text, sizeof text, "%llu B", static_cast<unsigned long long>(bytes));
  } else if (bytes < 1000 * 1000) {
    std::snprintf(text, sizeof text, "%.1f kB", static_cast<double>(bytes) / 1e3);
  } else {
    std::snprintf(text, sizeof text, "%.1f MB", static_cast<double>(bytes) / 1e6);
  }
  return text;
}

std::string why(const rules_report &report, const rule_entry &entry) {
  if (entry.element >= 0) {
    const rule_element &element = report.elements[entry.element];
    return std::string(element.include ? "include" : "exclude") + " \"" + cleaned(element.given) +
           "\", line " + std::to_string(element.line);
  }
  if (entry.in) return report.file.empty() ? "no rules file" : "no rule speaks of it";
  return "no include covers it";
}

std::vector<rule_entry> largest(const rules_report &report) {
  std::vector<rule_entry> entries;
  std::copy_if(report.entries.begin(), report.entries.end(), std::back_inserter(entries),
               [](const rule_entry &entry) { return entry.in; });
  std::stable_sort(entries.begin(), entries.end(),
                   [](const rule_entry &a, const rule_entry &b) { return a.size > b.size; });
  if (entries.size() > kLargestShown) entries.resize(kLargestShown);
  return entries;
}

void put(json_object *object, const char *key, const std::string &text) {
  json_object_object_add(object, key,
                         json_object_new_string_len(text.data(), static_cast<int>(text.size())));
}

void put(json_object *object, const char *key, std::uint64_t number) {
  json_object_object_add(object, key, json_object_new_uint64(number));
}

json_object *entry_json(const rules_report &report, const rule_entry &entry) {
  json_object *object = json_object_new_object();
  put(object, "path", entry.path);
  put(object, "type", std::string(entry.link ? "link" : "file"));
  put(object, "size", entry.size);
  json_object_object_add(object, "in", json_object_new_boolean(entry.in ? 1 : 0));
  json_object *rule = nullptr;
  if (entry.element >= 0) {
    const rule_element &element = report.elements[entry.element];
    rule = json_object_new_object();
    put(rule, "kind", std::string(element.include ? "include" : "exclude"));
    put(rule, "path", element.given);
    put(rule, "line", static_cast<std::uint64_t>(element.line));
  }
  json_object_object_add(object, "rule", rule);
  return object;
}

std::string line_of(json_object *object) {
  return std::string(json_object_to_json_string_ext(object, JSON_C_TO_STRING_PLAIN)) + "\n";
}

int fail(bool json, int code, const std::string &text) {
  if (json) {
    const JsonPtr object(json_object_new_object());
    put(object.get(), "error", text);
    put(object.get(), "exit", static_cast<std::uint64_t>(code));
    std::fputs(line_of(object.get()).c_str(), stdout);
  } else {
    std::fprintf(stderr, "quarnctl: %s\n", cleaned(text).c_str());
  }
  return code;
}

struct package_place {
  std::string id;
  std::string type;
  std::string root;
};

// A source directory has a package.ini; anything else is the id of an installed package.
bool find_package(const std::string &name, package_place *place, std::string *problem) {
  const std::string ini = name + "/package.ini";
  if (access(ini.c_str(), F_OK) == 0) {
    const Handle<GKeyFile, &g_key_file_unref> file(g_key_file_new());
    GErrorPtr error;
    if (g_key_file_load_from_file(file.get(), ini.c_str(), G_KEY_FILE_NONE, out(error)) == FALSE) {
      *problem = ini + ": " + error->message;
      return false;
    }
    const GString_ id(g_key_file_get_string(file.get(), "package", "id", nullptr));
    const GString_ type(g_key_file_get_string(file.get(), "package", "type", nullptr));
    const CString root(realpath(name.c_str(), nullptr));
    if (!id || !root) {
      *problem = ini + ": no package id";
      return false;
    }
    *place = {id.get(), type ? type.get() : "tpk", root.get()};
    return true;
  }
  package_info_h info = nullptr;
  if (!is_safe_path_component(name) ||
      package_manager_get_package_info(name.c_str(), &info) != PACKAGE_MANAGER_ERROR_NONE) {
    *problem = "\"" + name + "\" is neither a package source nor an installed package";
    return false;
  }
  CString type;
  CString root;
  package_info_get_type(info, out(type));
  package_info_get_root_path(info, out(root));
  package_info_destroy(info);
  if (!type || !root) {
    *problem = "the package manager does not know where \"" + name + "\" lies";
    return false;
  }
  *place = {name, type.get(), root.get()};
  return true;
}

}  // namespace

rules_report check_rules(const std::string &package_id, const std::string &type,
                         const std::string &root) {
  rules_report report;
  report.package = package_id;
  report.root = root;
  report.cap = kMaxBackupSize;
  const std::string file = type == "tpk" ? kTpkRules : kOtherRules;
  const std::string other = type == "tpk" ? kOtherRules : kTpkRules;
  if (file_exist((root + "/" + file).c_str())) {
    report.file = file;
    read_elements(&report);
  } else if (file_exist((root + "/" + other).c_str())) {
    report.problems.push_back(
        {"wrong-place", 0, other, "a package of type \"" + type + "\" keeps its rules in " + file});
  }
  parse_backup_path_xml(package_id.c_str(), type.c_str(), root.c_str());
  for (const char *name : kDataDirs) {
    const std::string folder = root + "/" + name;
    // A source need not bring all three: the installation makes them.
    if (is_directory(folder.c_str())) walk(&report, folder);
  }
  for (const rule_entry &entry : report.entries) report.total += entry.in ? entry.size : 0;
  find_mistakes(&report);
  reset_backup_path_info();
  return report;
}

int rules_exit_code(const rules_report &report) {
  if (report.ignored) return RULES_UNUSABLE;
  if (report.total > report.cap) return RULES_OVER_CAP;
  return report.problems.empty() ? RULES_OK : RULES_PROBLEMS;
}

std::string rules_text(const rules_report &report) {
  std::string text = report.package + ": ";
  text += report.file.empty() ? "no rules file, everything is backed up\n"
                              : "rules in " + report.file + "\n";
  std::size_t width = 0;
  for (const rule_entry &entry : report.entries) {
    width = std::max(width, std::min<std::size_t>(cleaned(entry.path).size(), 60));
  }
  for (const rule_entry &entry : report.entries) {
    std::string path = cleaned(entry.path);
    if (path.size() < width) path.append(width - path.size(), ' ');
    char size[16];
    std::snprintf(size, sizeof size, "%10s", human(entry.size).c_str());
    text += std::string(entry.in ? "  in   " : "  out  ") + path + size + "  " +
            why(report, entry) + "\n";
  }
  const auto taken = std::count_if(report.entries.begin(), report.entries.end(),
                                   [](const rule_entry &entry) { return entry.in; });
  text += std::to_string(taken) + " of " + std::to_string(report.entries.size()) + " in, " +
          human(report.total) + " of at most " + human(report.cap) + "\n";
  if (report.total > report.cap) {
    text += "over the limit: the application would be skipped; its largest files:\n";
    for (const rule_entry &entry : largest(report)) {
      char size[16];
      std::snprintf(size, sizeof size, "%10s", human(entry.size).c_str());
      text += std::string("  ") + size + "  " + cleaned(entry.path) + "\n";
    }
  }
  for (const rule_problem &problem : report.problems) {
    text += "warning: ";
    if (problem.line > 0) text += "line " + std::to_string(problem.line) + ": ";
    text += cleaned(problem.text);
    if (problem.line == 0 && !problem.path.empty() && problem.path != report.file) {
      text += ": " + cleaned(problem.path);
    }
    text += "\n";
  }
  return text;
}

std::string rules_json(const rules_report &report) {
  const JsonPtr object(json_object_new_object());
  put(object.get(), "package", report.package);
  put(object.get(), "rules", report.file);
  json_object_object_add(object.get(), "ignored", json_object_new_boolean(report.ignored ? 1 : 0));
  put(object.get(), "total", report.total);
  put(object.get(), "cap", report.cap);
  json_object_object_add(object.get(), "over_cap",
                         json_object_new_boolean(report.total > report.cap ? 1 : 0));
  json_object *entries = json_object_new_array();
  for (const rule_entry &entry : report.entries) {
    json_object_array_add(entries, entry_json(report, entry));
  }
  json_object_object_add(object.get(), "entries", entries);
  json_object *big = json_object_new_array();
  if (report.total > report.cap) {
    for (const rule_entry &entry : largest(report)) {
      json_object_array_add(big, entry_json(report, entry));
    }
  }
  json_object_object_add(object.get(), "largest", big);
  json_object *problems = json_object_new_array();
  for (const rule_problem &problem : report.problems) {
    json_object *item = json_object_new_object();
    put(item, "kind", problem.kind);
    put(item, "line", static_cast<std::uint64_t>(problem.line));
    put(item, "path", problem.path);
    put(item, "text", problem.text);
    json_object_array_add(problems, item);
  }
  json_object_object_add(object.get(), "problems", problems);
  put(object.get(), "exit", static_cast<std::uint64_t>(rules_exit_code(report)));
  return line_of(object.get());
}

std::string explain_rules(const rules_report &report, const std::string &path, bool json,
                          int *exit_code) {
  std::string relative = path;
  if (begins_with(relative, report.root + "/")) relative.erase(0, report.root.size() + 1);
  while (begins_with(relative, "/")) relative.erase(0, 1);
  const auto found = std::find_if(report.entries.begin(), report.entries.end(),
                                  [&](const rule_entry &entry) { return entry.path == relative; });
  if (found == report.entries.end()) {
    *exit_code = RULES_NO_INPUT;
    return "";
  }
  *exit_code = RULES_OK;
  if (json) {
    const JsonPtr object(entry_json(report, *found));
    return line_of(object.get());
  }
  return cleaned(found->path) + ": " + (found->in ? "in" : "out") + " (" + why(report, *found) +
         ")\n";
}

int rules_command(const std::vector<std::string> &arguments, bool json) {
  const bool check = arguments.size() == 2 && arguments[0] == "check";
  const bool explain = arguments.size() == 3 && arguments[0] == "explain";
  if (!check && !explain) {
    return fail(json, kUsageError,
                "usage: quarnctl rules check SOURCE-or-PKGID | rules explain PKGID PATH");
  }
  package_place place;
  std::string problem;
  if (!find_package(arguments[1], &place, &problem)) return fail(json, RULES_NO_INPUT, problem);
  const rules_report report = check_rules(place.id, place.type, place.root);
  if (check) {
    std::fputs((json ? rules_json(report) : rules_text(report)).c_str(), stdout);
    return rules_exit_code(report);
  }
  int code = RULES_OK;
  const std::string text = explain_rules(report, arguments[2], json, &code);
  if (code != RULES_OK) {
    return fail(json, code,
                "\"" + arguments[2] + "\" is no file or link in the application's data");
  }
  std::fputs(text.c_str(), stdout);
  return code;
}
