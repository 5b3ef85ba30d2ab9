#include "disk_store.h"

#include <fcntl.h>
#include <glib.h>
#include <signal.h>
#include <sys/file.h>
#include <sys/resource.h>
#include <unistd.h>

#include <filesystem>

using namespace harness;
namespace fs = std::filesystem;

namespace {
constexpr uid_t kNobody = 65534;

void limit_file_size(rlim_t bytes) {
  struct rlimit limit {};
  getrlimit(RLIMIT_FSIZE, &limit);
  limit.rlim_cur = bytes;
  setrlimit(RLIMIT_FSIZE, &limit);
}
}  // namespace

DiskStore::DiskStore() {
  // The harness's own files must stay reachable for the user that lock_out() becomes.
  signal(SIGXFSZ, SIG_IGN);
}

DiskStore::~DiskStore() { release(); }

std::string DiskStore::config_for(const std::string &name) const {
  char *uri = g_filename_to_uri((dir_ / name).c_str(), nullptr, nullptr);
  const std::string text = std::string("[cloud]\nurl=") + uri + "\n";
  g_free(uri);
  return text;
}

std::map<std::string, std::string> DiskStore::content() const { return tree(root()); }

void DiskStore::put(const std::string &path, const std::string &content) {
  fs::create_directories(fs::path(root() + path).parent_path());
  write_file(root() + path + ".foreign", content);
  fs::rename(root() + path + ".foreign", root() + path);
}

void DiskStore::hold() {
  fs::create_directories(root());
  held_ = open(root().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  ASSERT_EQ(flock(held_, LOCK_EX), 0);
}

void DiskStore::release() {
  if (held_ >= 0) close(held_);
  held_ = -1;
}

void DiskStore::fill(std::size_t bytes) { limit_file_size(bytes); }

void DiskStore::unfill() { limit_file_size(RLIM_INFINITY); }

void DiskStore::lock_out() {
  fs::permissions(dir_.path(), fs::perms::owner_all | fs::perms::others_exec);
  ASSERT_EQ(seteuid(kNobody), 0);
}

void DiskStore::let_in() { ASSERT_EQ(seteuid(0), 0); }
