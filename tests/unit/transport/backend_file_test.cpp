#include <fcntl.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>

#include "core/remote_path.h"
#include "core/staged_file.h"
#include "disk_store.h"

using namespace harness;
namespace fs = std::filesystem;
using Content = std::map<std::string, std::string>;

namespace {

template <bool Nameless>
class DiskStoreWith : public DiskStore {
 public:
  DiskStoreWith() { transport::StagedFile::set_nameless_allowed(Nameless); }
};

INSTANTIATE_TEST_SUITE_P(
    Disk, Conformance,
    ::testing::Values(StoreKind{"nameless",
                                []() -> std::unique_ptr<TestStore> {
                                  return std::make_unique<DiskStoreWith<true>>();
                                }},
                      StoreKind{"named",
                                []() -> std::unique_ptr<TestStore> {
                                  return std::make_unique<DiskStoreWith<false>>();
                                }}),
    [](const ::testing::TestParamInfo<StoreKind> &kind) { return std::string(kind.param.name); });

class FileBackendTest : public ::testing::Test {
 protected:
  FileBackendTest() {
    transport::StagedFile::set_nameless_allowed(true);
    cloud = std::make_unique<Cloud>(store.config());
  }
  DiskStore store;
  std::unique_ptr<Cloud> cloud;
};

TEST_F(FileBackendTest, StoreIsMadeWithTheFirstObjectAndPrivate) {
  EXPECT_EQ(cloud->get("/a"), "<12>");
  EXPECT_TRUE(cloud->children("/").empty());
  EXPECT_FALSE(fs::exists(store.root()));
  ASSERT_EQ(cloud->put("/f/a", "x"), 0);
  struct stat status {};
  ASSERT_EQ(stat(store.root().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode, S_IFDIR | 0700U);
  ASSERT_EQ(stat((store.root() + "/f").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode, S_IFDIR | 0700U);
  ASSERT_EQ(stat((store.root() + "/f/a").c_str(), &status), 0);
  EXPECT_EQ(status.st_mode, S_IFREG | 0600U);
  EXPECT_EQ(status.st_nlink, 1U);
}

TEST_F(FileBackendTest, ModificationTimeIsTheOneGivenToTheMillisecond) {
  const AnswerPtr answer = cloud->upload(cloud->file("x"), "/a", 1234567890123);
  ASSERT_TRUE(cloud->settle());
  ASSERT_EQ(answer->code, 0);
  struct stat status {};
  ASSERT_EQ(stat((store.root() + "/a").c_str(), &status), 0);
  EXPECT_EQ(status.st_mtim.tv_sec, 1234567890);
  EXPECT_EQ(status.st_mtim.tv_nsec, 123000000);
}

TEST_F(FileBackendTest, LeftoversOfACrashAreInvisibleAndSwept) {
  ASSERT_EQ(mkdir(store.root().c_str(), 0700), 0);
  const std::string file = transport::make_temporary_name();
  const std::string folder = transport::make_temporary_name();
  write_file(store.root() + "/" + file, "half an object");
  fs::create_directories(store.root() + "/" + folder + "/deep/er");
  write_file(store.root() + "/" + folder + "/deep/er/x", "of a deleted folder");
  EXPECT_TRUE(cloud->children("/").empty());
  EXPECT_EQ(cloud->get("/" + file), "<1>");
  EXPECT_EQ(cloud->put("/" + folder + "/deep/er/x", "x"), BACKUP_TRANS_ERROR_ARGUMENT);
  ASSERT_EQ(cloud->put("/a", "x"), 0);
  EXPECT_EQ(store.content(), (Content{{"/a", "x"}}));
}

TEST_F(FileBackendTest, TemporaryFileOfALivingWriterIsNotSwept) {
  ASSERT_EQ(mkdir(store.root().c_str(), 0700), 0);
  const std::string name = transport::make_temporary_name();
  write_file(store.root() + "/" + name, "being written");
  const UniqueFd writer(open((store.root() + "/" + name).c_str(), O_RDWR));
  ASSERT_EQ(flock(writer.get(), LOCK_EX | LOCK_NB), 0);
  ASSERT_EQ(cloud->put("/a", "x"), 0);
  EXPECT_EQ(store.content(), (Content{{"/a", "x"}, {"/" + name, "being written"}}));
}

TEST_F(FileBackendTest, LinksInTheStoreAreNotFollowed) {
  const TempDir outside;
  write_file(outside / "secret", "secret");
  ASSERT_EQ(cloud->put("/f/a", "x"), 0);
  ASSERT_EQ(symlink((outside / "secret").c_str(), (store.root() + "/f/link").c_str()), 0);
  ASSERT_EQ(symlink(outside.path().c_str(), (store.root() + "/out").c_str()), 0);
  EXPECT_EQ(cloud->get("/f/link"), "<12>");
  EXPECT_EQ(cloud->get("/out/secret"), "<12>");
  EXPECT_TRUE(cloud->children("/out").empty());
  EXPECT_EQ(cloud->children("/f").size(), 1U);
  EXPECT_EQ(cloud->children("/").size(), 1U);
  EXPECT_EQ(cloud->put("/out/new", "x"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(cloud->drop("/out"), BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
  ASSERT_EQ(cloud->put("/f/link", "own"), 0);
  ASSERT_EQ(cloud->drop("/f"), 0);
  EXPECT_EQ(tree(outside.path()), (Content{{"/secret", "secret"}}));
}

TEST_F(FileBackendTest, LinkInADeletedFolderIsRemovedAndNotFollowed) {
  const TempDir outside;
  write_file(outside / "kept", "kept");
  ASSERT_EQ(cloud->put("/f/a", "x"), 0);
  ASSERT_EQ(symlink(outside.path().c_str(), (store.root() + "/f/out").c_str()), 0);
  ASSERT_EQ(cloud->drop("/f"), 0);
  EXPECT_TRUE(store.content().empty());
  EXPECT_EQ(read_file(outside / "kept"), "kept");
}

TEST_F(FileBackendTest, FolderWithoutAnObjectIsNone) {
  ASSERT_EQ(cloud->put("/a/x", "x"), 0);
  fs::create_directories(store.root() + "/empty/deep/er");
  EXPECT_EQ(cloud->children("/"), (std::vector<Child>{{"/a", false, 0, 0}}));
  EXPECT_EQ(cloud->drop("/empty/deep"), BACKUP_TRANS_ERROR_NO_SUCH_OBJECT);
  EXPECT_EQ(store.content(), (Content{{"/a/x", "x"}}));
}

TEST_F(FileBackendTest, ObjectInTheWayOfAFolderAndTheReverseFail) {
  ASSERT_EQ(cloud->put("/a/x", "x"), 0);
  EXPECT_EQ(cloud->put("/a", "y"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(cloud->put("/a/x/y/z", "y"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(store.content(), (Content{{"/a/x", "x"}}));
}

TEST_F(FileBackendTest, RootThatIsAFileFailsEveryRequest) {
  write_file(store.root(), "not a folder");
  EXPECT_EQ(cloud->get("/a"), "<16>");
  EXPECT_EQ(cloud->put("/a", "x"), BACKUP_TRANS_ERROR_SERVER);
  EXPECT_EQ(cloud->drop("/a"), BACKUP_TRANS_ERROR_SERVER);
  const AnswerPtr list = cloud->list("/");
  ASSERT_TRUE(cloud->settle());
  EXPECT_EQ(list->code, BACKUP_TRANS_ERROR_SERVER);
}

TEST_F(FileBackendTest, LocalFileThatCannotGrowFailsTheDownload) {
  ASSERT_EQ(cloud->put("/a", bytes(2 << 20)), 0);
  const std::string place = cloud->file("before");
  store.fill(100000);
  const AnswerPtr answer = cloud->download("/a", place);
  ASSERT_TRUE(cloud->settle());
  store.unfill();
  EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_LOCAL_FILE);
  EXPECT_EQ(read_file(place), "before");
}

TEST_F(FileBackendTest, EightDevicesThatStartFromOneListLeaveOneWinner) {
  ASSERT_EQ(cloud->put("/list", "base"), 0);
  std::vector<backup_trans_handle_h> handles;
  for (int i = 0; i < 8; ++i) {
    cloud->handle = backup_trans_create_handle();
    handles.push_back(cloud->handle);
    ASSERT_EQ(cloud->get("/list", BACKUP_TRANS_OPTION_BASIS), "base");
  }
  std::vector<AnswerPtr> answers;
  for (int i = 0; i < 8; ++i) {
    cloud->handle = handles[static_cast<std::size_t>(i)];
    answers.push_back(cloud->upload(cloud->file("of " + std::to_string(i)), "/list"));
  }
  ASSERT_TRUE(cloud->settle());
  int winners = 0;
  std::string won;
  for (std::size_t i = 0; i < answers.size(); ++i) {
    if (answers[i]->code == 0) {
      ++winners;
      won = "of " + std::to_string(i);
    } else {
      EXPECT_EQ(answers[i]->code, BACKUP_TRANS_ERROR_CONFLICT);
    }
  }
  EXPECT_EQ(winners, 1);
  EXPECT_EQ(store.content(), (Content{{"/list", won}}));
}

TEST(FileUrl, IsDecodedAndMustNameAnAbsolutePath) {
  const std::pair<const char *, const char *> cases[] = {
      {"file:///", "/"},
      {"file:///a/b", "/a/b"},
      {"file:///a%20b%25", "/a b%"},
      {"file:///a/b///", "/a/b"},
      {"file://host/a", ""},
      {"file:///a%00b", ""},
      {"file:///a%zz", ""},
      {"file://", ""},
      {"FILE:///a", ""},
      {"/a", ""},
      {"", ""},
  };
  for (const auto &[url, path] : cases) {
    const TempDir dir;
    write_file(dir / "conf", std::string("[cloud]\nurl=") + url + "\n");
    setenv("QUARN_CLOUD_CONFIG", (dir / "conf").c_str(), 1);
    int code = -1;
    ASSERT_EQ(backup_trans_init(&code, [](backup_trans_error_code error,
                                          void *out) { *static_cast<int *>(out) = error; }),
              0);
    ASSERT_TRUE(run_until([&] { return code >= 0; }));
    EXPECT_EQ(code, *path == '\0' ? BACKUP_TRANS_ERROR_NOT_INITIALIZED : 0) << url;
    backup_trans_deinit();
  }
}

}  // namespace
