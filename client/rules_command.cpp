#include <json-c/json.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>

#include "files/package_files.h"
#include "glib_handles.h"
#include "json_ptr.h"
#include "json_read.h"
#include "platform_package_manager.h"
#include "quarn_handles.h"
#include "rules.h"
#include "rules_private.h"
#include "text.h"

using quarn_client::json_add;
using quarn_client::printable;

namespace {

constexpr int kUsageError = 64;

int fail(const char *verb, bool json, int code, const std::string &text) {
  std::fprintf(stderr, "quarnctl: %s\n", printable(text).c_str());
  if (json) {
    const JsonPtr object(json_object_new_object());
    json_add(object.get(), "verb", verb);
    std::fputs(finish_rules_document(object.get(), code, text).c_str(), stdout);
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
    const GText id(g_key_file_get_string(file.get(), "package", "id", nullptr));
    const GText type(g_key_file_get_string(file.get(), "package", "type", nullptr));
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
