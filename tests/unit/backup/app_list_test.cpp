#include <json-c/json.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <atomic>
#include <csignal>
#include <filesystem>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "backup_device.h"
#include "json_ptr.h"
#include "quarn_common.h"
#include "quarn_d_backup/app_list.h"
#include "quarn_d_backup/backup_context.h"
#include "quarn_d_backup/list_rebase.h"
#include "quarn_d_backup/model_entries.h"
#include "quarn_d_utils/file.h"

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

namespace {

const std::string kEntryA =
    R"({"backup_info":{"timestamp":1,"serial_number":"A","model_name":"Other"},)"
    R"("pkg_list":[{"pkg_id":"org.a","version":"1","crc":-5}]})";

std::string own_entry(const std::string &pkg_list) {
  return std::string(R"({"backup_info":{"timestamp":7,"serial_number":")") + kSerial +
         R"(","model_name":"As it was"},"pkg_list":)" + pkg_list + "}";
}

std::string list_of(const std::string &entries) {
  return R"({"format_ver":1,"model_list":[)" + entries + "]}";
}

class AppListDocument : public BackupDevice {
 protected:
  AppListDocument() : ctx_(new backup_context) {
    ctx_->serial_number = kSerial;
    ctx_->model_name = "Model One";
  }

  void cloud_text(const std::string &text) {
    ctx_->cloud_app_list_text.reset(strdup(text.c_str()));
  }
  bool create(const std::string &text) {
    cloud_text(text);
    return create_app_list_info(ctx_.get());
  }
  std::string saved() {
    EXPECT_TRUE(save_app_list_to_file(ctx_.get()));
    return read_text(kLocalAppListPath);
  }
  std::vector<std::string> previous() const {
    std::vector<std::string> all;
    for (const auto &p : ctx_->previous_pkg_list) {
      EXPECT_EQ(p.serial + p.root_path, "");
      all.push_back(p.pkg_id + " " + p.version + " " + std::to_string(p.crc));
    }
    return all;
  }

  BackupContextPtr ctx_;
};

TEST_F(AppListDocument, EmptyCloudGivesVersionOneAndThisDevice) {
  ASSERT_TRUE(create_app_list_info(ctx_.get()));
  EXPECT_EQ(count_logged(DLOG_INFO, "app list is made newly"), 1);
  add_pkg_info_to_app_list(ctx_.get(), "org.b", "2.0", -3);
  const AppList list(saved());
  EXPECT_EQ(json_object_get_int(json_object_object_get(list.root(), "format_ver")), 1);
  ASSERT_EQ(list.models(), 1U);
  EXPECT_EQ(list.info(0, "serial_number"), kSerial);
  EXPECT_EQ(list.info(0, "model_name"), "Model One");
  EXPECT_GT(std::stoll(list.info(0, "timestamp")), 1500000000000LL);
  EXPECT_THAT(list.packages(0), ElementsAre("org.b 2.0 -3"));
}

TEST_F(AppListDocument, KeysAreWrittenInTheOrderInWhichTheyAreAdded) {
  ASSERT_TRUE(create_app_list_info(ctx_.get()));
  add_pkg_info_to_app_list(ctx_.get(), "org.b", "2.0", 1);
  const std::string text = saved();
  std::size_t at = 0;
  for (const char *key : {"format_ver", "model_list", "backup_info", "timestamp", "serial_number",
                          "model_name", "pkg_list", "pkg_id", "version", "crc"}) {
    const std::size_t next = text.find(std::string("\"") + key + "\"");
    ASSERT_NE(next, std::string::npos) << key;
    EXPECT_GE(next, at) << key;
    at = next;
  }
  EXPECT_EQ(text.find("app_data_path"), std::string::npos);
}

