// The WebDAV backend's store, seen from behind the server.
#include "webdav_store.h"

#include <fcntl.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <unistd.h>

#include <algorithm>

#include "webdav/dav_client.h"

using namespace harness;

namespace {

#ifndef CLOUD_DEFINES
#define CLOUD_DEFINES
#endif

constexpr char kKind[] = CLOUD_SERVER;
const std::vector<std::string> kDefines = {CLOUD_DEFINES};

std::unique_ptr<DavServer> &the_server() {
  static std::unique_ptr<DavServer> server;
  return server;
}

class Server : public ::testing::Environment {
 public:
  void SetUp() override { the_server() = std::make_unique<DavServer>(kKind, kDefines); }
  void TearDown() override { the_server().reset(); }
};
::testing::Environment *const server = ::testing::AddGlobalTestEnvironment(new Server);

constexpr milliseconds kPatience{10000};

bool has_temporary_name(const std::string &name) {
  return name.find("/%2Equarn-part-") != std::string::npos;
}

// This server keeps what it had received of a process that died, as the sweep's case shows.
bool is_cut_off(const std::string &name) {
  const std::string running = ::testing::UnitTest::GetInstance()->current_test_info()->name();
  return running == "ProcessMayExitWithRequestsInFlight/rclone" && has_temporary_name(name);
}

// Apache keeps track of locks beside the objects.
bool is_state(const std::string &name) { return name.find("/.DAV/") != std::string::npos; }

// Apache's own names for what it receives, ours, and folders that nothing came to lie in.
bool is_passing(const std::string &name) {
  return name.back() == '/' || name.find("/.davfs.tmp") != std::string::npos ||
         (has_temporary_name(name) && !is_cut_off(name));
}

std::string path_of(const std::string &name) {
  std::string path;
  for (std::size_t at = 0; at < name.size();) {
    const std::size_t end = std::min(name.find('/', at + 1), name.size());
    path += "/" + transport::name_of_stored(name.substr(at + 1, end - at - 1));
    at = end;
  }
  return path;
}

void give(const std::string &path) {
  const passwd *nobody = getpwnam("nobody");
  EXPECT_EQ(chown(path.c_str(), nobody->pw_uid, nobody->pw_gid), 0);
}

void make_folder(const std::string &path) {
  if (mkdir(path.c_str(), 0755) == 0) give(path);
}

INSTANTIATE_TEST_SUITE_P(Webdav, Conformance,
                         ::testing::Values(StoreKind{kKind,
                                                     []() -> std::unique_ptr<TestStore> {
                                                       return std::make_unique<WebdavStore>();
                                                     }}),
                         [](const auto &info) { return std::string(info.param.name); });

}  // namespace

int WebdavStore::count_ = 0;

WebdavStore::WebdavStore() : server_(*the_server()), name_("store" + std::to_string(++count_)) {}

std::map<std::string, std::string> WebdavStore::content() const {
  // A server may get to requests after their sender was told to give up, and works on what was
  // cut off until it notices.
  std::map<std::string, std::string> found;
  run_until(
      [&] {
        found = tree(root());
        return std::none_of(found.begin(), found.end(),
                            [](const auto &item) { return is_passing(item.first); });
      },
      kPatience);
  std::map<std::string, std::string> objects;
  for (auto &[name, content] : found) {
    if (is_cut_off(name) || is_state(name)) continue;
    objects[path_of(name)] = std::move(content);
  }
  return objects;
}

bool WebdavStore::checks_proofs() const { return std::string(kKind) != "nginx"; }

void WebdavStore::put(const std::string &object, const std::string &content) {
  write(transport::stored_path(object), content);
  changed();
}

void WebdavStore::put_raw(const std::string &path, std::chrono::seconds age) {
  write(path, "left");
  timespec times[2] = {};
  clock_gettime(CLOCK_REALTIME, times);
  times[0].tv_sec -= age.count();
  times[1] = times[0];
  EXPECT_EQ(utimensat(AT_FDCWD, (root() + path).c_str(), times, 0), 0);
  changed();
}

void WebdavStore::write(const std::string &path, const std::string &content) {
  make_folder(root());
  for (auto slash = path.find('/', 1); slash != std::string::npos;
       slash = path.find('/', slash + 1)) {
    make_folder(root() + path.substr(0, slash));
  }
  write_file(root() + path, content, 0644);
  give(root() + path);
}

void WebdavStore::fill(std::size_t bytes) {
  struct statvfs status {};
  ASSERT_EQ(statvfs(server_.root().c_str(), &status), 0);
  const int ballast = open((server_.root() + "/ballast").c_str(), O_WRONLY | O_CREAT, 0600);
  ASSERT_EQ(
      posix_fallocate(ballast, 0, static_cast<off_t>(status.f_bfree * status.f_bsize - bytes)), 0);
  close(ballast);
}

void WebdavStore::unfill() { EXPECT_EQ(unlink((server_.root() + "/ballast").c_str()), 0); }

std::string WebdavStore::config_for(const std::string &name) const {
  std::string path;
  for (const char c : name) path += c == ' ' ? std::string("%20") : std::string(1, c);
  return "[cloud]\nurl=webdav+http://127.0.0.1:" + std::to_string(server_.port()) + "/dav/" + path +
         "\nuser=device\npassword=right\n";
}
