#include "quarn_d_callers.h"

#include <algorithm>
#include <cstring>

#include "quarn_common.h"
#include "quarn_d_methods.h"

#ifndef QUARN_CLIENT_GROUP
#define QUARN_CLIENT_GROUP "quarn"
#endif

const char kClientGroup[] = QUARN_CLIENT_GROUP;

namespace {

/** A label that can be a package's: its id. What the system itself runs with is none. */
bool is_package_label(const std::string &label) {
  return label.size() > 1 && label != ".." && label.find('/') == std::string::npos;
}

/** The method's; other interfaces, and methods that do not exist, are for who is trusted. */
method_rights rights_to(const quarn_subject &subject) {
  const quarn_method *const method = subject.interface_name == kQuarnInterface
                                         ? find_quarn_method(subject.member.c_str())
                                         : nullptr;
  return method == nullptr ? method_rights::trusted : method->rights;
}

bool is_cancel_own(const quarn_subject &subject) {
  return subject.interface_name == "org.orvane.Quarn.Packages" && subject.member == "CancelOwn";
}

caller_verdict allowed() { return {true, ""}; }
caller_verdict refused(const std::string &reason) { return {false, reason}; }

caller_verdict application_may(const std::string &label, const quarn_subject &subject) {
  if (is_cancel_own(subject)) return allowed();
  if (rights_to(subject) != method_rights::own_package) {
    return refused(std::string("it is for root and the group ") + kClientGroup);
  }
  if (subject.package != label) return refused("an application may ask for its own package only");
  return allowed();
}

caller_verdict companion_may(const std::string &label, const quarn_subject &subject,
                             bool cloud_mode) {
  const method_rights rights = rights_to(subject);
  const bool switches_mode = rights == method_rights::companions_mode;
  if (rights != method_rights::as_companion && !switches_mode) {
    return application_may(label, subject);
  }
  if (subject.client != QUARN_CLIENT_COMPANION) {
    return refused("the companion may ask as the companion only");
  }
  if (switches_mode && !subject.switches_on && cloud_mode) {
    return refused("restore mode is not the companion's");
  }
  return allowed();
}

}  // namespace

caller_kind kind_of_caller(const quarn_caller &caller, gid_t client_group) {
  if (!caller.known) return caller_kind::nobody;
  if (caller.uid == 0) return caller_kind::trusted;
  const bool member =
      client_group != kNoGroup &&
      std::find(caller.groups.begin(), caller.groups.end(), client_group) != caller.groups.end();
  if (member) return caller_kind::trusted;
  if (caller.uid != kAppUid || !is_package_label(caller.label)) return caller_kind::nobody;
  return caller.label == kPellixPackage ? caller_kind::companion : caller_kind::application;
}

caller_verdict may_call(const quarn_caller &caller, gid_t client_group,
                        const quarn_subject &subject, bool cloud_mode) {
  switch (kind_of_caller(caller, client_group)) {
    case caller_kind::trusted:
      return allowed();
    case caller_kind::companion:
      return companion_may(caller.label, subject, cloud_mode);
    case caller_kind::application:
      return application_may(caller.label, subject);
    case caller_kind::nobody:
      break;
  }
  if (!caller.known) return refused("the bus does not tell who calls");
  if (caller.uid == kAppUid) return refused("its security label is no package's");
  return refused(std::string("it is for root and the group ") + kClientGroup);
}