TEST_F(AppListDocument, OtherDevicesEntryIsCarriedOverAndOwnPackagesAreReplaced) {
  ASSERT_TRUE(create(
      list_of(kEntryA + "," + own_entry(R"([{"pkg_id":"org.old","version":"1","crc":9}])"))));
  EXPECT_EQ(count_logged(DLOG_INFO, "app list was rebased from it of cloud"), 1);
  EXPECT_EQ(count_logged(DLOG_INFO, "app list is made newly"), 0);
  EXPECT_THAT(previous(), ElementsAre("org.old 1 9"));
  add_pkg_info_to_app_list(ctx_.get(), "org.new", "1", 4);
  const std::string text = saved();
  EXPECT_THAT(text, HasSubstr(kEntryA));
  const AppList list(text);
  ASSERT_EQ(list.models(), 2U);
  EXPECT_THAT(list.packages(1), ElementsAre("org.new 1 4"));
  EXPECT_EQ(list.info(1, "model_name"), "As it was");
  EXPECT_GT(std::stoll(list.info(1, "timestamp")), 1500000000000LL);
}

TEST_F(AppListDocument, NewDeviceGetsAnEntryBesideTheOthers) {
  ASSERT_TRUE(create(list_of(kEntryA)));
  const AppList list(saved());
  ASSERT_EQ(list.models(), 2U);
  EXPECT_EQ(list.info(0, "serial_number"), "A");
  EXPECT_EQ(list.info(1, "serial_number"), kSerial);
  EXPECT_EQ(list.info(1, "model_name"), "Model One");
  EXPECT_THAT(list.packages(1), IsEmpty());
  EXPECT_TRUE(ctx_->previous_pkg_list.empty());
}

TEST_F(AppListDocument, MembersThatAreNotKnownStay) {
  ASSERT_TRUE(
      create(R"({"later":[1,2],"format_ver":1,"model_list":[)" + kEntryA + R"(],"x":null})"));
  const std::string text = saved();
  EXPECT_THAT(text, HasSubstr(R"("later": [ 1, 2 ])"));
  EXPECT_THAT(text, HasSubstr(R"("x": null)"));
}

// Whatever another device's entry holds, its text stays as it is.
TEST_F(AppListDocument, EntriesOfAnyShapeAreCarriedOverUnchanged) {
  std::string deep = R"({"backup_info":{"serial_number":"deep"},"x":)";
  deep += std::string(100, '[') + std::string(100, ']') + "}";
  const std::vector<std::string> entries = {
      "null",
      "17",
      "\"text with \\\"]},{[ in it\"",
      "[]",
      "{}",
      R"({"backup_info":null,"pkg_list":null})",
      R"({"backup_info":[],"pkg_list":{}})",
      R"({"backup_info":{"serial_number":350000000000001},"pkg_list":[]})",
      R"({"backup_info":{"serial_number":null}})",
      R"({"backup_info":{"serial_number":"350000000000001\u0000x"}})",
      R"({"backup_info":{"serial_number":"B"},"pkg_list":[{"crc":99999999999999999999999999}]})",
      R"({"backup_info":{"serial_number":"C","serial_number":"D"},"d":1e400,"e":-0.10})",
      deep,
      R"({"backup_info":{"serial_number":"E\/F"},"pkg_list":"no list"})"};
  std::string all;
  for (const auto &entry : entries) all += entry + ", ";
  ASSERT_TRUE(create(list_of(all + own_entry("[]"))));
  EXPECT_EQ(count_logged(DLOG_INFO, "app list was rebased from it of cloud"), 1);
  add_pkg_info_to_app_list(ctx_.get(), "org.mine", "1", 1);
  const std::string text = saved();
  std::size_t at = 0;
  for (const auto &entry : entries) {
    const std::size_t found = text.find(entry, at);
    ASSERT_NE(found, std::string::npos) << entry << " in " << text;
    at = found + entry.size();
  }
  const list_text again = take_list_apart(text, kModelList);
  EXPECT_EQ(again.entries.size(), entries.size() + 1);
  EXPECT_NE(again.entries.back().find("org.mine"), std::string_view::npos);
}

TEST_F(AppListDocument, FirstOfTwoEntriesWithThisSerialIsTaken) {
  ASSERT_TRUE(create(list_of(own_entry(R"([{"pkg_id":"first","version":"1","crc":1}])") + "," +
                             own_entry(R"([{"pkg_id":"second","version":"1","crc":2}])"))));
  EXPECT_THAT(previous(), ElementsAre("first 1 1"));
  const AppList list(saved());
  ASSERT_EQ(list.models(), 2U);
  EXPECT_THAT(list.packages(0), IsEmpty());
  EXPECT_THAT(list.packages(1), ElementsAre("second 1 2"));
}

