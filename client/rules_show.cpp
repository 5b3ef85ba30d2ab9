#include <json-c/json.h>

#include <algorithm>
#include <filesystem>

#include "json_ptr.h"
#include "json_read.h"
#include "rules.h"
#include "rules_private.h"
#include "text.h"

using quarn_client::display_width;
using quarn_client::json_add;
using quarn_client::json_text;
using quarn_client::printable;
using quarn_client::size_text;

namespace {

constexpr std::size_t kLargestShown = 10;
constexpr std::size_t kMaxPathColumns = 60;
constexpr std::size_t kSizeColumns = 11;

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

}  // namespace

std::string finish_rules_document(json_object *object, int code, const std::string &message) {
  put(object, "exit", static_cast<std::uint64_t>(code));
  json_add(object, "message", message);
  return json_text(object) + "\n";
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
  return finish_rules_document(object.get(), code, exit_text(code, report.blocked));
}

std::string explain_rules(const rules_report &report, const std::string &path, bool json,
                          int *exit_code) {
  std::string relative = path;
  const std::string root = report.root + "/";
  if (relative.compare(0, root.size(), root) == 0) relative.erase(0, root.size());
  relative.erase(0, relative.find_first_not_of('/'));
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
    return finish_rules_document(object.get(), RULES_OK, exit_text(RULES_OK));
  }
  return printable(found->path) + ": " + (found->in ? "in" : "out") + " (" + why(report, *found) +
         ")\n";
}
