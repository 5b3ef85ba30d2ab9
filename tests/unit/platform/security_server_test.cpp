#include "platform_security_server.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "device_fixture.h"
#include "label_helpers.h"
#include "state/labels.h"

namespace {

constexpr char kPackage[] = "org.example.notes";
constexpr int kPathType = SECURITY_SERVER_PATH_ANY_LABEL;

class SecurityServer : public DeviceTest {
 protected:
  SecurityServer() : privileged_(may_write_kernel_labels(dir_.file("scratch", ""))) {
    dir_.file("tree/data/file", "");
    dir_.file("tree/data/deep/er/file", "");
    dir_.file("outside/file", "");
    dir_.link("tree/data/link", "../../outside/file");
    dir_.link("tree/data/folder", "../../outside");
    EXPECT_EQ(mkfifo((dir_ / "tree/data/fifo").c_str(), 0600), 0);
  }
  std::string label(const std::string &name) const {
    std::string text;
    return embedded::read_label((dir_ / name).c_str(), embedded::Links::kKeep,
                                embedded::LabelKind::kAccess, &text) == 0
               ? text
               : "error";
  }
  int relabel(const std::string &path, const char *to = "new") const {
    security_server_perm_h handle = nullptr;
    EXPECT_EQ(security_server_perm_begin(&handle), SECURITY_SERVER_SUCCESS);
    EXPECT_EQ(security_server_perm_app_setup_path(handle, kPackage, path.c_str(), kPathType, to),
              SECURITY_SERVER_SUCCESS);
    EXPECT_EQ(label("tree/data/file"), "_");
    return security_server_perm_commit(handle);
  }