TEST_F(AppListDocument, KeyWrittenWithEscapesIsTheSameKey) {
  ASSERT_TRUE(create(R"({"format_ver":1,"model\u005flist":[)" + kEntryA + "]}"));
  EXPECT_THAT(saved(), HasSubstr(kEntryA));
}

TEST_F(AppListDocument, LastOfTwoModelListsCounts) {
  ASSERT_TRUE(create(R"({"format_ver":1,"model_list":[1],"model_list":[)" + kEntryA + "]}"));
  const AppList list(saved());
  ASSERT_EQ(list.models(), 2U);
  EXPECT_EQ(list.info(0, "serial_number"), "A");
}

TEST_F(AppListDocument, UnparsableTextIsReplacedByAFreshDocument) {
  const std::vector<std::string> texts = {"",
                                          "{",
                                          "not json",
                                          "null",
                                          list_of(kEntryA) + "x",
                                          list_of(kEntryA).substr(0, 60),
                                          R"({"format_ver":1,"model_list":[{"a":}]})",
                                          R"({"format_ver":1,"model_list":[1,]})",
                                          R"({"format_ver":1,"model_list":[[1}]})",
                                          R"({"format_ver":1,"model_list":["open]})",
                                          R"({"format_ver":1 "model_list":[1]})",
                                          "/* c */" + list_of(kEntryA)};
  for (const auto &text : texts) {
    clear_captured_log();
    ctx_.reset(new backup_context);
    ctx_->serial_number = kSerial;
    ASSERT_TRUE(create(text)) << text;
    EXPECT_EQ(count_logged(DLOG_INFO, "json token error"), 1) << text;
    EXPECT_EQ(count_logged(DLOG_INFO, "app list is made newly"), 1) << text;
    const AppList list(saved());
    EXPECT_EQ(list.models(), 1U) << text;
    EXPECT_EQ(list.info(0, "serial_number"), kSerial) << text;
  }
}

TEST_F(AppListDocument, TextThatIsNestedTooDeeplyIsNeverReplaced) {
  const std::string deep = std::string(1000, '[') + std::string(1000, ']');
  for (const auto &text : {R"({"format_ver":1,"x":)" + deep + "}", list_of(deep), deep}) {
    clear_captured_log();
    ctx_.reset(new backup_context);
    ctx_->serial_number = kSerial;
    ASSERT_TRUE(create(text));
    EXPECT_EQ(count_logged(DLOG_INFO, "json token error"), 1);
    EXPECT_EQ(ctx_->app_list_root, nullptr);
    EXPECT_FALSE(save_app_list_to_file(ctx_.get()));
    EXPECT_FALSE(exists(kLocalAppListPath));
  }
}

TEST_F(AppListDocument, TextOfMoreValuesThanMemoryIsForIsNeverReplacedNorTakenIn) {
  const auto many = [](const std::string &value) {
    std::string text = "[" + value;
    for (int i = 0; i < 300000; ++i) text += "," + value;
    return text + "]";
  };
  const std::string other = R"({"backup_info":{"serial_number":"A"},"x":)";
  const std::string own = own_entry("[]");
  const std::string member = own.substr(0, own.size() - 1) + R"(,"x":)";
  for (const std::string &text :
       {many("{}"), R"({"format_ver":1,"x":)" + many("[]") + "}", list_of(many("0")),
        R"({"format_ver":1,"model_list":)" + many("0") + "}",
        R"({"format_ver":1,"model_list":)" + many("null") + "}", list_of(other + many("{}") + "}"),
        list_of(member + many("{}") + "}"), list_of(own_entry(many("{}"))),
        list_of(own_entry("[" + many("{}") + "]"))}) {
    clear_captured_log();
    ctx_.reset(new backup_context);
    ctx_->serial_number = kSerial;
    ASSERT_TRUE(create(text));
    EXPECT_EQ(count_logged(DLOG_INFO, "json token error"), 1) << text.substr(0, 100);
    EXPECT_EQ(ctx_->app_list_root, nullptr);
    EXPECT_TRUE(ctx_->keep_cloud_list);
  }
}

