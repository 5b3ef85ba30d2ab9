#include "state/labels.h"

#include <fcntl.h>
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

TEST_F(Labels, FailOnRequest) {
  dir_.file("state/faults.ini", "[faults]\nsmack_getlabel=-5\nsmack_lsetlabel=-6\n");
  char *label = nullptr;
  EXPECT_EQ(smack_getlabel(file_.c_str(), &label, SMACK_LABEL_ACCESS), -5);
  EXPECT_EQ(smack_lsetlabel(file_.c_str(), "a", SMACK_LABEL_ACCESS), -6);
  EXPECT_EQ(get(file_, true), "_");
  EXPECT_EQ(smack_setlabel(file_.c_str(), "a", SMACK_LABEL_ACCESS), 0);
}

}  // namespace
