/**
 * @file backup_device.h
 * @brief A device and a cloud to run backups on, inside the test's process.
 */
#ifndef BACKUP_DEVICE_H
#define BACKUP_DEVICE_H

#include <gtest/gtest.h>
#include <json-c/json.h>

#include <atomic>
#include <deque>
#include <functional>
#include <list>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "log_capture.h"
#include "mock_platform.h"
#include "mock_transport.h"
#include "quarn_common.h"
#include "quarn_d_backup/backup_progress.h"
#include "quarn_d_backup/quarn_d_backup.h"
#include "quarn_dbus_client.h"
#include "temp_dir.h"

inline constexpr char kSerial[] = "350000000000001";
inline constexpr char kAppListInCloud[] = "/app_list/app_list.txt";

/** One application component. */
struct FakeApp {
  std::string id;
  bool disabled = false;
};

/** One installed package, with real directories. */
struct FakePackage {
  std::string id;
  std::string version;
  std::string type;
  std::string root;
  std::vector<FakeApp> apps;
  bool preload = false;
  bool external = false;
  // results of the calls about it; a negative one is a failure
  int preload_result = 0;
  int id_result = 0;
  int version_result = 0;
  int type_result = 0;
  int root_result = 0;
  bool null_id = false;
  bool null_version = false;
  bool null_type = false;
  bool null_root = false;
  std::deque<int> walk_results; /**< of the walks over its applications, in turn; then 0 */

  std::string staged() const { return root + "/shared/data/" + id + "_upload.zip"; }
  std::string folder() const { return std::string("/") + kSerial + "/" + id; }
  std::string object() const { return folder() + "/" + version + "/" + id + ".zip"; }
};

/** What the transport was asked for. */
enum class Op { download, upload, list, remove };

/**
 * A store in memory. Requests are answered when the test says so, in their
 * order; see answer_next().
 */
class FakeCloud {
 public:
  FakeCloud();

  ::testing::NiceMock<MockTransport> transport;
  std::map<std::string, std::string> objects;
  /** Non-zero refuses the request. */
  std::function<int(Op, const std::string &)> refuse;
  /** Non-zero is answered in place of doing it. */
  std::function<int(Op, const std::string &)> fail;
  /** Children per listing answer. */
  int page = BACKUP_TRANS_MAX_LIST_COUNT;
  int cancels = 0;
  /** A cancel ends what waits then with the transport's error; its answer comes in its turn. */
  bool aborts = false;
  /** Downloads are answered with success, but there is no file. */
  bool lose_downloads = false;
  std::vector<int> download_options;
  std::string last_upload_local;
  std::string last_download_local;

  /** Answer the oldest request. @return false when there is none */
  bool answer_next();
  void answer_all();
  std::size_t waiting();
  /** "upload /a/b.zip" and so on, in order. */
  std::vector<std::string> requests();
  int count_requests(const std::string &request);
  std::vector<std::string> paths();

 private:
  bool accept(Op op, const std::string &path, int *result);
  int outcome(Op op, const std::string &path);
  void answer_later(std::function<void()> answer);
  std::vector<backup_trans_file_info_s> children(const std::string &folder,
                                                 std::list<std::string> *paths);

  std::recursive_mutex mutex_;
  std::deque<std::function<void()>> answers_;
  std::size_t aborted_ = 0; /**< of them, from the front */
  bool aborting_ = false;
  std::vector<std::string> requests_;
};

/** A status that a client was sent. */
struct SentStatus {
  int err;
  int status;
  std::uint32_t req_id;
  bool operator==(const SentStatus &other) const {
    return err == other.err && status == other.status && req_id == other.req_id;
  }
};
std::ostream &operator<<(std::ostream &stream, const SentStatus &status);

/** What the worker has waited for clients that do not answer, microseconds. */
extern std::atomic<std::int64_t> time_waited_for_clients;

/** Every status since the last clear. */
std::vector<SentStatus> sent_statuses();
void clear_sent_statuses();
/** Called before each status is recorded; on the sender's thread. */
void set_status_hook(std::function<void(int err, int status)> hook);
client_cb_data *new_client(std::uint32_t req_id, const std::string &sender = ":1.7");

/** Whether the device is on Wi-Fi. */
extern std::atomic<int> fake_wifi;
/** Asked in its place until the next test; on the asking thread. */
void set_wifi_hook(int (*hook)());

/** Fixture: packages, cloud, Wi-Fi, no log and no clients. */
class BackupDevice : public ::testing::Test {
 protected:
  BackupDevice();
  ~BackupDevice() override;

  /** Install a package with one application and one file of data. */
  FakePackage &install(const std::string &id, const std::string &version = "1.0.0",
                       const std::string &content = "private");
  FakePackage &package(const std::string &id);
  void remove(const std::string &id);
  std::string path(const std::string &name) const { return directory_ / name; }

  ::testing::NiceMock<MockPlatform> platform_;
  FakeCloud cloud_;
  std::list<FakePackage> packages_;
  int package_walk_result_ = 0;
  /** What the package manager says of one that is not installed. */
  int unknown_package_result_ = PACKAGE_MANAGER_ERROR_NO_SUCH_PACKAGE;
  std::map<std::string, double> settings_;
  bool settings_work_ = true;

 private:
  void script_packages();
  const TempDir directory_{quick_directory()};
};

/** A file of exactly @p size bytes that takes no space. */
void write_sparse(const std::string &path, std::uint64_t size);

/** The application list in a text; released with the test. */
class AppList {
 public:
  explicit AppList(const std::string &text);
  ~AppList() { json_object_put(root_); }
  AppList(const AppList &) = delete;
  AppList &operator=(const AppList &) = delete;

  json_object *root() const { return root_; }
  std::size_t models() const;
  json_object *model(std::size_t index) const;
  /** "id version crc" of a device's packages. */
  std::vector<std::string> packages(std::size_t index) const;
  std::vector<std::string> package_ids(std::size_t index) const;
  std::string info(std::size_t index, const char *key) const;

 private:
  json_object *root_;
};

#endif
