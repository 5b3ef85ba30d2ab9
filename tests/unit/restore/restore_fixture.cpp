#include "restore_fixture.h"

#include <fcntl.h>
#include <linux/capability.h>
#include <linux/securebits.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <sys/xattr.h>
#include <unistd.h>
#include <zip.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <csignal>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <set>
#include <sstream>

#include "quarn_common.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_restore/restore_files.h"
#include "quarn_d_restore/restore_step.h"
#include "quarn_d_utils/admission.h"
#include "quarn_d_utils/unpacked_file.h"
#include "quarn_dbus_client.h"

using ::testing::_;

Outside outside;

/* What the engine calls outside of itself. */

GDBusConnection *quarn_dbus_connection = nullptr;

namespace {

constexpr char kSecurityAttribute[] = "security.SMACK64";
constexpr char kUserAttribute[] = "user.quarn.SMACK64";
constexpr mode_t kPermissionBits = 07777;

int answer_client(const char *method, int err, const char *msg, void *record, bool last) {
  auto *client = static_cast<client_cb_data *>(record);
  if (client == nullptr) return QUARN_FAILED;
  outside.answers.push_back({method, err, msg, client->req_id});
  if (last) delete client;
  return QUARN_OK;
}

/** Where labels can be kept here: user attributes where security ones are not permitted. */
const char *label_attribute(const std::string &directory) {
  static const char *name = nullptr;
  if (name == nullptr) {
    const std::string probe = directory + "/probe";
    write_text(probe, "");
    name = setxattr(probe.c_str(), kSecurityAttribute, "x", 1, 0) == 0 ? kSecurityAttribute
                                                                       : kUserAttribute;
    unlink(probe.c_str());
  }
  return name;
}

int get_label(const char *path, char **label, bool follow) {
  char text[SMACK_LABEL_LEN + 1] = {};
  const ssize_t length = follow ? getxattr(path, label_attribute(""), text, SMACK_LABEL_LEN)
                                : lgetxattr(path, label_attribute(""), text, SMACK_LABEL_LEN);
  if (length < 0 && errno != ENODATA && errno != EOPNOTSUPP) return -1;
  *label = strdup(length <= 0 ? kFloorLabel : text);
  return 0;
}

int put_label(const char *path, const char *label, bool follow) {
  const std::size_t size = std::strlen(label);
  return follow ? setxattr(path, label_attribute(""), label, size, 0)
                : lsetxattr(path, label_attribute(""), label, size, 0);
}

/** Label everything below a directory, as the service does: by what it has opened. */
void relabel_below(UniqueFd fd, const std::string &label) {
  const DirPtr dir(fdopendir(fd.get()));
  if (dir == nullptr) return;
  static_cast<void>(fd.release());
  while (const dirent *entry = readdir(dir.get())) {
    const std::string name = entry->d_name;
    if (name == "." || name == ".." || name == "quarn_tmp_rst_dir") continue;
    UniqueFd object(openat(dirfd(dir.get()), name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK));
    struct stat status = {};
    if (!object || fstat(object.get(), &status) != 0) continue;
    // the service labels nothing by a second name
    if (!S_ISDIR(status.st_mode) && status.st_uid != kAppUid) continue;
    put_label(("/proc/self/fd/" + std::to_string(object.get())).c_str(), label.c_str(), true);
    if (S_ISDIR(status.st_mode)) relabel_below(std::move(object), label);
  }
}

std::vector<AtStep *> awaited_steps;
AtNthStep *awaited_number = nullptr;

void on_step(const char *step) {
  const auto awaited = awaited_steps;
  for (AtStep *one : awaited) one->reached(step);
  if (awaited_number != nullptr) awaited_number->reached(step);
}

char a_transaction[1];

std::string parent_of(const std::string &name) {
  const auto slash = name.rfind('/');
  return slash == std::string::npos ? "" : name.substr(0, slash);
}

void add_to_archive(zipFile zip, const std::string &name, const std::string &content) {
  ASSERT_EQ(zipOpenNewFileInZip(zip, name.c_str(), nullptr, nullptr, 0, nullptr, 0, nullptr,
                                Z_DEFLATED, 1),
            ZIP_OK);
  ASSERT_EQ(zipWriteInFileInZip(zip, content.data(), static_cast<unsigned>(content.size())),
            ZIP_OK);
  ASSERT_EQ(zipCloseFileInZip(zip), ZIP_OK);
}

}  // namespace

