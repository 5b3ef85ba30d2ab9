/**
 * @file restore_fixture.h
 * @brief A package on a small real device: files with modes, owners and labels.
 *
 * Labels are extended attributes, so they follow their files as on a device.
 * The security service relabels for real; a test may make it refuse.
 */
#ifndef RESTORE_FIXTURE_H
#define RESTORE_FIXTURE_H

#include <gtest/gtest.h>
#include <json-c/json.h>

#include <functional>
#include <initializer_list>
#include <map>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "json_ptr.h"
#include "log_capture.h"
#include "mock_platform.h"
#include "mock_transport.h"
#include "quarn_d_restore/app_restore.h"
#include "quarn_d_restore/restore_context.h"
#include "quarn_d_restore/restore_mode.h"
#include "quarn_d_restore/restore_progress.h"
#include "quarn_dbus_client.h"
#include "run_until.h"
#include "temp_dir.h"

/** The label of what nobody labelled. */
inline constexpr char kFloorLabel[] = "_";
/** The label of the package's data. */
inline constexpr char kDataLabel[] = "app.data";

std::string label_of(const std::string &path);
void set_label(const std::string &path, const std::string &label);

/** Everything of one object that a restore must keep: type, mode, owner, label, content. */
using Tree = std::map<std::string, std::string>;
/** All objects below @p root by their relative paths. */
Tree tree_of(const std::string &root);

/** One file of an archive and its line in the table. */
struct Entry {
  std::string name;
  std::string content;
  int mode = 0644;
  std::string label = kDataLabel;
};

/** Where the phone-transfer companion keeps its archives. */
inline constexpr char kCompanionDir[] = "/opt/usr/apps/com.velmor.pellix-efl/shared/data";

/** What clients were told, and what else left the engine. */
struct Outside {
  struct Answer {
    std::string method;
    int err;
    std::string msg;
    unsigned int req_id;
    bool operator==(const Answer &other) const {
      return method == other.method && err == other.err && msg == other.msg &&
             req_id == other.req_id;
    }
  };
  std::vector<Answer> answers;
  std::vector<std::pair<double, bool>> terminations;
};
extern Outside outside;

/** A client_cb_data record, counted as the dispatcher does. */
void *make_record(unsigned int req_id, const std::string &sender = ":1.7");
/** The same, for what takes it as its own. */
std::unique_ptr<client_cb_data> owned_record(unsigned int req_id);

class RestoreTest : public ::testing::Test {
 protected:
  static constexpr char kPkg[] = "org.example.notes";
  static constexpr char kVersion[] = "1.2.0";
  static constexpr char kSerial[] = "350000000000001";

  RestoreTest();
  ~RestoreTest() override;

  std::string at(const std::string &name) const { return root + "/" + name; }
  /** A file of the application: owner 5000:5000, labelled. */
  std::string file(const std::string &name, const std::string &content, int mode = 0644,
                   const std::string &label = kDataLabel);
  /** A file of the daemon's own: root's, for nobody else. */
  std::string daemons_file(const std::string &name, const std::string &content);
  /** A file as the unpacking leaves it: the package's, not to be opened by anybody yet. */
  std::string unpacked_file(const std::string &name, const std::string &content);
  std::string dir(const std::string &name, int mode = 0755, const std::string &label = kDataLabel);
  /** Two files with attributes of their own, a database with its own label, in two folders. */
  void make_old_data();

  /** The table's text for @p entries and the directories they lie in. */
  std::string table_text(const std::vector<Entry> &entries) const;
  JsonPtr table(const std::vector<Entry> &entries) const;
  /** An archive of @p entries, its table last; @p table_content replaces the table's text. */
  void make_archive(const std::string &path, const std::vector<Entry> &entries,
                    const char *table_content = nullptr) const;
  /** The same without a table. */
  void make_plain_archive(const std::string &path, const std::vector<Entry> &entries) const;

  pkg_restore_context *new_context() const;
  /** Fill @p ctx for a restore whose end is waited for, and request it. */
  void request_restore(pkg_restore_context *ctx) const;
  /** Where the engine downloads to. */
  std::string download() const { return at("shared/data/org.example.notes_download.zip"); }
  std::string snapshot() const { return at("shared/data/quarn_tmp_rst_dir"); }
  std::string perm() const { return at("shared/data/org.example.notes.perm"); }

  ::testing::NiceMock<MockPlatform> platform;
  ::testing::NiceMock<MockTransport> transport;
  const TempDir place{quick_directory()};
  const std::string base = place.path(); /**< holds the root, and what lies outside of it */
  std::string root;

  /** Downloads that were accepted and not answered yet. */
  struct Download {
    std::string remote;
    std::string local;
    void *user_data;
    backup_trans_download_cb callback;
  };
  std::vector<Download> downloads;
  int transport_result = 0;
  /** Answer the oldest download; the archive must lie at its local path by then. */
  void answer(backup_trans_error_code error = BACKUP_TRANS_ERROR_NONE);

  /** Results of the security service; 0 does the work. */
  int begin_result = 0;
  int setup_result = 0;
  int commit_result = 0;
  int label_result = 0;
  int transactions = 0; /**< opened and neither committed nor aborted */
  std::vector<std::string> relabelled;
  std::vector<std::pair<std::string, std::string>> to_relabel;
};

/** Takes capabilities away from this thread while it lives: root is then refused like anybody. */
class WithoutCapabilities {
 public:
  explicit WithoutCapabilities(std::initializer_list<int> capabilities);
  ~WithoutCapabilities();
  WithoutCapabilities(const WithoutCapabilities &) = delete;
  WithoutCapabilities &operator=(const WithoutCapabilities &) = delete;

 private:
  unsigned int effective_[2];
  int securebits_;
};

/** Lets no file grow beyond @p bytes while it lives, as a full disk does. */
class DiskFullAfter {
 public:
  explicit DiskFullAfter(unsigned long bytes);
  ~DiskFullAfter();
  DiskFullAfter(const DiskFullAfter &) = delete;
  DiskFullAfter &operator=(const DiskFullAfter &) = delete;
};

/** A log line that must have been written exactly @p count times. */
void expect_error(const std::string &text, int count = 1);
void expect_info(const std::string &text, int count = 1);

/** Calls @p action at the @p nth time that the engine comes to @p step. */
class AtStep {
 public:
  AtStep(std::string step, std::function<void()> action, int nth = 1);
  ~AtStep();
  AtStep(const AtStep &) = delete;
  AtStep &operator=(const AtStep &) = delete;

  void reached(const std::string &step);

 private:
  std::string step_;
  std::function<void()> action_;
  int countdown_;
};

/** Calls @p action at the @p nth step that the engine comes to, whichever it is. One at a time. */
class AtNthStep {
 public:
  AtNthStep(int nth, std::function<void(const std::string &step)> action);
  ~AtNthStep();
  AtNthStep(const AtNthStep &) = delete;
  AtNthStep &operator=(const AtNthStep &) = delete;

  void reached(const std::string &step);

 private:
  int countdown_;
  std::function<void(const std::string &step)> action_;
};

/** Run @p work in a process of its own. @return whether it was killed; the test fails when it
 * failed */
bool is_killed_in(const std::function<void()> &work);

/** What replaces make_old_data(): changed, added and, by what it leaves out, removed. */
const std::vector<Entry> &new_app_data();

#endif
