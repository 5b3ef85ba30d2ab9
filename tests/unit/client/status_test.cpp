#include "status.h"

#include <gtest/gtest.h>

#include "glib_handles.h"
#include "json_ptr.h"
#include "json_read.h"
#include "text.h"

namespace {

using namespace quarn_client;

constexpr std::int64_t kNow = 1709208300000;
constexpr std::int64_t kHour = 3600000;

DaemonStatus read(GVariant *properties) {
  const GVariantPtr answer(g_variant_ref_sink(g_variant_new("(@a{sv})", properties)));
  return read_status(answer.get());
}

GVariant *parsed(const std::string &text) {
  return g_variant_parse(G_VARIANT_TYPE_VARDICT, text.c_str(), nullptr, nullptr, nullptr);
}

TEST(Status, MissingAndMistypedPropertiesAreNotKnown) {
  setenv("TZ", "UTC", 1);
  const std::string text =
      status_text(read(parsed("{'AutoBackup': <'yes'>, 'LastBackup': <int64 5>, "
                              "'RestoreCandidates': <'a'>, 'SerialNumber': <1>}")),
                  kNow);
  EXPECT_EQ(text,
            "device            not known\n"
            "automatic backup  not known\n"
            "charger           not known\n"
            "Wi-Fi             not known\n"
            "screen            not known\n"
            "condition alarm   not known\n"
            "next alarm        not known\n"
            "last backup       not known\n"
            "backup            not known\n"
            "restore mode      not known\n");
}

TEST(Status, EverythingIsPutIntoWords) {
  setenv("TZ", "UTC", 1);
  DaemonStatus status;
  status.auto_backup = true;
  status.charger = false;
  status.wifi = true;
  status.screen_off = true;
  status.backup_running = true;
  status.restore_mode = true;
  status.condition_alarm_ms = kNow + kHour;
  status.next_alarm_ms = kNow - kHour;
  status.last_backup_ms = kNow - 27 * kHour;
  status.restore_candidates = {"a", "b"};
  status.serial = "1\x1b[2J";
  status.model = "Orvane One";
  EXPECT_EQ(status_text(status, kNow),
            "device            Orvane One, 1\\x1b[2J\n"
            "automatic backup  on\n"
            "charger           not connected\n"
            "Wi-Fi             connected\n"
            "screen            off\n"
            "condition alarm   2024-02-29T13:05:00+00:00, in 1 h\n"
            "next alarm        2024-02-29T11:05:00+00:00, due\n"
            "last backup       2024-02-28T09:05:00+00:00, 1 d 3 h ago\n"
            "backup            running\n"
            "restore mode      on, waiting for 2 packages\n");
}

TEST(Status, NoBackupIsNeverAndNoAlarmIsNone) {
  DaemonStatus status;
  status.condition_alarm_ms = 0;
  status.last_backup_ms = 0;
  const std::string text = status_text(status, kNow);
  EXPECT_NE(text.find("condition alarm   none\n"), std::string::npos);
  EXPECT_NE(text.find("last backup       never\n"), std::string::npos);
  const JsonPtr object(json_object_new_object());
  status_to_json(status, kNow, object.get());
  EXPECT_EQ(json_text(object.get()),
            R"({"serial":"","model":"","auto_backup":null,"charger_connected":null,)"
            R"("wifi_connected":null,"screen_off":null,"condition_alarm_ms":null,)"
            R"("next_alarm_ms":null,"last_backup_ms":null,"last_backup_age_ms":null,)"
            R"("cloud_problem":null,)"
            R"("backup_running":null,"restore_mode":null,"restore_candidates":[]})");
}

TEST(Status, ABackupInTheFutureIsSaidToBeOne) {
  setenv("TZ", "UTC", 1);
  DaemonStatus status;
  status.last_backup_ms = kNow + kHour;
  EXPECT_NE(status_text(status, kNow)
                .find("last backup       2024-02-29T13:05:00+00:00, 1 h in the future\n"),
            std::string::npos);
}

TEST(Status, ADeviceWithoutASerialNumberIsItsModelAlone) {
  DaemonStatus status;
  status.model = "Orvane One";
  EXPECT_EQ(status_text(status, kNow).find("device            Orvane One\n"), 0u);
}

TEST(Status, ATimeBeyondAllTimesIsNotKnown) {
  EXPECT_FALSE(read(parsed("{'LastBackup': <uint64 18446744073709551615>}")).last_backup_ms);
}

TEST(DurationText, ShowsTheTwoLargestUnits) {
  EXPECT_EQ(duration_text(-5), "0 s");
  EXPECT_EQ(duration_text(0), "0 s");
  EXPECT_EQ(duration_text(59999), "59 s");
  EXPECT_EQ(duration_text(61000), "1 min 1 s");
  EXPECT_EQ(duration_text(3600000), "1 h");
  EXPECT_EQ(duration_text(3605000), "1 h");
  EXPECT_EQ(duration_text(90000000), "1 d 1 h");
}

}  // namespace
