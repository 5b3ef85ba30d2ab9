/**
 * @file harness.h
 * @brief What the transport's tests share: folders, files, and a session whose callbacks are
 * counted.
 */
#ifndef TRANSPORT_HARNESS_H
#define TRANSPORT_HARNESS_H

#include <gtest/gtest.h>

#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "backup_transport.h"
#include "run_until.h"
#include "temp_dir.h"

namespace harness {

using std::chrono::milliseconds;

using ::run_until;
using ::TempDir;

void write_file(const std::string &path, const std::string &content, mode_t mode = 0600);
/** "<absent>" when there is none. */
std::string read_file(const std::string &path);
/** Files and empty folders (with a trailing slash) below @p root, by their paths from it. */
std::map<std::string, std::string> tree(const std::string &root);
/** Text of @p size bytes that differs with @p seed. */
std::string bytes(std::size_t size, unsigned seed = 1);

struct Child {
  std::string path;
  bool is_file;
  uint64_t size;
  int64_t timestamp_ms;
  bool operator==(const Child &other) const {
    return path == other.path && is_file == other.is_file && size == other.size;
  }
};
std::ostream &operator<<(std::ostream &out, const Child &child);

/** What became of one request. */
struct Answer {
  int accepted = -1;  // what the call returned
  int calls = 0;      // how often the callback came
  int code = -1;
  std::string message;
  std::vector<Child> children;  // of an upload and a deletion: the one of the info
  bool has_info = false;
  bool more = false;
  std::thread::id thread;
  std::chrono::steady_clock::time_point when;
};
using AnswerPtr = std::shared_ptr<Answer>;

/** Threads of this process with that name. */
int threads_named(const std::string &name);

/** A session with the store that a configuration text names. */
class Cloud {
 public:
  /** Writes the configuration, initialises and takes a handle. */
  explicit Cloud(const std::string &config);
  Cloud(const Cloud &) = delete;
  Cloud &operator=(const Cloud &) = delete;
  /** Ends the session and waits for every callback. */
  ~Cloud();

  void configure(const std::string &config);
  const std::string &config_path() const { return config_path_; }
  const TempDir &dir() const { return dir_; }
  backup_trans_handle_h handle = nullptr;

  // The calls; what they answer is filled in while the main context runs.
  AnswerPtr upload(const std::string &local, const std::string &remote,
                   int64_t timestamp_ms = 1700000000123, const char *content_type = nullptr);
  AnswerPtr download(const std::string &remote, const std::string &local, int options = 0);
  /** Of at most so many bytes. */
  AnswerPtr download_limited(const std::string &remote, const std::string &local, uint64_t most);
  /** The user data of the latest request. */
  void *latest() const { return latest_; }
  AnswerPtr list(const std::string &folder, int start = 0, int count = 100);
  AnswerPtr remove(const std::string &folder);

  // The same, waiting for the answer; -1 when none came.
  int put(const std::string &remote, const std::string &content);
  /** "<CODE>" on a failure. */
  std::string get(const std::string &remote, int options = 0);
  std::vector<Child> children(const std::string &folder);
  int drop(const std::string &folder);

  /** A local file with that content. */
  std::string file(const std::string &content);
  /** A local path where nothing is. */
  std::string place();

  /** Run the main context until every accepted request was answered. */
  bool settle(milliseconds patience = milliseconds(60000));
  const std::vector<AnswerPtr> &answers() const { return answers_; }

 private:
  AnswerPtr note();
  void *latest_ = nullptr;

  TempDir dir_;
  std::string config_path_;
  int files_ = 0;
  std::vector<AnswerPtr> answers_;
};

/** A role for a second process, found by its name. */
using Role = int (*)(int argc, char **argv);
bool add_role(const std::string &name, Role role);
/** Run this program again in a role. @return its exit status; 128 + the signal that killed it */
int run_role(const std::vector<std::string> &arguments);
pid_t start_role(const std::vector<std::string> &arguments);
int wait_role(pid_t pid);

}  // namespace harness

#endif
