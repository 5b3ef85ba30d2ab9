// Standard error is the journal's stream for the whole process, as under a service manager.
#include <sys/stat.h>
#include <unistd.h>

#include "device_fixture.h"
#include "platform_log.h"

namespace {

class Journal : public DeviceTest {
 protected:
  void SetUp() override {
    struct stat status {};
    ASSERT_EQ(fstat(STDERR_FILENO, &status), 0);
    setenv("JOURNAL_STREAM",
           (std::to_string(status.st_dev) + ":" + std::to_string(status.st_ino)).c_str(), 1);
    setenv("FAKE_JOURNAL", (dir_ / "journal").c_str(), 1);
  }
  void TearDown() override { unsetenv("FAKE_JOURNAL"); }
  std::string journal() const { return read_text(dir_ / "journal"); }
};

TEST_F(Journal, HasTheMessageAndItsPlaceInFieldsOfTheirOwn) {
  dlog_print(LOG_ID_MAIN, DLOG_WARN, "QUARND", "%s: %s(%d) > a > b(%d)", "file.cpp", "work", 12, 3);
  EXPECT_EQ(journal(),
            "MESSAGE=a > b(3)\nPRIORITY=4\nSYSLOG_IDENTIFIER=QUARND\nCODE_FILE=file.cpp\n"
            "CODE_FUNC=work\nCODE_LINE=12\n");
  EXPECT_FALSE(std::filesystem::exists(dir_ / "log/quarnd.log"));
}

TEST_F(Journal, HasNoPlaceForAMessageWithoutOne) {
  dlog_print(LOG_ID_MAIN, DLOG_ERROR, "QUARND", "plain");
  EXPECT_EQ(journal(), "MESSAGE=plain\nPRIORITY=3\nSYSLOG_IDENTIFIER=QUARND\n");
}

TEST_F(Journal, HasTheSeverityInItsOwnNumbers) {
  dlog_print(LOG_ID_MAIN, DLOG_DEBUG, "QUARND", "x");
  dlog_print(LOG_ID_MAIN, DLOG_INFO, "QUARND", "x");
  EXPECT_NE(journal().find("PRIORITY=7\n"), std::string::npos);
  EXPECT_NE(journal().find("PRIORITY=6\n"), std::string::npos);
}

TEST_F(Journal, ThatTakesNothingIsReplacedByTheLogFile) {
  unsetenv("FAKE_JOURNAL");
  dlog_print(LOG_ID_MAIN, DLOG_INFO, "QUARND", "kept");
  EXPECT_NE(read_text(dir_ / "log/quarnd.log").find("kept\n"), std::string::npos);
}

}  // namespace