TEST_F(AppListDocument, AsManyPackagesAsAListHoldsAreTakenIn) {
  std::string packages;
  for (int i = 0; i < 50000; ++i) {
    packages += (i == 0 ? "" : ",") +
                (R"({"pkg_id":"org.)" + std::to_string(i) + R"(","version":"1.0","crc":7})");
  }
  ASSERT_TRUE(create(list_of(kEntryA + "," + own_entry("[" + packages + "]"))));
  EXPECT_EQ(ctx_->previous_pkg_list.size(), 50000U);
  EXPECT_NE(saved().find(kEntryA), std::string::npos);
}

TEST_F(AppListDocument, OtherFormatVersionIsNeverReplacedAndGivesNoPreviousCrc) {
  const std::string own = own_entry(R"([{"pkg_id":"p","version":"1","crc":5}])");
  for (const char *version :
       {R"("format_ver":2,)", R"("format_ver":0,)", R"("format_ver":"1",)", R"("format_ver":null,)",
        R"("format_ver":4294967297,)", R"("format_ver":99999999999999999999999,)",
        R"("format_ver":1.5,)", R"("format_ver":[1],)", ""}) {
    clear_captured_log();
    ctx_.reset(new backup_context);
    ctx_->serial_number = kSerial;
    ASSERT_TRUE(create(std::string("{") + version + R"("model_list":[)" + own + "]}")) << version;
    EXPECT_EQ(count_logged(DLOG_INFO, "format version in json changed"), 1) << version;
    EXPECT_EQ(ctx_->app_list_root, nullptr) << version;
    EXPECT_TRUE(ctx_->previous_pkg_list.empty()) << version;
    add_pkg_info_to_app_list(ctx_.get(), "org.b", "1", 1);
    EXPECT_FALSE(save_app_list_to_file(ctx_.get())) << version;
    EXPECT_FALSE(exists(kLocalAppListPath)) << version;
  }
}

TEST_F(AppListDocument, JsonThatIsNoListOfAnyFormatIsReplaced) {
  for (const char *text : {"{}", "[]", "5", "\"text\"", R"({"other":1})"}) {
    clear_captured_log();
    ctx_.reset(new backup_context);
    ctx_->serial_number = kSerial;
    ASSERT_TRUE(create(text)) << text;
    EXPECT_EQ(count_logged(DLOG_INFO, "format version in json changed"), 1) << text;
    EXPECT_EQ(AppList(saved()).models(), 1U) << text;
  }
}

TEST_F(AppListDocument, ListWithoutModelsIsReplaced) {
  for (const char *text :
       {R"({"format_ver":1})", R"({"format_ver":1,"model_list":[]})",
        R"({"format_ver":1,"model_list":null})", R"({"format_ver":1,"model_list":{}})",
        R"({"format_ver":1,"model_list":"no"})"}) {
    clear_captured_log();
    ctx_.reset(new backup_context);
    ctx_->serial_number = kSerial;
    ASSERT_TRUE(create(text)) << text;
    EXPECT_EQ(count_logged(DLOG_INFO, "model list is not in json"), 1) << text;
    EXPECT_EQ(AppList(saved()).models(), 1U) << text;
  }
}

TEST_F(AppListDocument, PreviousListThatIsMissingOrOfAnotherTypeIsNone) {
  for (const char *pkg_list : {"[]", "{}", "null", "3", "\"x\""}) {
    clear_captured_log();
    ctx_.reset(new backup_context);
    ctx_->serial_number = kSerial;
    ASSERT_TRUE(create(list_of(own_entry(pkg_list))));
    EXPECT_EQ(count_logged(DLOG_INFO, "get_previous_package_list_info"), 1);
    EXPECT_EQ(count_logged(DLOG_INFO, "no previous package list in old app list"), 1) << pkg_list;
    EXPECT_TRUE(ctx_->previous_pkg_list.empty());
    EXPECT_EQ(AppList(saved()).models(), 1U);
  }
}

