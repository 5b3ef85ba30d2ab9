/**
 * @file device_fixture.h
 * @brief An embedded device of one test, and waiting on the main loop.
 */
#ifndef DEVICE_FIXTURE_H
#define DEVICE_FIXTURE_H

#include <glib.h>
#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <string>

#include "run_until.h"
#include "state/facts.h"
#include "state/state_file.h"
#include "state/watch.h"
#include "temp_dir.h"

/** A device directory that is the process's device while the test runs. */
class DeviceTest : public ::testing::Test {
 protected:
  DeviceTest() {
    for (const char *folder : {"state/packages", "state/apps", "state/.tmp", "log"}) {
      dir_.dir(folder);
    }
    setenv(embedded::kDeviceVariable, dir_.path().c_str(), 1);
  }
  ~DeviceTest() override { unsetenv(embedded::kDeviceVariable); }

  const std::string &device() const { return dir_.path(); }
  void set_fact(const char *key, const std::string &value) const {
    ASSERT_TRUE(embedded::set_fact(device(), key, value));
  }
  /** The process belongs to no device from here on. */
  static void leave_device() { unsetenv(embedded::kDeviceVariable); }
  /** Nothing can be written to the device's state from here on. */
  void break_state() const { std::filesystem::remove_all(dir_ / "state"); }
  /** A state file that is there but is none. */
  void spoil(const std::string &file) const { dir_.file("state/" + file, "no key file\n"); }

  /** Wait until the main loop has told of everything that was written so far. */
  void drain() const {
    bool seen = false;
    const embedded::StateWatch last(device(), "last.ini", [&seen] { seen = true; });
    ASSERT_TRUE(embedded::write_state_text(device(), "last.ini", "[last]\n", 0644));
    ASSERT_TRUE(run_until([&seen] { return seen; }));
    // Watches are served in the order of their events, but maybe in the same round.
    run_pending();
  }

  TempDir dir_;
};

#endif
