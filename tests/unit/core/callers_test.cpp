// The table of rights, row by row.
#include "quarn_d_callers.h"

#include <gtest/gtest.h>

#include "quarn_common.h"

namespace {

constexpr gid_t kGroup = 7001;
constexpr gid_t kNone = static_cast<gid_t>(-1);
constexpr char kStatus[] = "org.freedesktop.DBus.Properties";
constexpr char kIntrospectable[] = "org.freedesktop.DBus.Introspectable";
constexpr char kPackages[] = "org.orvane.Quarn.Packages";
constexpr char kNotes[] = "org.example.notes";
constexpr char kOther[] = "org.example.other";

quarn_caller of(uid_t uid, std::vector<gid_t> groups = {}, std::string label = "") {
  return {true, uid, std::move(groups), std::move(label)};
}

const quarn_caller kRoot = of(0);
const quarn_caller kMember = of(7001, {100, kGroup});
const quarn_caller kCompanion = of(kAppUid, {kAppGid}, kPellixPackage);
const quarn_caller kApplication = of(kAppUid, {kAppGid}, kNotes);

/** Who may, of: root, a member of the group, the companion, the application of kNotes. */
struct Row {
  quarn_subject asked;
  const char *may; /**< of "rgca" */
};

quarn_subject method(const char *member, const char *package = "", int client = -1,
                     bool switches_on = false) {
  return {kQuarnInterface, member, package, client, switches_on};
}

const Row kRows[] = {{method("set_activation"), "rg"},
                     {method("backup_enable"), "rg"},
                     {method("last_bu_time"), "rg"},
                     {method("auto_backup_start"), "rg"},
                     {method("manual_backup_start"), "rg"},
                     {method("manual_backup_cancel"), "rg"},
                     {method("fly"), "rg"},
                     {method("get_app_list", "", 0), "rg"},
                     {method("get_app_list", "", 1), "rgc"},
                     {method("get_app_list", "", 2), "rg"},
                     {method("get_app_list"), "rg"},
                     {method("restore_enable", "", 0, true), "rg"},
                     {method("restore_enable", "", 1, true), "rgc"},
                     {method("restore_enable", "", 0, false), "rg"},
                     {method("restore_enable", "", 1, false), "rgc"},
                     {method("restore_enable", "", 2, true), "rg"},
                     {method("app_data_backup_start", kNotes), "rga"},
                     {method("app_data_restore_start", kNotes), "rga"},
                     {method("make_app_data", kNotes), "rga"},
                     {method("app_data_backup_start", kOther), "rg"},
                     {method("app_data_restore_start", kOther), "rg"},
                     {method("make_app_data", kOther), "rg"},
                     {method("make_app_data", ""), "rg"},
                     {method("app_data_backup_start", kPellixPackage), "rgc"},
                     {method("make_app_data", kPellixPackage), "rgc"},
                     {{kPackages, "CancelOwn", "", -1, false}, "rgca"},
                     {{kPackages, "Restore", "", -1, false}, "rg"},
                     {{"org.example.Other", "CancelOwn", "", -1, false}, "rg"},
                     {{"org.example.Other", "make_app_data", kNotes, -1, false}, "rg"},
                     {{kStatus, "Get", "", -1, false}, "rg"},
                     {{kStatus, "GetAll", "", -1, false}, "rg"},
                     {{kStatus, "Set", "", -1, false}, "rg"},
                     {{kIntrospectable, "Introspect", "", -1, false}, "rg"},
                     {{"org.freedesktop.DBus.Peer", "Ping", "", -1, false}, "rg"},
                     {{"", "make_app_data", kNotes, -1, false}, "rg"}};

std::string who_may(const quarn_subject &asked, bool cloud_mode = false) {
  const std::pair<char, const quarn_caller *> callers[] = {
      {'r', &kRoot}, {'g', &kMember}, {'c', &kCompanion}, {'a', &kApplication}};
  std::string may;
  for (const auto &[letter, caller] : callers) {
    if (may_call(*caller, kGroup, asked, cloud_mode).allowed) may += letter;
  }
  return may;
}

TEST(Rights, EachCallerMayWhatItsRowSays) {
  for (const Row &row : kRows) {
    EXPECT_EQ(who_may(row.asked), row.may) << row.asked.interface_name << "." << row.asked.member
                                           << " " << row.asked.package << " " << row.asked.client;
  }
}

TEST(Rights, WhoHasNoPackagesLabelMayNothing) {
  const quarn_caller strangers[] = {of(kAppUid),                      // without a label
                                    of(kAppUid, {kAppGid}, ""),       //
                                    of(kAppUid, {kAppGid}, "_"),      // the floor label
                                    of(kAppUid, {kAppGid}, "^"),      //
                                    of(kAppUid, {kAppGid}, ".."),     //
                                    of(kAppUid, {kAppGid}, "a/b"),    //
                                    of(7001, {7001 + 1}),             // another user
                                    of(7001, {100}, kNotes),          // with a package's label
                                    of(7001, {100}, kPellixPackage),  //
                                    of(7001, {0}),                    // root's group is no root
                                    of(65534),                        //
                                    of(static_cast<uid_t>(-1)),       //
                                    quarn_caller{}};  // of whom the bus does not tell
  for (const quarn_caller &stranger : strangers) {
    for (const Row &row : kRows) {
      const caller_verdict verdict = may_call(stranger, kGroup, row.asked, false);
      EXPECT_FALSE(verdict.allowed)
          << stranger.uid << " " << stranger.label << " " << row.asked.member;
      EXPECT_FALSE(verdict.reason.empty());
    }
  }
}

TEST(Rights, WithoutTheGroupOnTheSystemNobodyIsAMember) {
  EXPECT_FALSE(may_call(of(7001, {kNone}), kNone, method("last_bu_time"), false).allowed);
  EXPECT_TRUE(may_call(kRoot, kNone, method("last_bu_time"), false).allowed);
  EXPECT_EQ(kind_of_caller(kApplication, kNone), caller_kind::application);
}

TEST(Rights, AnApplicationsUserInTheGroupMayEverything) {
  const quarn_caller both = of(kAppUid, {kAppGid, kGroup});
  EXPECT_EQ(kind_of_caller(both, kGroup), caller_kind::trusted);
}

TEST(Rights, TheCompanionEndsNoRestoreModeOfTheCloud) {
  EXPECT_EQ(who_may(method("restore_enable", "", 1, false), true), "rg");
  EXPECT_EQ(who_may(method("restore_enable", "", 1, true), true), "rgc");
}

TEST(Rights, ARefusalSaysWhy) {
  const auto reason = [](const quarn_caller &caller, const quarn_subject &asked,
                         bool mode = false) {
    return may_call(caller, kGroup, asked, mode).reason;
  };
  EXPECT_EQ(reason(of(7001), method("last_bu_time")), "it is for root and the group quarn");
  EXPECT_EQ(reason(kApplication, method("last_bu_time")), "it is for root and the group quarn");
  EXPECT_EQ(reason(kApplication, method("make_app_data", kOther)),
            "an application may ask for its own package only");
  EXPECT_EQ(reason(of(kAppUid), method("make_app_data", kOther)),
            "its security label is no package's");
  EXPECT_EQ(reason({}, method("last_bu_time")), "the bus does not tell who calls");
  EXPECT_EQ(reason(kCompanion, method("get_app_list", "", 0)),
            "the companion may ask as the companion only");
  EXPECT_EQ(reason(kCompanion, method("restore_enable", "", 1, false), true),
            "restore mode is not the companion's");
}

}  // namespace