TEST_F(AppListDocument, PreviousEntriesThatAreNotUnderstoodAreLeftOut) {
  ASSERT_TRUE(create(list_of(own_entry(
      R"([null,1,"x",[],{},{"pkg_id":"a"},{"version":"1"},{"pkg_id":1,"version":"1"},)"
      R"({"pkg_id":"a","version":null},{"pkg_id":"../a","version":"1"},)"
      R"({"pkg_id":"a","version":".."},{"pkg_id":"a/b","version":"1"},{"pkg_id":"","version":"1"},)"
      R"({"pkg_id":"a\u0000b","version":"1"},{"pkg_id":"kept","version":"1","crc":-7},)"
      R"({"pkg_id":"absent","version":"1"},{"pkg_id":"text","version":"1","crc":"12"},)"
      R"({"pkg_id":"huge","version":"1","crc":99999999999999999999},)"
      R"({"pkg_id":"over","version":"1","crc":2147483648},)"
      R"({"pkg_id":"under","version":"1","crc":-2147483649},)"
      R"({"pkg_id":"max","version":"1","crc":2147483647},{"pkg_id":"null","version":"1","crc":null}])"))));
  EXPECT_THAT(previous(), ElementsAre("kept 1 -7", "absent 1 0", "text 1 0", "huge 1 0", "over 1 0",
                                      "under 1 0", "max 1 2147483647", "null 1 0"));
  EXPECT_EQ(count_logged(DLOG_ERROR, "refused entry 0 of previous package list"), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "refused entry 13 of previous package list"), 1);
}

TEST_F(AppListDocument, AnyNumberOfEntriesThatAreNotUnderstoodIsAHundredLinesAndOne) {
  std::string packages = "0";
  for (int i = 0; i < 100000; ++i) packages += ",0";
  ASSERT_TRUE(create(list_of(own_entry("[" + packages + "]"))));
  EXPECT_EQ(count_logged(DLOG_ERROR, "refused entry 99 of previous package list"), 1);
  EXPECT_EQ(count_logged(DLOG_ERROR, "refused entry 100 of previous package list"), 0);
  EXPECT_EQ(
      count_logged(DLOG_WARN, "99901 more such lines on the previous package list are left out"),
      1);
}

// Damaged texts of every kind: what is written afterwards is JSON, and whoever
// could still be read is still there.
TEST_F(AppListDocument, DamagedTextsNeverGiveADamagedDocument) {
  const std::string whole =
      list_of(kEntryA + R"(,{"backup_info":{"serial_number":"B"},"x":[1e5,-0,"\u00e9\\"]},)" +
              own_entry(R"([{"pkg_id":"p","version":"1","crc":12}])"));
  const std::string alphabet = "{}[]\",:\\0123456789.-eEtrufalsn \n/\x01\xff";
  std::minstd_rand random(20);
  const auto below = [&](std::size_t limit) { return random() % limit; };
  for (int round = 0; round < 4000; ++round) {
    std::string text = whole;
    for (std::size_t change = 0; change <= below(3); ++change) {
      const std::size_t at = below(text.size());
      switch (below(4)) {
        case 0:
          text[at] = alphabet[below(alphabet.size())];
          break;
        case 1:
          text.insert(at, 1, alphabet[below(alphabet.size())]);
          break;
        case 2:
          text.erase(at, 1 + below(20));
          break;
        default:
          text.insert(at, text.substr(below(text.size()), below(40)));
      }
      if (text.empty()) text = "x";
    }
    ctx_.reset(new backup_context);
    ctx_->serial_number = kSerial;
    ASSERT_TRUE(create(text)) << text;
    if (ctx_->app_list_root == nullptr) continue;
    const std::string written = json_object_get_string(ctx_->app_list_root.get());
    const JsonPtr again(parse_whole_json(written, 300, nullptr));
    ASSERT_NE(again, nullptr) << text << " became " << written;
    if (count_logged(DLOG_INFO, "app list is made newly") == 0 &&
        text.find(kEntryA) != std::string::npos) {
      EXPECT_THAT(written, HasSubstr(kEntryA)) << text;
    }
    clear_captured_log();
  }
}

