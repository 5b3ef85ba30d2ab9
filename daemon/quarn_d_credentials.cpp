#include "quarn_d_credentials.h"

#include <grp.h>
#include <pwd.h>

#include <cerrno>
#include <cstdlib>
#include <optional>
#include <string>
#include <vector>

#include "glib_handles.h"

namespace {

constexpr std::size_t kLookUpRoom = 4096;
constexpr int kGroupsAtFirst = 32;

std::optional<gid_t> given_group;

/** The groups of a user, for a bus that does not tell a process' own. */
std::vector<gid_t> groups_of_user(uid_t uid) {
  std::vector<char> room(kLookUpRoom);
  struct passwd user {};
  struct passwd *found = nullptr;
  if (getpwuid_r(uid, &user, room.data(), room.size(), &found) != 0 || found == nullptr) return {};
  std::vector<gid_t> groups(kGroupsAtFirst);
  int count = kGroupsAtFirst;
  if (getgrouplist(user.pw_name, user.pw_gid, groups.data(), &count) < 0) {
    groups.resize(static_cast<std::size_t>(count));
    if (getgrouplist(user.pw_name, user.pw_gid, groups.data(), &count) < 0) return {};
  }
  groups.resize(static_cast<std::size_t>(count));
  return groups;
}

std::string text_of_bytes(GVariant *bytes) {
  gsize length = 0;
  const auto *text =
      static_cast<const char *>(g_variant_get_fixed_array(bytes, &length, sizeof(char)));
  std::string label(text, text == nullptr ? 0 : length);
  // The bus ends it with a NUL.
  if (!label.empty() && label.back() == '\0') label.pop_back();
  return label.find('\0') == std::string::npos ? label : "";
}

gid_t look_up_client_group() {
  char *end = nullptr;
  constexpr int kDecimal = 10;
  const unsigned long number = std::strtoul(kClientGroup, &end, kDecimal);
  if (end != kClientGroup && *end == '\0') return static_cast<gid_t>(number);
  std::vector<char> room(kLookUpRoom);
  struct group group {};
  struct group *found = nullptr;
  while (getgrnam_r(kClientGroup, &group, room.data(), room.size(), &found) == ERANGE) {
    room.resize(room.size() * 2);
  }
  return found == nullptr ? kNoGroup : found->gr_gid;
}

}  // namespace

quarn_caller read_credentials(GVariant *reply) {
  quarn_caller caller;
  const GVariantPtr values(g_variant_get_child_value(reply, 0));
  guint32 uid = 0;
  if (g_variant_lookup(values.get(), "UnixUserID", "u", &uid) == FALSE) return caller;
  caller.known = true;
  caller.uid = uid;
  if (uid == 0) return caller;
  const GVariantPtr groups(
      g_variant_lookup_value(values.get(), "UnixGroupIDs", G_VARIANT_TYPE("au")));
  if (groups) {
    gsize count = 0;
    const auto *ids = static_cast<const guint32 *>(
        g_variant_get_fixed_array(groups.get(), &count, sizeof(guint32)));
    caller.groups.assign(ids, ids + count);
  } else {
    caller.groups = groups_of_user(uid);
  }
  const GVariantPtr label(
      g_variant_lookup_value(values.get(), "LinuxSecurityLabel", G_VARIANT_TYPE_BYTESTRING));
  if (label) caller.label = text_of_bytes(label.get());
  return caller;
}

gid_t client_group() { return given_group ? *given_group : look_up_client_group(); }

void set_client_group(gid_t group) { given_group = group; }
