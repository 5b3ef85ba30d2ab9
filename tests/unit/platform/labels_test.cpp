#include "state/labels.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <memory>

#include "device_fixture.h"
#include "label_helpers.h"
#include "platform_smack.h"

namespace {

struct Free {
  void operator()(char *text) const { std::free(text); }
};
using Text = std::unique_ptr<char, Free>;

class Labels : public DeviceTest {
 protected:
  Labels()
      : file_(dir_.file("tree/file", "")),
        link_(dir_.link("tree/link", "file")),
        privileged_(may_write_kernel_labels(dir_.file("scratch", ""))) {}

  static std::string get(const std::string &path, bool link = false,
                         smack_label_type type = SMACK_LABEL_ACCESS) {
    char *label = nullptr;
    const auto read = link ? smack_lgetlabel : smack_getlabel;
    return read(path.c_str(), &label, type) == 0 ? Text(label).get() : "error";
  }
  const char *attribute() const { return privileged_ ? kKernelAttribute : kUserAttribute; }

  std::string file_;
  std::string link_;
  bool privileged_;
};

TEST_F(Labels, AreTheFloorWhereThereIsNone) {
  EXPECT_EQ(get(file_), "_");
  EXPECT_EQ(get(link_, true), "_");
  char *label = nullptr;
  for (const auto type : {SMACK_LABEL_EXEC, SMACK_LABEL_MMAP}) {
    EXPECT_EQ(smack_getlabel(file_.c_str(), &label, type), -1);
    EXPECT_EQ(errno, ENODATA);
  }
}

TEST_F(Labels, AreKeptInAnExtendedAttribute) {
  EXPECT_EQ(smack_setlabel(file_.c_str(), "org.example", SMACK_LABEL_ACCESS), 0);
  EXPECT_EQ(attribute_of(file_, attribute()), "org.example");
  EXPECT_EQ(get(file_), "org.example");
  EXPECT_EQ(smack_setlabel(file_.c_str(), "o", SMACK_LABEL_ACCESS), 0);
  EXPECT_EQ(get(file_), "o");
}

TEST_F(Labels, OfEachKindAreTheirOwn) {
  EXPECT_EQ(smack_setlabel(file_.c_str(), "a", SMACK_LABEL_ACCESS), 0);
  EXPECT_EQ(smack_setlabel(file_.c_str(), "e", SMACK_LABEL_EXEC), 0);
  EXPECT_EQ(smack_setlabel(file_.c_str(), "m", SMACK_LABEL_MMAP), 0);
  EXPECT_EQ(get(file_), "a");
  EXPECT_EQ(get(file_, false, SMACK_LABEL_EXEC), "e");
  EXPECT_EQ(get(file_, false, SMACK_LABEL_MMAP), "m");
}

TEST_F(Labels, OfWhatIsOpenAreReadByItsDescriptorsName) {
  EXPECT_EQ(smack_setlabel(file_.c_str(), "org.example", SMACK_LABEL_ACCESS), 0);
  for (const int flags : {O_RDONLY, O_PATH}) {
    const int fd = open(file_.c_str(), flags | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    const std::string number = std::to_string(fd);
    const std::string own = "/proc/self/fd/";
    EXPECT_EQ(get(own + number), "org.example");
    // once the first one had a label, what has none is asked differently
    EXPECT_EQ(get(dir_.file("tree/bare", "")), "_");
    EXPECT_EQ(get(own + number), "org.example");
    EXPECT_EQ(get("/proc/thread-self/fd/" + number), "org.example");
    EXPECT_EQ(get(own), "_");
    for (const std::string &other : {own + number + "x", own + number + "/x", own + "x"}) {
      EXPECT_EQ(get(other), "error") << other;
    }
    close(fd);
    EXPECT_EQ(get(own + number), "error");
  }
}

TEST_F(Labels, FollowLinksOrDoNot) {
  EXPECT_EQ(smack_setlabel(link_.c_str(), "target", SMACK_LABEL_ACCESS), 0);
  EXPECT_EQ(get(file_), "target");
  EXPECT_EQ(get(link_, true), "_");
  EXPECT_EQ(smack_lsetlabel(link_.c_str(), "link", SMACK_LABEL_ACCESS), privileged_ ? 0 : -1);
  EXPECT_EQ(get(link_, true), privileged_ ? "link" : "_");
  EXPECT_EQ(get(link_), "target");
}

TEST_F(Labels, AreUserAttributesWhereTheKernelsMayNotBeWritten) {
  const WithoutSysAdmin contained;
  EXPECT_EQ(smack_setlabel(file_.c_str(), "org.example", SMACK_LABEL_ACCESS), 0);
  EXPECT_EQ(attribute_of(file_, kKernelAttribute), "");
  EXPECT_EQ(attribute_of(file_, kUserAttribute), "org.example");
  EXPECT_EQ(get(file_), "org.example");
}

TEST_F(Labels, OfALinkStayTheFloorWhereTheyAreUserAttributes) {
  const WithoutSysAdmin contained;
  EXPECT_EQ(smack_lsetlabel(link_.c_str(), "_", SMACK_LABEL_ACCESS), 0);
  EXPECT_EQ(smack_lsetlabel(link_.c_str(), "other", SMACK_LABEL_ACCESS), -1);
  EXPECT_EQ(errno, EPERM);
  EXPECT_EQ(get(link_, true), "_");
}

TEST_F(Labels, ThatTheKernelGuardsAreNotHiddenByUserAttributes) {
  if (!privileged_) {
    EXPECT_EQ(smack_setlabel(file_.c_str(), "user", SMACK_LABEL_ACCESS), 0);
    EXPECT_EQ(get(file_), "user");
    return;
  }
  ASSERT_EQ(smack_setlabel(file_.c_str(), "kernel", SMACK_LABEL_ACCESS), 0);
  const WithoutSysAdmin contained;
  EXPECT_EQ(smack_setlabel(file_.c_str(), "user", SMACK_LABEL_ACCESS), -1);
  EXPECT_EQ(errno, EPERM);
  EXPECT_EQ(smack_setlabel(file_.c_str(), "kernel", SMACK_LABEL_ACCESS), 0);
  EXPECT_EQ(get(file_), "kernel");
}

TEST_F(Labels, ThatCannotBeOnesAreRefused) {
  for (const std::string &label :
       {std::string(), std::string("-x"), std::string("a b"), std::string("a/b"),
        std::string("a\"b"), std::string("a'b"), std::string("a\\b"), std::string("\x80"),
        std::string(SMACK_LABEL_LEN + 1, 'x')}) {
    EXPECT_EQ(smack_setlabel(file_.c_str(), label.c_str(), SMACK_LABEL_ACCESS), -1) << label;
    EXPECT_EQ(errno, EINVAL);
  }
  const std::string longest(SMACK_LABEL_LEN, 'x');
  EXPECT_EQ(smack_setlabel(file_.c_str(), longest.c_str(), SMACK_LABEL_ACCESS), 0);
  EXPECT_EQ(get(file_), longest);
}

TEST_F(Labels, OfWhatIsNotThereAreAnError) {
  char *label = nullptr;
  const std::string missing = dir_ / "missing";
  EXPECT_EQ(smack_getlabel(missing.c_str(), &label, SMACK_LABEL_ACCESS), -1);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_EQ(smack_setlabel(missing.c_str(), "a", SMACK_LABEL_ACCESS), -1);
  EXPECT_EQ(errno, ENOENT);
  EXPECT_EQ(smack_getlabel(nullptr, &label, SMACK_LABEL_ACCESS), -1);
  EXPECT_EQ(smack_getlabel(file_.c_str(), nullptr, SMACK_LABEL_ACCESS), -1);
  EXPECT_EQ(smack_lsetlabel(nullptr, "a", SMACK_LABEL_ACCESS), -1);
  EXPECT_EQ(smack_lsetlabel(file_.c_str(), nullptr, SMACK_LABEL_ACCESS), -1);
  EXPECT_EQ(errno, EINVAL);
}

/** What an application makes has no attribute; the device is the process's own. */
class MadeByAnApplication : public Labels {
 protected:
  MadeByAnApplication() {
    file_ = dir_.file("root/opt/usr/apps/org.example.notes/data/new/note", "");
    link_ = dir_.link("root/opt/usr/apps/org.example.notes/data/link", "new/note");
  }
  std::string below(const char *path) const {
    return dir_ / ("root/opt/usr/apps/" + std::string(path));
  }
};

TEST_F(MadeByAnApplication, ItHasItsPackagesLabel) {
  EXPECT_EQ(get(file_), "org.example.notes");
  EXPECT_EQ(get(file_, true), "org.example.notes");
  EXPECT_EQ(get(below("org.example.notes/data/new")), "org.example.notes");
  EXPECT_EQ(get(below("org.example.notes/data")), "org.example.notes");
  EXPECT_EQ(get(link_), "org.example.notes");
  EXPECT_EQ(get(link_, true), privileged_ ? "org.example.notes" : "_");
  const std::string fifo = below("org.example.notes/data/fifo");
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  EXPECT_EQ(get(fifo), privileged_ ? "org.example.notes" : "_");
  EXPECT_EQ(attribute_of(file_, attribute()), "") << "reading writes nothing";
  EXPECT_EQ(attribute_of(link_, attribute()), "");
}

TEST_F(MadeByAnApplication, ItHasNoLabelOfTheOtherKinds) {
  char *label = nullptr;
  for (const auto type : {SMACK_LABEL_EXEC, SMACK_LABEL_MMAP}) {
    EXPECT_EQ(smack_getlabel(file_.c_str(), &label, type), -1);
    EXPECT_EQ(errno, ENODATA);
  }
}

TEST_F(MadeByAnApplication, TheWayToItDoesNotMatter) {
  const std::string own = "/proc/self/fd/";
  for (const int flags : {O_RDONLY, O_PATH}) {
    const int fd = open(file_.c_str(), flags | O_CLOEXEC);
    ASSERT_GE(fd, 0);
    EXPECT_EQ(get(own + std::to_string(fd)), "org.example.notes");
    close(fd);
  }
  const int folder = open(below("org.example.notes/data").c_str(), O_PATH | O_CLOEXEC);
  ASSERT_GE(folder, 0);
  const std::string relative = own + std::to_string(folder) + "/";
  EXPECT_EQ(get(relative + "new/note"), "org.example.notes");
  EXPECT_EQ(get(relative + "link", true), privileged_ ? "org.example.notes" : "_");
  close(folder);
  const std::string elsewhere = dir_.link("alias", file_);
  EXPECT_EQ(get(elsewhere), "org.example.notes") << "what it is counts, not what leads to it";
  EXPECT_EQ(get(elsewhere, true), "_");
}

TEST_F(MadeByAnApplication, WhatLiesElsewhereHasTheFloorLabel) {
  const std::string outside = dir_.file("outside", "");
  const std::string loose = dir_.file("root/opt/usr/apps/loose", "");
  const std::string beside = dir_.file("root/opt/usr/appsx/org.example.notes/data/file", "");
  const std::string out = dir_.link("root/opt/usr/apps/org.example.notes/data/out", outside);
  for (const std::string &path : {outside, loose, beside, out, below("org.example.notes/../loose"),
                                  below("org.example.notes")}) {
    EXPECT_EQ(get(path), "_") << path;
  }
  const std::string odd = dir_.file("root/opt/usr/apps/no label/data/file", "");
  EXPECT_EQ(get(odd), "_") << "an id that cannot be a label";
  leave_device();
  EXPECT_EQ(get(file_), "_") << "no package of this process's device";
}

TEST_F(MadeByAnApplication, ALabelThatItWasGivenCounts) {
  EXPECT_EQ(smack_setlabel(file_.c_str(), "other", SMACK_LABEL_ACCESS), 0);
  EXPECT_EQ(get(file_), "other");
  EXPECT_EQ(smack_setlabel(file_.c_str(), "_", SMACK_LABEL_ACCESS), 0);
  EXPECT_EQ(get(file_), "_");
}

TEST_F(MadeByAnApplication, ALinkHasTheFloorLabelWhereLabelsAreUserAttributes) {
  const WithoutSysAdmin contained;
  EXPECT_EQ(get(file_), "org.example.notes");
  EXPECT_EQ(get(below("org.example.notes/data/new")), "org.example.notes");
  EXPECT_EQ(get(link_, true), "_");
  EXPECT_EQ(get(link_), "org.example.notes");
}

TEST_F(Labels, FailOnRequest) {
  dir_.file("state/faults.ini", "[faults]\nsmack_getlabel=-5\nsmack_lsetlabel=-6\n");
  char *label = nullptr;
  EXPECT_EQ(smack_getlabel(file_.c_str(), &label, SMACK_LABEL_ACCESS), -5);
  EXPECT_EQ(smack_lsetlabel(file_.c_str(), "a", SMACK_LABEL_ACCESS), -6);
  EXPECT_EQ(get(file_, true), "_");
  EXPECT_EQ(smack_setlabel(file_.c_str(), "a", SMACK_LABEL_ACCESS), 0);
}

}  // namespace