  bool privileged_;
};

TEST_F(SecurityServer, LabelsADirectoryAndEverythingBelowAtTheCommit) {
  EXPECT_EQ(relabel(dir_ / "tree/data"), SECURITY_SERVER_SUCCESS);
  for (const char *name : {"tree/data", "tree/data/file", "tree/data/deep", "tree/data/deep/er",
                           "tree/data/deep/er/file"}) {
    EXPECT_EQ(label(name), "new") << name;
  }
  for (const char *name : {"tree/data/link", "tree/data/folder", "tree/data/fifo"}) {
    EXPECT_EQ(label(name), privileged_ ? "new" : "_") << name;
  }
  EXPECT_EQ(label("tree"), "_");
  EXPECT_EQ(label("outside"), "_");
  EXPECT_EQ(label("outside/file"), "_");
}

TEST_F(SecurityServer, PassesOverWhatCannotHaveALabelInAContainer) {
  const WithoutSysAdmin contained;
  EXPECT_EQ(relabel(dir_ / "tree/data"), SECURITY_SERVER_SUCCESS);
  EXPECT_EQ(label("tree/data/deep/er/file"), "new");
  EXPECT_EQ(label("tree/data/link"), "_");
  EXPECT_EQ(label("tree/data/fifo"), "_");
  EXPECT_EQ(label("outside/file"), "_");
}

TEST_F(SecurityServer, FollowsTheNameOfADescriptor) {
  const int fd = open((dir_ / "tree/data").c_str(), O_PATH | O_DIRECTORY | O_CLOEXEC);
  ASSERT_GE(fd, 0);
  const std::string name = "/proc/" + std::to_string(getpid()) + "/fd/" + std::to_string(fd);
  EXPECT_EQ(relabel(name), SECURITY_SERVER_SUCCESS);
  EXPECT_EQ(label("tree/data/deep/er/file"), "new");
  EXPECT_EQ(security_server_label_access(name.c_str(), "newer"), SECURITY_SERVER_SUCCESS);
  EXPECT_EQ(label("tree/data"), "newer");
  close(fd);
}

TEST_F(SecurityServer, LeavesOutWhatOnlyRootMayEnter) {
  dir_.file("tree/data/deep/own/file", "");
  ASSERT_EQ(chmod((dir_ / "tree/data/deep/own").c_str(), 0700), 0);
  dir_.file("tree/data/deep/app/file", "");
  ASSERT_EQ(chmod((dir_ / "tree/data/deep/app").c_str(), 0700), 0);
  for (const char *name : {"tree/data/deep/app", "tree/data/deep/app/file"}) {
    ASSERT_EQ(chown((dir_ / name).c_str(), 5000, 5000), 0);
  }
  ASSERT_EQ(chmod((dir_ / "tree/data").c_str(), 0700), 0);  // what was asked for is labelled
  EXPECT_EQ(relabel(dir_ / "tree/data"), SECURITY_SERVER_SUCCESS);
  EXPECT_EQ(label("tree/data"), "new");
  EXPECT_EQ(label("tree/data/deep/own"), "_");
  EXPECT_EQ(label("tree/data/deep/own/file"), "_");
  EXPECT_EQ(label("tree/data/deep/app"), "new");
  EXPECT_EQ(label("tree/data/deep/app/file"), "new");
}

TEST_F(SecurityServer, LeavesOutSecondNamesOfOthersFiles) {
  const auto own = [this](const char *name) {
    ASSERT_EQ(lchown((dir_ / name).c_str(), 5000, 5000), 0);
  };
  for (const char *name : {"tree/data", "tree/data/file", "tree/data/deep"}) own(name);
  dir_.file("outside/secret", "");
  dir_.file("tree/data/mine", "");
  own("tree/data/mine");
  ASSERT_EQ(link((dir_ / "outside/secret").c_str(), (dir_ / "tree/data/second").c_str()), 0);
  ASSERT_EQ(link((dir_ / "tree/data/mine").c_str(), (dir_ / "tree/data/deep/again").c_str()), 0);
  dir_.file("tree/data/last", "");  // whose other name is gone
  dir_.file("tree/data/service/file", "");
  EXPECT_EQ(relabel(dir_ / "tree/data"), SECURITY_SERVER_SUCCESS);
  EXPECT_EQ(label("outside/secret"), "_");
  EXPECT_EQ(label("tree/data/last"), "_");
  EXPECT_EQ(label("tree/data/mine"), "new");
  EXPECT_EQ(label("tree/data/deep/again"), "new");
  EXPECT_EQ(label("tree/data/service/file"), "new") << "the application cannot have put it there";
}

TEST_F(SecurityServer, WhoOwnsTheFolderOfAnObjectCountsNotWhoOwnsWhatWasNamed) {
  const auto own = [this](const char *name, uid_t owner) {
    ASSERT_EQ(lchown((dir_ / name).c_str(), owner, owner), 0);
  };
  // a folder of root's that holds the application's, and one that others may fill
  for (const char *name : {"roots", "service"}) dir_.file(std::string("outside/") + name, "");
  own("outside/service", 1234);
  dir_.file("tree/data/app/mine", "");
  dir_.file("tree/data/app/left", "");
  dir_.file("tree/data/open/left", "");
  own("tree/data/app/mine", 5000);
  own("tree/data/app", 5000);
  ASSERT_EQ(chmod((dir_ / "tree/data/open").c_str(), 01777), 0);
  for (const char *name : {"roots", "service"}) {
    const std::string there = dir_ / (std::string("outside/") + name);
    for (const char *folder : {"tree/data/app/", "tree/data/open/"}) {
      ASSERT_EQ(link(there.c_str(), (dir_ / (std::string(folder) + name)).c_str()), 0);
    }
  }
  EXPECT_EQ(relabel(dir_ / "tree/data"), SECURITY_SERVER_SUCCESS);
  for (const char *name :
       {"outside/roots", "outside/service", "tree/data/app/left", "tree/data/open/left"}) {
    EXPECT_EQ(label(name), "_") << name;
  }
  for (const char *name : {"tree/data/app", "tree/data/app/mine", "tree/data/file"}) {
    EXPECT_EQ(label(name), "new") << name;
  }
}

TEST_F(SecurityServer, LabelsNoObjectThroughALink) {
  ASSERT_EQ(link((dir_ / "outside/file").c_str(), (dir_ / "tree/data/second").c_str()), 0);
  for (const char *name : {"tree/data/link", "tree/data/folder/file", "tree/data/second"}) {
    EXPECT_EQ(security_server_label_access((dir_ / name).c_str(), "one"),
              SECURITY_SERVER_ERROR_SERVER)
        << name;
  }
  EXPECT_EQ(label("outside/file"), "_");
}

TEST_F(SecurityServer, FollowsNoLinkInAPath) {
  dir_.link("way", "tree");
  EXPECT_EQ(relabel(dir_ / "tree/data/folder"), SECURITY_SERVER_ERROR_SERVER);
  EXPECT_EQ(relabel(dir_ / "way/data"), SECURITY_SERVER_ERROR_SERVER);
  EXPECT_EQ(label("tree/data/file"), "_");
  EXPECT_EQ(label("outside/file"), "_");
}

TEST_F(SecurityServer, FailsForWhatIsMissingOrNoDirectory) {
  EXPECT_EQ(relabel(dir_ / "missing"), SECURITY_SERVER_ERROR_SERVER);
  EXPECT_EQ(relabel(dir_ / "tree/data/file"), SECURITY_SERVER_ERROR_SERVER);
  EXPECT_EQ(relabel("/opt/usr/apps/org.example.not-there/data"), SECURITY_SERVER_ERROR_SERVER);
}

TEST_F(SecurityServer, ChangesNothingWhenATransactionIsGivenUp) {
  security_server_perm_h handle = nullptr;
  ASSERT_EQ(security_server_perm_begin(&handle), SECURITY_SERVER_SUCCESS);
  ASSERT_EQ(security_server_perm_app_setup_path(handle, kPackage, (dir_ / "tree/data").c_str(),
                                                kPathType, "new"),
            SECURITY_SERVER_SUCCESS);
  security_server_perm_abort(handle);
  security_server_perm_abort(nullptr);
  EXPECT_EQ(label("tree/data"), "_");
}

TEST_F(SecurityServer, LabelsOneObject) {
  const std::string file = dir_ / "tree/data/file";
  EXPECT_EQ(security_server_label_access(file.c_str(), "one"), SECURITY_SERVER_SUCCESS);
  EXPECT_EQ(label("tree/data/file"), "one");
  EXPECT_EQ(security_server_label_access((dir_ / "missing").c_str(), "one"),
            SECURITY_SERVER_ERROR_SERVER);
}

TEST_F(SecurityServer, RefusesBadParameters) {
  const std::string path = dir_ / "tree/data";
  security_server_perm_h handle = nullptr;
  ASSERT_EQ(security_server_perm_begin(&handle), SECURITY_SERVER_SUCCESS);
  constexpr int kBad = SECURITY_SERVER_ERROR_INPUT_PARAM;
  EXPECT_EQ(security_server_perm_begin(nullptr), kBad);
  EXPECT_EQ(security_server_perm_app_setup_path(nullptr, kPackage, path.c_str(), kPathType, "a"),
            kBad);
  EXPECT_EQ(security_server_perm_app_setup_path(handle, nullptr, path.c_str(), kPathType, "a"),
            kBad);
  EXPECT_EQ(security_server_perm_app_setup_path(handle, kPackage, nullptr, kPathType, "a"), kBad);
  EXPECT_EQ(security_server_perm_app_setup_path(handle, kPackage, path.c_str(), 0, "a"), kBad);
  EXPECT_EQ(security_server_perm_app_setup_path(handle, kPackage, path.c_str(), kPathType, ""),
            kBad);
  EXPECT_EQ(security_server_perm_app_setup_path(handle, kPackage, path.c_str(), kPathType,
                                                static_cast<const char *>(nullptr)),
            kBad);
  EXPECT_EQ(security_server_perm_commit(handle), SECURITY_SERVER_SUCCESS);
  EXPECT_EQ(security_server_perm_commit(nullptr), kBad);
  EXPECT_EQ(security_server_label_access(nullptr, "a"), kBad);
  EXPECT_EQ(security_server_label_access(path.c_str(), nullptr), kBad);
  EXPECT_EQ(label("tree/data"), "_");
}

TEST_F(SecurityServer, FailsOnRequest) {
  const std::string faults = dir_ / "state/faults.ini";
  const std::string path = dir_ / "tree/data";
  security_server_perm_h handle = nullptr;
  dir_.file("state/faults.ini", "[faults]\nsecurity_server_perm_begin=-7\n");
  EXPECT_EQ(security_server_perm_begin(&handle), -7);
  dir_.file("state/faults.ini", "[faults]\nsecurity_server_label_access=-8\n");
  EXPECT_EQ(security_server_label_access(path.c_str(), "a"), -8);
  ASSERT_EQ(security_server_perm_begin(&handle), SECURITY_SERVER_SUCCESS);
  dir_.file("state/faults.ini", "[faults]\nsecurity_server_perm_app_setup_path=-9\n");
  EXPECT_EQ(security_server_perm_app_setup_path(handle, kPackage, path.c_str(), kPathType, "a"),
            -9);
  std::filesystem::remove(faults);
  ASSERT_EQ(security_server_perm_app_setup_path(handle, kPackage, path.c_str(), kPathType, "a"),
            SECURITY_SERVER_SUCCESS);
  dir_.file("state/faults.ini", "[faults]\nsecurity_server_perm_commit=-10\n");
  EXPECT_EQ(security_server_perm_commit(handle), -10);
  EXPECT_EQ(label("tree/data"), "_");
}

}  // namespace
