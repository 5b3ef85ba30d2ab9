#include "harness.h"

#include <fcntl.h>
#include <ftw.h>
#include <glib.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>

#include "noise.h"

namespace harness {
namespace fs = std::filesystem;

void write_file(const std::string &path, const std::string &content, mode_t mode) {
  write_text(path, content);
  chmod(path.c_str(), mode);
}

std::string read_file(const std::string &path) {
  return std::ifstream(path) ? read_text(path) : "<absent>";
}

std::map<std::string, std::string> tree(const std::string &root) {
  std::map<std::string, std::string> found;
  std::error_code error;
  for (fs::recursive_directory_iterator it(root, error), end; !error && it != end;
       it.increment(error)) {
    const std::string name = it->path().string().substr(root.size());
    if (it->is_symlink()) {
      found[name] = "-> " + fs::read_symlink(it->path()).string();
    } else if (it->is_directory()) {
      if (fs::is_empty(it->path())) found[name + "/"] = "";
    } else {
      found[name] = read_file(it->path());
    }
  }
  return found;
}

std::string bytes(std::size_t size, unsigned seed) { return noise(size, seed); }

std::ostream &operator<<(std::ostream &out, const Child &child) {
  return out << child.path << (child.is_file ? " file " : " folder ") << child.size;
}

int threads_named(const std::string &name) {
  int count = 0;
  std::error_code error;
  for (fs::directory_iterator it("/proc/self/task", error), end; !error && it != end;
       it.increment(error)) {
    if (read_file(it->path().string() + "/comm") == name + "\n") ++count;
  }
  return count;
}

namespace {

Child child_of(const backup_trans_file_info_s &info) {
  return {info.path, info.is_file, info.size, info.timestamp_ms};
}

// Takes the reference that the call was given.
AnswerPtr take(void *user_data, int error) {
  auto *owned = static_cast<AnswerPtr *>(user_data);
  AnswerPtr answer = *owned;
  ++answer->calls;
  answer->code = error;
  answer->thread = std::this_thread::get_id();
  answer->when = std::chrono::steady_clock::now();
  if (answer->calls == 1) delete owned;
  return answer;
}

void note_info(const AnswerPtr &answer, const backup_trans_file_info_s *info) {
  answer->has_info = info != nullptr;
  if (info != nullptr) answer->children = {child_of(*info)};
}

AnswerPtr keep(AnswerPtr answer, AnswerPtr *owned, int accepted) {
  answer->accepted = accepted;
  if (accepted != BACKUP_TRANS_ERROR_NONE) delete owned;
  return answer;
}

}  // namespace

Cloud::Cloud(const std::string &config) : config_path_(dir_ / "cloud.conf") {
  // A case may go on as a user without rights.
  chmod(dir_.path().c_str(), 0777);
  configure(config);
  setenv("QUARN_CLOUD_CONFIG", config_path_.c_str(), 1);
  AnswerPtr answer = note();
  keep(answer, nullptr, 0);
  answer->accepted = backup_trans_init(
      new AnswerPtr(answer),
      [](backup_trans_error_code error, void *user_data) { take(user_data, error); });
  EXPECT_EQ(answer->accepted, BACKUP_TRANS_ERROR_NONE);
  EXPECT_TRUE(run_until([&] { return answer->calls > 0; }));
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_NONE);
  handle = backup_trans_create_handle();
  EXPECT_NE(handle, nullptr);
}

Cloud::~Cloud() {
  backup_trans_deinit();
  EXPECT_TRUE(settle());
  for (const AnswerPtr &answer : answers_) {
    EXPECT_EQ(answer->calls, answer->accepted == BACKUP_TRANS_ERROR_NONE ? 1 : 0);
  }
}

void Cloud::configure(const std::string &config) {
  write_file(config_path_ + ".new", config);
  rename((config_path_ + ".new").c_str(), config_path_.c_str());
}

AnswerPtr Cloud::note() {
  answers_.push_back(std::make_shared<Answer>());
  return answers_.back();
}

AnswerPtr Cloud::upload(const std::string &local, const std::string &remote, int64_t timestamp_ms,
                        const char *content_type) {
  AnswerPtr answer = note();
  auto *owned = new AnswerPtr(answer);
  return keep(
      answer, owned,
      backup_trans_upload_file_ors_async(
          handle, local.c_str(), remote.c_str(),
          [](backup_trans_error_code error, void *user_data, const backup_trans_file_info_s *info) {
            note_info(take(user_data, error), info);
          },
          timestamp_ms, BACKUP_TRANS_OPTION_NONE, owned, content_type));
}

AnswerPtr Cloud::download(const std::string &remote, const std::string &local, int options) {
  AnswerPtr answer = note();
  auto *owned = new AnswerPtr(answer);
  return keep(answer, owned,
              backup_trans_download_file_ors_async(
                  handle, remote.c_str(), local.c_str(), owned,
                  [](backup_trans_error_code error, void *user_data, char *message) {
                    const AnswerPtr taken = take(user_data, error);
                    taken->has_info = message != nullptr;
                    if (message != nullptr) taken->message = message;
                  },
                  options));
}

