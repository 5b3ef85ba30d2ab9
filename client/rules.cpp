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
#include <filesystem>
#include <memory>

#include "json_read.h"
#include "platform_package_manager.h"
#include "quarn_common.h"
#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/quarn_d_utils.h"
#include "quarn_d_utils/rules_file.h"
#include "quarn_d_utils/safe_path.h"
#include "quarn_d_utils/working_files.h"
#include "text.h"

using quarn_client::display_width;
using quarn_client::json_add;
using quarn_client::json_text;
using quarn_client::printable;
using quarn_client::size_text;

namespace {

constexpr char kTpkRules[] = "res/backup.path.xml";
constexpr char kOtherRules[] = "res/wgt/res/backup.path.xml";
constexpr const char *kDataDirs[] = {"data", "shared/data", "shared/trusted"};
constexpr char kCheckVerb[] = "rules check";
constexpr char kExplainVerb[] = "rules explain";
constexpr std::size_t kLargestShown = 10;
constexpr std::size_t kMaxPathColumns = 60;
constexpr std::size_t kSizeColumns = 11;
constexpr int kUsageError = 64;

using XmlText = std::unique_ptr<xmlChar, void (*)(xmlChar *)>;

void free_xml_text(xmlChar *text) { xmlFree(text); }

bool begins_with(const std::string &text, const std::string &start) {
  return text.compare(0, start.size(), start) == 0;
}

std::string joined(const std::string &root, const std::string &value) {
  return begins_with(value, "/") ? root + value : root + "/" + value;
}

bool exists(const std::string &path) {
  struct stat status {};
  return safe_lstat(path.c_str(), &status) == 0;
}

/** Why the daemon gets no document out of a file that is there. */
rule_problem unusable_file(const rules_report &report, const std::string &path) {
  if (!file_exist(path.c_str())) {
    return {"unreadable", 0, report.file, "the rules file is no regular file: it is ignored"};
  }
  if (!safe_open(path.c_str(), O_RDONLY)) {
    return {"unreadable", 0, report.file, "the rules file cannot be read: it is ignored"};
  }
  return {"malformed", 0, report.file, "not readable as XML: the file is ignored"};
}

/** Why nothing of an application with such a file is backed up. */
rule_problem blocking_file(const rules_report &report, rules_state state) {
  const char *kind = state == rules_state::too_large  ? "too-large"
                     : state == rules_state::entities ? "entities"
                                                      : "no-library";
  return {kind, 0, report.file,
          std::string(rules_state_text(state)) + ": the application is not backed up"};
}

// The daemon's loader keeps what exists; a report also needs what it dropped, and line numbers.
void read_elements(rules_report *report) {
  const std::string path = report->root + "/" + report->file;
  rules_state state = rules_state::none;
  const RulesDoc document = load_rules(path.c_str(), &state);
  if (!document) {
    report->blocked = !rules_usable(state);
    report->ignored = !report->blocked;
    report->problems.push_back(report->blocked ? blocking_file(*report, state)
                                               : unusable_file(*report, path));
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
int deciding_element(rules_report *report, const std::string &path, bool in) {
  int deciding = -1;
  for (std::size_t i = 0; i < report->elements.size(); ++i) {
    rule_element &element = report->elements[i];
    if (!element.has_path) continue;
    if (element.path != path && !is_child_file(element.path.c_str(), path.c_str())) continue;
    ++element.matches;
    if (in) ++element.kept;
    if (deciding < 0 && element.include == in) deciding = static_cast<int>(i);
  }
  return deciding;
}

std::string relative_to(const rules_report &report, const std::string &path) {
  return path.substr(report.root.size() + 1);
}

void note_unreadable(rules_report *report, const std::string &path) {
  report->problems.push_back({"unreadable", 0, relative_to(*report, path),
                              "the directory cannot be read: the application would be skipped"});
}

void note_entry(rules_report *report, const std::string &path, const struct stat &status) {
  rule_entry entry;
  entry.path = relative_to(*report, path);
  if (!S_ISREG(status.st_mode) && !S_ISLNK(status.st_mode)) {
    report->problems.push_back({"special-file", 0, entry.path,
                                "neither file, directory nor link: its application's backup "
                                "fails"});
    return;
  }
  entry.link = S_ISLNK(status.st_mode);
  entry.size = static_cast<std::uint64_t>(status.st_size);
  entry.in = !report->blocked && is_backup_file(path.c_str());
  entry.element = deciding_element(report, path, entry.in);
  report->entries.push_back(entry);
}

/** As the daemon walks, and no deeper: beyond it an application is skipped. */
void walk(rules_report *report, const DirPtr &dir, std::string *path, int depth) {
  const WorkingFiles working(report->package, report->root);
  std::vector<std::string> names;
  while (const dirent *entry = readdir(dir.get())) {
    if (!is_dot_entry(entry->d_name)) names.emplace_back(entry->d_name);
  }
  std::sort(names.begin(), names.end());
  for (const std::string &name : names) {
    const PathStep step(path, name.c_str());
    struct stat status {};
    if (working.contain(*path) ||
        fstatat(dirfd(dir.get()), name.c_str(), &status, AT_SYMLINK_NOFOLLOW) != 0) {
      continue;
    }
    if (!S_ISDIR(status.st_mode)) {
      note_entry(report, *path, status);
      continue;
    }
    DirPtr child;
    if (depth < kMaxDirDepth) child = safe_opendir_at(dirfd(dir.get()), name.c_str());
    if (child) {
      walk(report, child, path, depth + 1);
    } else {
      note_unreadable(report, *path);
    }
  }
}

void walk_data(rules_report *report, const char *name, bool installed) {
  std::string path = report->root + "/" + name;
  const DirPtr dir = safe_opendir(path.c_str());
  if (dir) {
    walk(report, dir, &path, 1);
  } else if (installed || exists(path)) {
    // A source need not bring all three: the installation makes them.
    note_unreadable(report, path);
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
    } else if (element.include && element.kept == 0) {
      report->problems.push_back(
          {"all-excluded", element.line, element.given,
           name + " \"" + element.given + "\" has no effect: all that it covers is excluded"});
    }
  }
}

std::string why(const rules_report &report, const rule_entry &entry) {
  if (entry.element >= 0) {
    const rule_element &element = report.elements[entry.element];
    return std::string(element.include ? "include" : "exclude") + " \"" + printable(element.given) +
           "\", line " + std::to_string(element.line);
  }
  if (report.ignored) return "the rules file is ignored";
  if (report.blocked) return "the rules file cannot be used";
  if (entry.in) return report.file.empty() ? "no rules file" : "no rule speaks of it";
  return "no include covers it";
}

std::string size_column(const rule_entry &entry) {
  const std::string size = size_text(entry.size);
  return std::string(kSizeColumns - std::min(size.size(), kSizeColumns), ' ') + size;
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

void put(json_object *object, const char *key, std::uint64_t number) {
  json_object_object_add(object, key, json_object_new_uint64(number));
}

void add_entry(json_object *object, const rules_report &report, const rule_entry &entry) {
  json_add(object, "path", entry.path);
  json_add(object, "type", entry.link ? "link" : "file");
  put(object, "size", entry.size);
  json_object_object_add(object, "in", json_object_new_boolean(entry.in ? 1 : 0));
  json_object *rule = nullptr;
  if (entry.element >= 0) {
    const rule_element &element = report.elements[entry.element];
    rule = json_object_new_object();
    json_add(rule, "kind", element.include ? "include" : "exclude");
    json_add(rule, "path", element.given);
    put(rule, "line", static_cast<std::uint64_t>(element.line));
  }
  json_object_object_add(object, "rule", rule);
}

json_object *entry_json(const rules_report &report, const rule_entry &entry) {
  json_object *object = json_object_new_object();
  add_entry(object, report, entry);
  return object;
}

/** What an exit code of a finished check says. */
const char *exit_text(int code, bool blocked = false) {
  switch (code) {
    case RULES_PROBLEMS:
      return "mistakes were found";
    case RULES_OVER_CAP:
      return "over the size limit";
    case RULES_UNUSABLE:
      return blocked ? "the rules file cannot be used, so nothing is backed up"
                     : "the rules file is ignored";
    default:
      return "success";
  }
}

/** The members with which every verb's object ends; the object's line. */
std::string finished(json_object *object, int code, const std::string &message) {
  put(object, "exit", static_cast<std::uint64_t>(code));
  json_add(object, "message", message);
  return json_text(object) + "\n";
}

int fail(const char *verb, bool json, int code, const std::string &text) {
  std::fprintf(stderr, "quarnctl: %s\n", printable(text).c_str());
  if (json) {
    const JsonPtr object(json_object_new_object());
    json_add(object.get(), "verb", verb);
    std::fputs(finished(object.get(), code, text).c_str(), stdout);
  }
  return code;
}

struct package_place {
  std::string id;
  std::string type;
  std::string root;
  bool installed;
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
    *place = {id.get(), type ? type.get() : "tpk", root.get(), false};
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
  *place = {name, type.get(), root.get(), true};
  return true;
}

}  // namespace

rules_report check_rules(const std::string &package_id, const std::string &type,
                         const std::string &root, bool installed) {
  rules_report report;
  report.package = package_id;
  report.root = root;
  report.cap = kMaxBackupSize;
  const std::string file = type == "tpk" ? kTpkRules : kOtherRules;
  const std::string other = type == "tpk" ? kOtherRules : kTpkRules;
  if (exists(root + "/" + file)) {
    report.file = file;
    read_elements(&report);
  } else if (exists(root + "/" + other)) {
    report.problems.push_back(
        {"wrong-place", 0, other, "a package of type \"" + type + "\" keeps its rules in " + file});
  }
  parse_backup_path_xml(package_id.c_str(), type.c_str(), root.c_str());
  for (const char *name : kDataDirs) walk_data(&report, name, installed);
  for (const rule_entry &entry : report.entries) report.total += entry.in ? entry.size : 0;
  find_mistakes(&report);
  reset_backup_path_info();
  return report;
}

int rules_exit_code(const rules_report &report) {
  if (report.ignored || report.blocked) return RULES_UNUSABLE;
  if (report.total > report.cap) return RULES_OVER_CAP;
  return report.problems.empty() ? RULES_OK : RULES_PROBLEMS;
}

std::string rules_text(const rules_report &report) {
  std::string text = report.package + ": ";
  text += report.file.empty() ? "no rules file, everything is backed up\n"
                              : "rules in " + report.file + "\n";
  std::size_t width = 0;
  for (const rule_entry &entry : report.entries) {
    width = std::max(width, std::min(display_width(printable(entry.path)), kMaxPathColumns));
  }
  for (const rule_entry &entry : report.entries) {
    const std::string path = printable(entry.path);
    const std::size_t columns = display_width(path);
    text += std::string(entry.in ? "  in   " : "  out  ") + path +
            std::string(columns < width ? width - columns : 0, ' ') + size_column(entry) + "  " +
            why(report, entry) + "\n";
  }
  const auto taken = std::count_if(report.entries.begin(), report.entries.end(),
                                   [](const rule_entry &entry) { return entry.in; });
  text += std::to_string(taken) + " of " + std::to_string(report.entries.size()) + " in, " +
          std::to_string(report.total) + " bytes (" + size_text(report.total) + ") of at most " +
          std::to_string(report.cap) + " (" + size_text(report.cap) + ")\n";
  if (report.total > report.cap) {
    text += "over the limit: the application would be skipped; its largest files:\n";
    for (const rule_entry &entry : largest(report)) {
      text += " " + size_column(entry) + "  " + printable(entry.path) + "\n";
    }
  }
  for (const rule_problem &problem : report.problems) {
    text += "warning: ";
    if (problem.line > 0) text += "line " + std::to_string(problem.line) + ": ";
    text += printable(problem.text);
    if (problem.line == 0 && !problem.path.empty() && problem.path != report.file) {
      text += ": " + printable(problem.path);
    }
    text += "\n";
  }
  return text;
}

std::string rules_json(const rules_report &report) {
  const JsonPtr object(json_object_new_object());
  json_add(object.get(), "verb", kCheckVerb);
  json_add(object.get(), "package", report.package);
  json_add(object.get(), "rules", report.file);
  json_object_object_add(object.get(), "ignored", json_object_new_boolean(report.ignored ? 1 : 0));
  json_object_object_add(object.get(), "blocked", json_object_new_boolean(report.blocked ? 1 : 0));
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
    json_add(item, "kind", problem.kind);
    put(item, "line", static_cast<std::uint64_t>(problem.line));
    json_add(item, "path", problem.path);
    json_add(item, "text", problem.text);
    json_object_array_add(problems, item);
  }
  json_object_object_add(object.get(), "problems", problems);
  const int code = rules_exit_code(report);
  return finished(object.get(), code, exit_text(code, report.blocked));
}

std::string explain_rules(const rules_report &report, const std::string &path, bool json,
                          int *exit_code) {
  std::string relative = path;
  if (begins_with(relative, report.root + "/")) relative.erase(0, report.root.size() + 1);
  while (begins_with(relative, "/")) relative.erase(0, 1);
  relative = std::filesystem::path(relative).lexically_normal();  // as find prints it: "./data/a"
  const auto found = std::find_if(report.entries.begin(), report.entries.end(),
                                  [&](const rule_entry &entry) { return entry.path == relative; });
  if (found == report.entries.end()) {
    *exit_code = RULES_NO_INPUT;
    return "";
  }
  *exit_code = RULES_OK;
  if (json) {
    const JsonPtr object(json_object_new_object());
    json_add(object.get(), "verb", kExplainVerb);
    json_add(object.get(), "package", report.package);
    add_entry(object.get(), report, *found);
    return finished(object.get(), RULES_OK, exit_text(RULES_OK));
  }
  return printable(found->path) + ": " + (found->in ? "in" : "out") + " (" + why(report, *found) +
         ")\n";
}

int rules_command(const std::vector<std::string> &arguments, bool json) {
  const bool check = arguments.size() == 2 && arguments[0] == "check";
  const bool explain = arguments.size() == 3 && arguments[0] == "explain";
  if (!check && !explain) {
    return fail("rules", json, kUsageError,
                "usage: quarnctl rules check SOURCE-or-PKGID | rules explain PKGID PATH");
  }
  const char *const verb = check ? kCheckVerb : kExplainVerb;
  package_place place;
  std::string problem;
  if (!find_package(arguments[1], &place, &problem))
    return fail(verb, json, RULES_NO_INPUT, problem);
  const rules_report report = check_rules(place.id, place.type, place.root, place.installed);
  if (check) {
    std::fputs((json ? rules_json(report) : rules_text(report)).c_str(), stdout);
    return rules_exit_code(report);
  }
  int code = RULES_OK;
  const std::string text = explain_rules(report, arguments[2], json, &code);
  if (code != RULES_OK) {
    return fail(verb, json, code,
                "\"" + arguments[2] + "\" is no file or link in the application's data");
  }
  std::fputs(text.c_str(), stdout);
  return code;
}