TEST_F(AppListDocument, SavedFileAndItsDirectoryAreForRootAlone) {
  ASSERT_TRUE(create_app_list_info(ctx_.get()));
  saved();
  struct stat status = {};
  ASSERT_EQ(stat(kLocalAppListPath, &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600U);
  ASSERT_EQ(stat("/tmp/quarn", &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0700U);
  EXPECT_EQ(ctx_->app_list_root, nullptr);
  EXPECT_TRUE(ctx_->json_objects.empty());
}

TEST_F(AppListDocument, OpenStagingDirectoryOfOursIsClosed) {
  std::filesystem::create_directory("/tmp/quarn");
  ASSERT_EQ(chmod("/tmp/quarn", 0777), 0);
  ASSERT_TRUE(create_app_list_info(ctx_.get()));
  saved();
  struct stat status = {};
  ASSERT_EQ(stat("/tmp/quarn", &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0700U);
}

/** What may lie where the staging directory is to be. */
class StagingSquat : public AppListDocument, public ::testing::WithParamInterface<const char *> {
 protected:
  static constexpr uid_t kOther = 5000;
  static constexpr char kPlace[] = "/tmp/quarn";
  StagingSquat() {
    const std::string kind = GetParam();
    std::filesystem::create_directory(path("elsewhere"));
    if (kind == "file") {
      write_text(kPlace, "another's");
      EXPECT_EQ(chmod(kPlace, 0666), 0);
    } else if (kind == "directory") {
      std::filesystem::create_directory(kPlace);
      write_text(std::string(kPlace) + "/app_list.txt", "another's");
    } else if (kind == "link") {
      std::filesystem::create_symlink(path("elsewhere"), kPlace);
    } else if (kind == "pipe") {
      EXPECT_EQ(mkfifo(kPlace, 0666), 0);
    } else {
      const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
      sockaddr_un address = {AF_UNIX, "/tmp/quarn"};
      EXPECT_EQ(bind(fd, reinterpret_cast<sockaddr *>(&address), sizeof address), 0);
      close(fd);
    }
    EXPECT_EQ(lchown(kPlace, kOther, kOther), 0);
    EXPECT_EQ(lstat(kPlace, &squat_), 0);
  }
  ~StagingSquat() override {
    for (const std::string &aside : set_aside()) std::filesystem::remove_all(aside);
  }
  std::vector<std::string> set_aside() const {
    std::vector<std::string> found;
    for (const auto &entry : std::filesystem::directory_iterator("/tmp")) {
      struct stat status = {};
      if (entry.path().filename().string().rfind("quarn.aside.", 0) == 0 &&
          lstat(entry.path().c_str(), &status) == 0 && status.st_ino == squat_.st_ino) {
        found.push_back(entry.path().string());
      }
    }
    return found;
  }
  struct stat squat_ = {};
};

TEST_P(StagingSquat, IsSetAsideAsItIs) {
  ASSERT_TRUE(create_app_list_info(ctx_.get()));
  saved();
  struct stat status = {};
  ASSERT_EQ(lstat(kPlace, &status), 0);
  EXPECT_TRUE(S_ISDIR(status.st_mode));
  EXPECT_EQ(status.st_uid, 0U);
  EXPECT_EQ(status.st_mode & 07777, 0700U);
  EXPECT_TRUE(std::filesystem::is_empty(path("elsewhere"))) << "it is not followed";
  const std::vector<std::string> aside = set_aside();
  ASSERT_EQ(aside.size(), 1U);
  ASSERT_EQ(lstat(aside[0].c_str(), &status), 0);
  EXPECT_EQ(status.st_uid, kOther);
  EXPECT_EQ(status.st_mode, squat_.st_mode);
  EXPECT_EQ(count_logged(DLOG_WARN, "quarn is not the daemon's and was set aside as " +
                                        aside[0].substr(sizeof "/tmp")),
            1);
}

TEST_P(StagingSquat, ThatComesBackAgainAndAgainStopsNothing) {
  std::atomic<bool> stop{false};
  std::thread squatter([&] {
    while (!stop) {
      if (mkdir(kPlace, 0777) == 0 && lchown(kPlace, kOther, kOther) != 0) return;
    }
  });
  int had = 0;
  for (int i = 0; i < 300; ++i) {
    had += prepare_staging_directory();
    rmdir(kPlace);
  }
  stop = true;
  squatter.join();
  EXPECT_EQ(had, 300);
  std::filesystem::remove_all(kPlace);
  for (const auto &entry : std::filesystem::directory_iterator("/tmp")) {
    const bool aside = entry.path().filename().string().rfind("quarn.aside.", 0) == 0;
    if (aside && entry.is_directory()) rmdir(entry.path().c_str());
  }
}

INSTANTIATE_TEST_SUITE_P(Things, StagingSquat,
                         ::testing::Values("file", "directory", "link", "pipe", "socket"),
                         [](const auto &info) { return std::string(info.param); });

TEST_F(AppListDocument, WhatOthersPutIntoTheStagingDirectoryWhileItWasOpenIsRemoved) {
  std::filesystem::create_directory("/tmp/quarn");
  ASSERT_EQ(chmod("/tmp/quarn", 0777), 0);
  std::filesystem::create_directories("/tmp/quarn/app_list.txt/in the way");
  ASSERT_EQ(chown("/tmp/quarn/app_list.txt", 5000, 5000), 0);
  const std::string secret = "/tmp/quarn_backup_test.secret";
  write_text(secret, "untouched");
  ASSERT_EQ(link(secret.c_str(), "/tmp/quarn/lock"), 0);
  write_text("/tmp/quarn/ours", "stays");
  ASSERT_TRUE(create_app_list_info(ctx_.get()));
  saved();
  EXPECT_FALSE(exists("/tmp/quarn/lock"));
  EXPECT_EQ(read_text(secret), "untouched");
  EXPECT_EQ(read_text("/tmp/quarn/ours"), "stays");
  std::filesystem::remove(secret);
}

TEST_F(AppListDocument, FileThatCannotBeWrittenIsNoList) {
  ASSERT_TRUE(create_app_list_info(ctx_.get()));
  std::filesystem::create_directories(std::string(kLocalAppListPath) + "/in the way");
  EXPECT_FALSE(save_app_list_to_file(ctx_.get()));
  EXPECT_EQ(
      count_logged(DLOG_ERROR, std::string("cannot create app list file ") + kLocalAppListPath), 1);
  EXPECT_EQ(ctx_->app_list_root, nullptr);
}

TEST_F(AppListDocument, HalfWrittenListIsDeleted) {
  ASSERT_TRUE(create_app_list_info(ctx_.get()));
  for (int i = 0; i < 2000; ++i) add_pkg_info_to_app_list(ctx_.get(), "org.example.app", "1", i);
  const auto handler = std::signal(SIGXFSZ, SIG_IGN);
  struct rlimit before = {};
  getrlimit(RLIMIT_FSIZE, &before);
  const struct rlimit little = {4096, before.rlim_max};
  setrlimit(RLIMIT_FSIZE, &little);
  const bool saved = save_app_list_to_file(ctx_.get());
  setrlimit(RLIMIT_FSIZE, &before);
  std::signal(SIGXFSZ, handler);
  EXPECT_FALSE(saved);
  EXPECT_FALSE(exists(kLocalAppListPath));
}

TEST_F(AppListDocument, GeneratedObjectsAreRecorded) {
  json_object *object = generate_new_json_object(ctx_.get());
  json_object *array = generate_new_json_array(ctx_.get());
  json_object *parsed = generate_new_json_tokener_parser(ctx_.get(), "{\"a\":[1]}");
  EXPECT_EQ(generate_new_json_tokener_parser(ctx_.get(), "{\"a\":"), nullptr);
  EXPECT_THAT(ctx_->json_objects, ElementsAre(object, array, parsed));
  EXPECT_EQ(json_object_get_type(object), json_type_object);
  EXPECT_EQ(json_object_get_type(array), json_type_array);
  json_object_put(object);
  json_object_put(array);
  json_object_put(parsed);
  ctx_->json_objects.clear();
}

TEST_F(AppListDocument, CompanionsDocumentIsAlwaysFreshAndHasArchivePaths) {
  ctx_->for_pellix = true;
  ASSERT_TRUE(create(list_of(kEntryA)));
  EXPECT_EQ(count_logged(DLOG_INFO, "app list is made newly"), 1);
  ASSERT_NE(ctx_->app_data_path, nullptr);
  const AppList list(json_object_get_string(ctx_->app_list_root.get()));
  ASSERT_EQ(list.models(), 1U);
  EXPECT_EQ(json_object_get_type(json_object_object_get(list.model(0), "app_data_path")),
            json_type_array);
}

}  // namespace