void quarn_dbus_accept_request(quarn_request, const std::string &, const client_cb_data *) {}
std::int64_t quarn_dbus_time_waited() { return 0; }
int quarn_dbus_restore_enable_cb(int err, const char *msg, void *record) {
  return answer_client("restore_enable_cb", err, msg, record,
                       std::strcmp(msg, "restore_stop") == 0);
}
int quarn_dbus_get_app_list_cb(int err, const char *msg, void *record) {
  return answer_client("get_app_list_cb", err, msg, record, true);
}
int quarn_dbus_manual_backup_status(int err, int status, void *record) {
  return answer_client("manual_backup_status", err, std::to_string(status).c_str(), record,
                       status != QUARN_BACKUP_RUNNING);
}
int quarn_dbus_manual_backup_cancel_result(int err, void *record) {
  return answer_client("manual_backup_cancel_result", err, "", record, true);
}
int quarn_dbus_app_backup_complete(int err, const char *msg, void *record) {
  return answer_client("app_data_backup_complete", err, msg, record, true);
}
int quarn_dbus_app_restore_complete(int err, const char *msg, void *record) {
  return answer_client("app_data_restore_complete", err, msg, record, true);
}
void request_quarn_terminate(double delay, bool restart) {
  outside.terminations.emplace_back(delay, restart);
}

void *make_record(unsigned int req_id, const std::string &sender) {
  return new client_cb_data{req_id, sender, count_waiting(sender)};
}
std::unique_ptr<client_cb_data> owned_record(unsigned int req_id) {
  return std::unique_ptr<client_cb_data>(static_cast<client_cb_data *>(make_record(req_id)));
}

std::string label_of(const std::string &path) {
  char *label = nullptr;
  if (get_label(path.c_str(), &label, false) != 0) return "?";
  const CString owner(label);
  return label;
}

void set_label(const std::string &path, const std::string &label) {
  ASSERT_EQ(put_label(path.c_str(), label.c_str(), false), 0) << path << strerror(errno);
}

Tree tree_of(const std::string &root) {
  Tree tree;
  for (const auto &item : std::filesystem::recursive_directory_iterator(root)) {
    const std::string path = item.path();
    struct stat status = {};
    if (lstat(path.c_str(), &status) != 0) continue;
    std::ostringstream text;
    text << std::oct << status.st_mode << std::dec << " " << status.st_uid << ":" << status.st_gid
         << " " << label_of(path) << " ";
    if (S_ISREG(status.st_mode)) text << read_text(path);
    if (S_ISLNK(status.st_mode)) text << std::filesystem::read_symlink(path);
    tree[path.substr(root.size() + 1)] = text.str();
  }
  return tree;
}

void expect_error(const std::string &text, int count) {
  EXPECT_EQ(count_logged(DLOG_ERROR, text), count) << text;
}
void expect_info(const std::string &text, int count) {
  EXPECT_EQ(count_logged(DLOG_INFO, text), count) << text;
}

AtStep::AtStep(std::string step, std::function<void()> action, int nth)
    : step_(std::move(step)), action_(std::move(action)), countdown_(nth) {
  awaited_steps.push_back(this);
  restore_step_hook = on_step;
}

AtStep::~AtStep() {
  awaited_steps.erase(std::find(awaited_steps.begin(), awaited_steps.end(), this));
  if (awaited_steps.empty() && awaited_number == nullptr) restore_step_hook = nullptr;
}

void AtStep::reached(const std::string &step) {
  if (step == step_ && --countdown_ == 0) action_();
}

AtNthStep::AtNthStep(int nth, std::function<void(const std::string &step)> action)
    : countdown_(nth), action_(std::move(action)) {
  EXPECT_EQ(awaited_number, nullptr);
  awaited_number = this;
  restore_step_hook = on_step;
}

AtNthStep::~AtNthStep() {
  awaited_number = nullptr;
  if (awaited_steps.empty()) restore_step_hook = nullptr;
}

void AtNthStep::reached(const std::string &step) {
  if (--countdown_ == 0) action_(step);
}

bool is_killed_in(const std::function<void()> &work) {
  const pid_t child = fork();
  if (child == 0) {
    work();
    _exit(0);
  }
  int status = 0;
  EXPECT_EQ(waitpid(child, &status, 0), child);
  EXPECT_FALSE(WIFEXITED(status) && WEXITSTATUS(status) != 0);
  return WIFSIGNALED(status) && WTERMSIG(status) == SIGKILL;
}

const std::vector<Entry> &new_app_data() {
  static const std::vector<Entry> entries = {
      {"data/settings.ini", "new settings", 0600},
      {"data/db/notes.db", "new notes", 0640, "wrt::db_origin"},
      {"data/added/deep/file", "added"},
      {"shared/data/pictures/one.jpg", "n", 0644},
      {"shared/trusted/key.bin", "new key", 0444}};
  return entries;
}

