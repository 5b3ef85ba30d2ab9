// What only WebDAV servers can do to a store, and how the store takes it.
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <filesystem>
#include <sstream>

#include "forwarder.h"
#include "http/url.h"
#include "session/session.h"
#include "webdav/backend_webdav.h"
#include "webdav/dav_client.h"
#include "webdav_store.h"

using namespace harness;
using transport::DavClient;
using transport::HttpAnswer;
using transport::HttpRequest;

namespace {

using std::chrono::hours;
using std::chrono::seconds;

constexpr char kList[] = "/app_list/app_list.txt";
constexpr char kLeftover[] = "%2Equarn-part-0123456789abcdef01234567";

class WebdavCase : public ::testing::Test {
 protected:
  WebdavCase() : cloud(store.config()) {}

  DavClient client() const {
    transport::ConfigFile file(cloud.config_path());
    EXPECT_TRUE(file.refresh());
    transport::StoreUrl url;
    std::string problem;
    EXPECT_TRUE(
        transport::parse_store_url(file.config().url, transport::kWebdavScheme, &url, &problem));
    return DavClient(url, file.config());
  }
  bool lies_there(const std::string &path) const {
    return std::filesystem::exists(store.root() + path);
  }

  WebdavStore store;
  Cloud cloud;
};

TEST_F(WebdavCase, WhatDeadUploadsLeftIsSweptAfterADay) {
  ASSERT_EQ(cloud.put("/f/object", "x"), 0);
  const std::string piece = std::string(kLeftover) + ".0000000020";
  store.put_raw(std::string("/f/") + kLeftover, hours(25));
  store.put_raw("/f/" + piece, hours(25));
  store.put_raw("/f/%2Equarn-part-fedcba987654321001234567", hours(23));
  EXPECT_EQ(cloud.children("/f"), (std::vector<Child>{{"/f/object", true, 1, 0}}));
  EXPECT_FALSE(lies_there(std::string("/f/") + kLeftover));
  EXPECT_FALSE(lies_there("/f/" + piece));
  EXPECT_TRUE(lies_there("/f/%2Equarn-part-fedcba987654321001234567"));
}

TEST_F(WebdavCase, WhatOnlyLooksLikeALeftoverIsKept) {
  for (const char *name : {"/f/%2Equarn-part-0123", "/f/quarn-part-0123456789abcdef01234567",
                           "/f/%2Equarn-part-0123456789abcdef0123456G"})
    store.put_raw(name, hours(1000));
  EXPECT_EQ(cloud.children("/f").size(), 3U);
  for (const char *name : {"/f/%2Equarn-part-0123", "/f/quarn-part-0123456789abcdef01234567",
                           "/f/%2Equarn-part-0123456789abcdef0123456G"})
    EXPECT_TRUE(lies_there(name)) << name;
}

TEST_F(WebdavCase, FolderIntoWhichAnotherDeviceUploadsStays) {
  ASSERT_EQ(cloud.put("/s/p/object", "x"), 0);
  store.put_raw(std::string("/s/") + kLeftover, seconds(0));
  ASSERT_EQ(cloud.drop("/s/p"), 0);
  EXPECT_TRUE(lies_there(std::string("/s/") + kLeftover));
  EXPECT_FALSE(lies_there("/s/p"));
}

TEST_F(WebdavCase, FolderThatHoldsOnlyWhatDeadUploadsLeftGoes) {
  ASSERT_EQ(cloud.put("/s/p/object", "x"), 0);
  store.put_raw(std::string("/s/") + kLeftover, hours(25));
  ASSERT_EQ(cloud.drop("/s/p"), 0);
  EXPECT_FALSE(lies_there("/s"));
}

TEST_F(WebdavCase, LeftoversDoNotMakeAListing) {
  store.put_raw(std::string("/f/") + kLeftover, seconds(0));
  EXPECT_TRUE(cloud.children("/f").empty());
}

TEST_F(WebdavCase, ObjectWhereAFolderIsWantedIsLeftAlone) {
  ASSERT_EQ(cloud.put("/a", "an object"), 0);
  EXPECT_EQ(cloud.put("/a/b", "x"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(cloud.put("/a/b/c", "x"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(cloud.get("/a"), "an object");
  EXPECT_EQ(store.content(), (std::map<std::string, std::string>{{"/a", "an object"}}));
}

TEST_F(WebdavCase, FolderWhereAnObjectIsWantedIsLeftAlone) {
  ASSERT_EQ(cloud.put("/a/b", "x"), 0);
  EXPECT_EQ(cloud.put("/a", "an object"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(store.content(), (std::map<std::string, std::string>{{"/a/b", "x"}}));
}

TEST_F(WebdavCase, FolderThatAnotherDeviceDeletedIsMadeAgain) {
  ASSERT_EQ(cloud.put("/s/p/one", "x"), 0);
  for (const std::string &gone : {store.root() + "/s/p", store.root() + "/s", store.root()}) {
    std::filesystem::remove_all(gone);
    store.changed();
    EXPECT_EQ(cloud.put("/s/p/two", gone), 0);
    EXPECT_EQ(store.content(), (std::map<std::string, std::string>{{"/s/p/two", gone}}));
  }
}

// Locks the folder of the list as a device does that then dies. Its token.
std::string lock_for_a_while(const DavClient &client, const char *seconds) {
  transport::Ticket ticket;
  HttpRequest request = client.request_for("LOCK", "/app_list/");
  request.has_body = true;
  request.body =
      "<?xml version=\"1.0\"?><d:lockinfo xmlns:d=\"DAV:\"><d:lockscope><d:exclusive/>"
      "</d:lockscope><d:locktype><d:write/></"
      "d:locktype><d:owner>.quarn-part-0123456789abcdef01234567</d:owner></d:lockinfo>";
  request.headers = {"Content-Type: application/xml", "Depth: infinity",
                     std::string("Timeout: Second-") + seconds};
  const HttpAnswer answer = http_perform(ticket, request);
  EXPECT_EQ(answer.status, 200);
  return answer.header("lock-token");
}

TEST_F(WebdavCase, LockOfADeviceThatDiedIsWaitedFor) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  // One of the servers never ends them.
  transport::RetryLimits limits;
  limits.longest_pause = seconds(1);
  transport::set_retry_clock(nullptr, limits);
  EXPECT_NE(lock_for_a_while(client(), "1"), "");
  const AnswerPtr answer = cloud.upload(cloud.file("two"), kList);
  ASSERT_TRUE(cloud.settle(std::chrono::minutes(2)));
  transport::set_retry_clock(nullptr, {});
  EXPECT_EQ(answer->code, 0);
  EXPECT_EQ(cloud.get(kList), "two");
}

TEST_F(WebdavCase, LockIsGivenBackWhateverHappens) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  ASSERT_EQ(cloud.put(kList, "two"), 0);
  ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "two");
  store.put(kList, "foreign");
  ASSERT_EQ(cloud.put(kList, "three"), BACKUP_TRANS_ERROR_CONFLICT);
  const std::string token = lock_for_a_while(client(), "60");
  EXPECT_NE(token, "");
  client().unlock("/app_list", token);
}

TEST_F(WebdavCase, LockOnAFolderThatIsGoneIsNotInTheWay) {
  ASSERT_EQ(cloud.put("/other", "x"), 0);
  transport::Ticket ticket;
  std::string token;
  const transport::Outcome outcome = client().lock(ticket, "/app_list", &token);
  EXPECT_EQ(outcome.ok(), !token.empty());
  client().unlock("/app_list", token);
  EXPECT_EQ(store.content(), (std::map<std::string, std::string>{{"/other", "x"}}));
  EXPECT_EQ(cloud.put(kList, "y"), 0);
}

// The lock ends in the middle of an upload: at its last step somebody takes it away.
class EndedLock : public WebdavCase {
 protected:
  EndedLock() : direct(client()) {
    EXPECT_EQ(cloud.put(kList, "one"), 0);
    std::string config = store.config();
    const std::string port = ":" + std::to_string(store.port()) + "/";
    config.replace(config.find(port), port.size(), ":" + std::to_string(between.port()) + "/");
    cloud.configure(config);
    EXPECT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  }

  // The lock whose token a request shows.
  void end_lock(const front::Request &request) {
    const std::string condition = request.header("if");
    const std::size_t begin = condition.find("(<") + 1;
    direct.unlock("/app_list", condition.substr(begin, condition.find('>', begin) - begin + 1));
    ended = true;
  }
  int put_directly(const std::string &content) {
    transport::Ticket ticket;
    HttpRequest request = direct.request_for("PUT", kList);
    request.has_body = true;
    request.body = content;
    return http_perform(ticket, request).status;
  }

  const DavClient direct;
  Forwarder between{store.port()};
  std::atomic<bool> ended{false};
};

TEST_F(EndedLock, IsTakenAgain) {
  between.before("MOVE", [&](const front::Request &request) { end_lock(request); });
  EXPECT_EQ(cloud.put(kList, "two"), 0);
  EXPECT_TRUE(ended);
  EXPECT_EQ(cloud.get(kList), "two");
}

TEST_F(EndedLock, LosesNoListOfAnotherDevice) {
  int status = 0;
  between.before("MOVE", [&](const front::Request &request) {
    end_lock(request);
    status = put_directly("of another device");
  });
  const int code = cloud.put(kList, "two");
  EXPECT_TRUE(status == 200 || status == 201 || status == 204) << status;
  EXPECT_EQ(code, store.checks_proofs() ? BACKUP_TRANS_ERROR_CONFLICT : 0);
  EXPECT_EQ(cloud.get(kList), code == 0 ? "two" : "of another device");
}

// A device that adds its lines to the list, again whenever another was faster:
// CONFIG-PATH NAME COUNT.
int append_role(int argc, char **argv) {
  if (argc != 3) return 125;
  Cloud device(read_file(argv[0]));
  for (int added = 0; added < std::stoi(argv[2]);) {
    std::string list = device.get(kList, BACKUP_TRANS_OPTION_BASIS);
    if (list == "<12>") list.clear();
    if (!list.empty() && list[0] == '<') return 124;
    const int code = device.put(kList, list + argv[1] + std::to_string(added) + "\n");
    if (code != 0 && code != BACKUP_TRANS_ERROR_CONFLICT) return code;
    if (code == 0) ++added;
  }
  return 0;
}
const bool append_added = add_role("append", append_role);

TEST_F(WebdavCase, DevicesThatWriteTheListAtOnceLoseNothing) {
  constexpr int kDevices = 3;
  constexpr int kLines = 4;
  std::vector<pid_t> devices;
  for (int i = 0; i < kDevices; ++i) {
    devices.push_back(
        start_role({"append", cloud.config_path(), std::string(1, static_cast<char>('a' + i)),
                    std::to_string(kLines)}));
  }
  for (const pid_t device : devices) EXPECT_EQ(wait_role(device), 0);
  std::istringstream list(cloud.get(kList));
  std::vector<std::string> lines;
  for (std::string line; std::getline(list, line);) lines.push_back(line);
  std::sort(lines.begin(), lines.end());
  std::vector<std::string> expected;
  for (int i = 0; i < kDevices; ++i) {
    for (int k = 0; k < kLines; ++k)
      expected.push_back(static_cast<char>('a' + i) + std::to_string(k));
  }
  EXPECT_EQ(lines, expected);
}

TEST_F(WebdavCase, HandlesThatWriteTheListAtOnceHaveOneWinner) {
  ASSERT_EQ(cloud.put(kList, "one"), 0);
  constexpr int kHandles = 8;
  std::vector<backup_trans_handle_h> handles;
  for (int i = 0; i < kHandles; ++i) {
    handles.push_back(cloud.handle = backup_trans_create_handle());
    ASSERT_EQ(cloud.get(kList, BACKUP_TRANS_OPTION_BASIS), "one");
  }
  std::vector<AnswerPtr> answers;
  for (std::size_t i = 0; i < handles.size(); ++i) {
    cloud.handle = handles[i];
    answers.push_back(cloud.upload(cloud.file("of " + std::to_string(i)), kList));
  }
  ASSERT_TRUE(cloud.settle());
  int winners = 0;
  for (std::size_t i = 0; i < answers.size(); ++i) {
    if (answers[i]->code == 0) {
      ++winners;
      EXPECT_EQ(cloud.get(kList), "of " + std::to_string(i));
    } else {
      EXPECT_EQ(answers[i]->code, BACKUP_TRANS_ERROR_CONFLICT);
    }
  }
  EXPECT_EQ(winners, 1);
}

// Uploads until it is killed: CONFIG-PATH LOCAL.
int upload_for_ever_role(int argc, char **argv) {
  if (argc != 2) return 125;
  Cloud device(read_file(argv[0]));
  for (;;) {
    const AnswerPtr answer = device.upload(argv[1], "/big");
    run_until([&] { return answer->calls > 0; });
  }
}
const bool upload_added = add_role("upload-for-ever", upload_for_ever_role);

bool sends(pid_t pid) {
  std::error_code error;
  for (std::filesystem::directory_iterator it("/proc/" + std::to_string(pid) + "/task", error), end;
       !error && it != end; it.increment(error)) {
    if (read_file(it->path().string() + "/comm") == "cloud-transport\n") return true;
  }
  return false;
}

TEST_F(WebdavCase, DeviceThatDiesInAnUploadLeavesTheObjectWhole) {
  const std::string before = bytes(1 << 20, 1);
  const std::string after = bytes(24 << 20, 2);
  ASSERT_EQ(cloud.put("/big", before), 0);
  const std::string local = cloud.file(after);
  for (int round = 0; round < 5; ++round) {
    const pid_t pid = start_role({"upload-for-ever", cloud.config_path(), local});
    EXPECT_TRUE(run_until([pid] { return sends(pid); }));
    kill(pid, SIGKILL);
    EXPECT_EQ(wait_role(pid), 128 + SIGKILL);
    const std::string now = cloud.get("/big");
    EXPECT_TRUE(now == before || now == after) << now.size();
    for (const Child &child : cloud.children("/")) EXPECT_EQ(child.path, "/big");
  }
}

}  // namespace