AnswerPtr Cloud::download_limited(const std::string &remote, const std::string &local,
                                  uint64_t most) {
  AnswerPtr answer = note();
  auto *owned = new AnswerPtr(answer);
  latest_ = owned;
  return keep(answer, owned,
              backup_trans_download_limited_ors_async(
                  handle, remote.c_str(), local.c_str(), owned,
                  [](backup_trans_error_code error, void *user_data, char *message) {
                    const AnswerPtr taken = take(user_data, error);
                    taken->has_info = message != nullptr;
                    if (message != nullptr) taken->message = message;
                  },
                  BACKUP_TRANS_OPTION_NONE, most));
}

AnswerPtr Cloud::list(const std::string &folder, int start, int count) {
  AnswerPtr answer = note();
  auto *owned = new AnswerPtr(answer);
  return keep(answer, owned,
              backup_trans_get_folder_child_list_async(
                  handle, folder.c_str(), start, count, BACKUP_TRANS_OPTION_NONE, owned,
                  [](backup_trans_error_code error, void *user_data,
                     const backup_trans_child_list_s *list) {
                    const AnswerPtr taken = take(user_data, error);
                    taken->has_info = list != nullptr;
                    if (list == nullptr) return;
                    taken->more = list->more;
                    for (int i = 0; i < list->count; ++i)
                      taken->children.push_back(child_of(list->children[i]));
                  }));
}

AnswerPtr Cloud::remove(const std::string &folder) {
  AnswerPtr answer = note();
  auto *owned = new AnswerPtr(answer);
  return keep(
      answer, owned,
      backup_trans_delete_folder_ors_async(
          handle, folder.c_str(), owned,
          [](backup_trans_error_code error, void *user_data, const backup_trans_file_info_s *info) {
            note_info(take(user_data, error), info);
          }));
}

int Cloud::put(const std::string &remote, const std::string &content) {
  const AnswerPtr answer = upload(file(content), remote);
  run_until([&] { return answer->accepted != 0 || answer->calls > 0; });
  return answer->accepted != 0 ? answer->accepted : answer->code;
}

std::string Cloud::get(const std::string &remote, int options) {
  const std::string local = place();
  const AnswerPtr answer = download(remote, local, options);
  run_until([&] { return answer->accepted != 0 || answer->calls > 0; });
  const int code = answer->accepted != 0 ? answer->accepted : answer->code;
  if (code != 0) return "<" + std::to_string(code) + ">";
  return read_file(local);
}

std::vector<Child> Cloud::children(const std::string &folder) {
  std::vector<Child> all;
  for (;;) {
    const AnswerPtr answer = list(folder, static_cast<int>(all.size()));
    run_until([&] { return answer->accepted != 0 || answer->calls > 0; });
    EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_NONE) << folder;
    all.insert(all.end(), answer->children.begin(), answer->children.end());
    if (!answer->more || answer->children.empty()) return all;
  }
}

int Cloud::drop(const std::string &folder) {
  const AnswerPtr answer = remove(folder);
  run_until([&] { return answer->accepted != 0 || answer->calls > 0; });
  return answer->accepted != 0 ? answer->accepted : answer->code;
}

std::string Cloud::file(const std::string &content) {
  const std::string path = place();
  write_file(path, content);
  return path;
}

std::string Cloud::place() { return dir_ / ("local-" + std::to_string(++files_)); }

bool Cloud::settle(milliseconds patience) {
  return run_until(
      [this] {
        for (const AnswerPtr &answer : answers_) {
          if (answer->accepted == BACKUP_TRANS_ERROR_NONE && answer->calls == 0) return false;
        }
        return true;
      },
      patience);
}

namespace {
std::map<std::string, Role> &roles() {
  static std::map<std::string, Role> all;
  return all;
}
}  // namespace

bool add_role(const std::string &name, Role role) {
  roles()[name] = role;
  return true;
}

pid_t start_role(const std::vector<std::string> &arguments) {
  std::vector<std::string> words = {"/proc/self/exe", "--role"};
  words.insert(words.end(), arguments.begin(), arguments.end());
  std::vector<char *> argv;
  for (std::string &word : words) argv.push_back(word.data());
  argv.push_back(nullptr);
  const pid_t pid = fork();
  if (pid == 0) {
    execv(argv[0], argv.data());
    _exit(127);
  }
  return pid;
}

int wait_role(pid_t pid) {
  int status = 0;
  if (waitpid(pid, &status, 0) != pid) return -1;
  return WIFSIGNALED(status) ? 128 + WTERMSIG(status) : WEXITSTATUS(status);
}

int run_role(const std::vector<std::string> &arguments) { return wait_role(start_role(arguments)); }

}  // namespace harness

int main(int argc, char **argv) {
  if (argc > 2 && std::string(argv[1]) == "--role") {
    const auto role = harness::roles().find(argv[2]);
    return role == harness::roles().end() ? 126 : role->second(argc - 3, argv + 3);
  }
  ::testing::InitGoogleTest(&argc, argv);
  return RUN_ALL_TESTS();
}