WithoutCapabilities::WithoutCapabilities(std::initializer_list<int> capabilities) {
  __user_cap_header_struct header = {_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct data[2] = {};
  EXPECT_EQ(syscall(SYS_capget, &header, data), 0);
  for (int i = 0; i < 2; ++i) effective_[i] = data[i].effective;
  // else a change of the thread's identity would give them back
  securebits_ = prctl(PR_GET_SECUREBITS);
  EXPECT_EQ(prctl(PR_SET_SECUREBITS, securebits_ | SECBIT_NO_SETUID_FIXUP), 0);
  for (const int capability : capabilities) {
    data[capability / 32].effective &= ~(1U << (capability % 32));
  }
  EXPECT_EQ(syscall(SYS_capset, &header, data), 0);
}

WithoutCapabilities::~WithoutCapabilities() {
  __user_cap_header_struct header = {_LINUX_CAPABILITY_VERSION_3, 0};
  __user_cap_data_struct data[2] = {};
  EXPECT_EQ(syscall(SYS_capget, &header, data), 0);
  for (int i = 0; i < 2; ++i) data[i].effective = effective_[i];
  EXPECT_EQ(syscall(SYS_capset, &header, data), 0);
  EXPECT_EQ(prctl(PR_SET_SECUREBITS, securebits_), 0);
}

DiskFullAfter::DiskFullAfter(unsigned long bytes) {
  signal(SIGXFSZ, SIG_IGN);
  const rlimit limit = {bytes, RLIM_INFINITY};
  EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
}

DiskFullAfter::~DiskFullAfter() {
  const rlimit limit = {RLIM_INFINITY, RLIM_INFINITY};
  EXPECT_EQ(setrlimit(RLIMIT_FSIZE, &limit), 0);
}

RestoreTest::RestoreTest() {
  label_attribute(base);
  root = base + "/opt/usr/apps/" + kPkg;
  dir("data");
  dir("shared/data");
  dir("shared/trusted");
  outside = Outside{};
  clear_captured_log();
  pkg_list_to_be_restored.clear();
  current_restore_client = QUARN_CLIENT_CLOUD;
  serial_num_user_select = kSerial;

  ON_CALL(platform, smack_getlabel).WillByDefault([](const char *path, char **label, auto) {
    return get_label(path, label, true);
  });
  ON_CALL(platform, smack_lgetlabel).WillByDefault([](const char *path, char **label, auto) {
    return get_label(path, label, false);
  });
  ON_CALL(platform, smack_setlabel).WillByDefault([](const char *path, const char *label, auto) {
    return put_label(path, label, true);
  });
  ON_CALL(platform, smack_lsetlabel).WillByDefault([](const char *path, const char *label, auto) {
    return put_label(path, label, false);
  });
  ON_CALL(platform, security_server_label_access)
      .WillByDefault([this](const char *path, const char *label) {
        if (label_result != 0) return label_result;
        relabelled.push_back(std::filesystem::read_symlink(path));
        return put_label(path, label, true);
      });
  ON_CALL(platform, security_server_perm_begin).WillByDefault([this](auto *handle) {
    if (begin_result != 0) return begin_result;
    *handle = reinterpret_cast<security_server_perm_h>(a_transaction);
    ++transactions;
    to_relabel.clear();
    return 0;
  });
  ON_CALL(platform, security_server_perm_app_setup_path)
      .WillByDefault([this](auto, const char *, const char *path, int, const char *label) {
        if (setup_result == 0) to_relabel.emplace_back(path, label);
        return setup_result;
      });
  ON_CALL(platform, security_server_perm_commit).WillByDefault([this](auto) {
    --transactions;
    if (commit_result != 0) return commit_result;
    for (const auto &[path, label] : to_relabel) {
      relabel_below(UniqueFd(open(path.c_str(), O_RDONLY | O_DIRECTORY)), label);
    }
    return 0;
  });
  ON_CALL(platform, security_server_perm_abort).WillByDefault([this](auto handle) {
    if (handle != nullptr) --transactions;
  });
  ON_CALL(transport, backup_trans_download_file_ors_async)
      .WillByDefault([this](auto, const char *remote, const char *local, void *data,
                            backup_trans_download_cb callback, int) {
        if (transport_result == 0) downloads.push_back({remote, local, data, callback});
        return transport_result;
      });
}

RestoreTest::~RestoreTest() {
  set_restore_progress_sink(nullptr);
  while (!downloads.empty()) answer(BACKUP_TRANS_ERROR_CANCELLED);
  end_restore_report();
  run_pending();
  EXPECT_EQ(transactions, 0) << "a transaction was left open";
}

std::string RestoreTest::file(const std::string &name, const std::string &content, int mode,
                              const std::string &label) {
  const std::string path = at(name);
  write_text(path, content);
  set_label(path, label);
  EXPECT_EQ(chown(path.c_str(), kAppUid, kAppGid), 0);
  EXPECT_EQ(chmod(path.c_str(), static_cast<mode_t>(mode)), 0);
  return path;
}

std::string RestoreTest::unpacked_file(const std::string &name, const std::string &content) {
  const std::string path = at(name);
  unlink(path.c_str());
  write_text(path, content);
  for (std::string folder = parent_of(name); !folder.empty(); folder = parent_of(folder)) {
    EXPECT_EQ(chown(at(folder).c_str(), kAppUid, kAppGid), 0);
  }
  EXPECT_EQ(chown(path.c_str(), kAppUid, kAppGid), 0);
  EXPECT_EQ(chmod(path.c_str(), kUnpackedMode), 0);
  return path;
}

std::string RestoreTest::daemons_file(const std::string &name, const std::string &content) {
  const std::string path = at(name);
  unlink(path.c_str());
  write_text(path, content);
  EXPECT_EQ(chmod(path.c_str(), 0600), 0);
  return path;
}

std::string RestoreTest::dir(const std::string &name, int mode, const std::string &label) {
  const std::string path = at(name);
  std::filesystem::create_directories(path);
  set_label(path, label);
  EXPECT_EQ(chown(path.c_str(), kAppUid, kAppGid), 0);
  EXPECT_EQ(chmod(path.c_str(), static_cast<mode_t>(mode)), 0);
  return path;
}

void RestoreTest::make_old_data() {
  dir("data/db", 0700);
  file("data/settings.ini", "old settings", 0640);
  file("data/db/notes.db", "old notes", 0600, "wrt::db_origin");
  dir("shared/data/pictures", 0775);
  file("shared/data/pictures/one.jpg", std::string(5000, 'o'), 0444);
  file("shared/trusted/key.bin", "old key", 0400, std::string(kPkg) + ".native");
}

std::string RestoreTest::table_text(const std::vector<Entry> &entries) const {
  return json_object_get_string(table(entries).get());
}

JsonPtr RestoreTest::table(const std::vector<Entry> &entries) const {
  JsonPtr whole(json_object_new_object());
  json_object_object_add(whole.get(), "quarn_symbolic_info", json_object_new_array());
  std::set<std::string> dirs;
  const auto add = [&](const std::string &name, int mode, const std::string &label) {
    json_object *entry = json_object_new_object();
    json_object_object_add(entry, "0", json_object_new_int(mode));
    json_object_object_add(entry, "1", json_object_new_int(kAppUid));
    json_object_object_add(entry, "2", json_object_new_int(kAppGid));
    json_object_object_add(entry, "3", json_object_new_string(label.c_str()));
    json_object_object_add(whole.get(), name.c_str(), entry);
  };
  for (const auto &entry : entries) {
    add(entry.name, entry.mode, entry.label);
    for (std::string name = parent_of(entry.name);
         !name.empty() && name != "data" && name != "shared/data" && name != "shared/trusted";
         name = parent_of(name)) {
      if (dirs.insert(name).second) add(name, 0755, kDataLabel);
    }
  }
  return whole;
}

void RestoreTest::make_plain_archive(const std::string &path,
                                     const std::vector<Entry> &entries) const {
  std::filesystem::create_directories(std::filesystem::path(path).parent_path());
  zipFile zip = zipOpen(path.c_str(), APPEND_STATUS_CREATE);
  ASSERT_NE(zip, nullptr);
  for (const auto &entry : entries) add_to_archive(zip, entry.name, entry.content);
  ASSERT_EQ(zipClose(zip, nullptr), ZIP_OK);
}

void RestoreTest::make_archive(const std::string &path, const std::vector<Entry> &entries,
                               const char *table_content) const {
  std::vector<Entry> all = entries;
  all.push_back({"shared/data/" + std::string(kPkg) + ".perm",
                 table_content == nullptr ? table_text(entries) : table_content});
  make_plain_archive(path, all);
}

void RestoreTest::request_restore(pkg_restore_context *ctx) const {
  ctx->serial = kSerial;
  ctx->pkgid = kPkg;
  ctx->version = kVersion;
  ctx->root = root;
  ctx->wait_for_result = true;
  EXPECT_EQ(restore_app_data("app", ctx), 0);
}

pkg_restore_context *RestoreTest::new_context() const {
  auto *ctx = new pkg_restore_context;
  ctx->serial = kSerial;
  ctx->pkgid = kPkg;
  ctx->version = kVersion;
  ctx->root = root;
  return ctx;
}

void RestoreTest::answer(backup_trans_error_code error) {
  ASSERT_FALSE(downloads.empty());
  const Download download = downloads.front();
  downloads.erase(downloads.begin());
  download.callback(error, download.user_data, nullptr);
}
