#include "installer.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <vector>

#include "files/package_files.h"
#include "state/labels.h"

namespace {

namespace fs = std::filesystem;

constexpr uid_t kAppUser = 5000;
constexpr gid_t kAppGroup = 5000;
constexpr mode_t kModeBits = 07777;
constexpr mode_t kFolderMode = 0755;
constexpr mode_t kOwnFolderMode = 0700;
constexpr int kFolderFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;
/** Beside the applications' folder, on its file system. */
constexpr char kParent[] = "root/opt/usr";
constexpr char kApps[] = "apps";
constexpr char kOwnFolder[] = ".installer";
/** How often what an application keeps changing is tried again. */
constexpr int kTries = 1000;
/** More than a tree of any use is deep. */
constexpr int kMaxRounds = 1000000;

[[noreturn]] void fail(const char *what, const std::string &path) {
  throw Failure(std::string("cannot ") + what + " " + path + ": " + reason());
}

/** Owner, mode and label of an object in the own folder; a link has no mode of its own. */
void dress(const fs::path &path, mode_t mode, bool link, const std::string &label) {
  if (lchown(path.c_str(), kAppUser, kAppGroup) != 0) {
    throw Failure("cannot give " + path.string() + " to the application: " + reason());
  }
  // After the owner: a change of owner takes set-id bits away.
  if (!link && chmod(path.c_str(), mode & kModeBits) != 0) fail("set the mode of", path);
  if (embedded::write_label(path.c_str(), embedded::Links::kKeep, embedded::LabelKind::kAccess,
                            label) != 0 &&
      !link) {
    fail("label", path);
  }
}

/** Into the own folder, where nobody else works. */
void copy_tree(const fs::path &from, const fs::path &to, const std::string &label) {
  struct stat source {};
  if (lstat(from.c_str(), &source) != 0) fail("read", from);
  const bool link = S_ISLNK(source.st_mode);
  std::error_code error;
  if (S_ISDIR(source.st_mode)) {
    if (mkdir(to.c_str(), kOwnFolderMode) != 0) fail("make", to);
    for (const fs::directory_entry &entry : fs::directory_iterator(from)) {
      copy_tree(entry.path(), to / entry.path().filename(), label);
    }
  } else if (link) {
    fs::copy_symlink(from, to, error);
  } else if (S_ISREG(source.st_mode)) {
    fs::copy_file(from, to, error);
  } else {
    throw Failure(from.string() + " is neither file, directory nor link");
  }
  if (error) throw Failure("cannot make " + to.string() + ": " + error.message());
  dress(to, source.st_mode, link, label);
}

std::vector<std::string> names_in(int folder) {
  std::vector<std::string> names;
  const int own = openat(folder, ".", kFolderFlags);
  DIR *dir = own < 0 ? nullptr : fdopendir(own);
  if (dir == nullptr) {
    if (own >= 0) close(own);
    return names;
  }
  while (const dirent *entry = readdir(dir)) {
    if (std::strcmp(entry->d_name, ".") != 0 && std::strcmp(entry->d_name, "..") != 0) {
      names.emplace_back(entry->d_name);
    }
  }
  closedir(dir);
  return names;
}

/** A folder that nobody but this user can enter; -1 with errno. */
int open_own_folder(int parent) {
  if (mkdirat(parent, kOwnFolder, kOwnFolderMode) != 0 && errno != EEXIST) return -1;
  return openat(parent, kOwnFolder, kFolderFlags);
}

bool is_applications_folder(int fd) {
  struct stat status {};
  return fstat(fd, &status) == 0 && status.st_uid == kAppUser;
}

int open_applications_folder(int at, const char *name, const std::string &shown) {
  const int fd = openat(at, name, kFolderFlags);
  if (fd < 0 && (errno == ENOTDIR || errno == ELOOP)) throw Failure(shown + " is no directory");
  if (fd < 0) fail("open", shown);
  if (!is_applications_folder(fd)) {
    close(fd);
    throw Failure(shown + " is not the application's");
  }
  return fd;
}

}  // namespace

Installer::Installer(const std::string &device)
    : path_(device + "/" + kParent + "/" + kOwnFolder),
      parent_(open((device + "/" + kParent).c_str(), kFolderFlags)),
      apps_(openat(parent_.fd, kApps, kFolderFlags)),
      own_(open_own_folder(parent_.fd)) {
  if (apps_.fd < 0 || own_.fd < 0) fail("open", path_);
  struct stat status {};
  if (fstat(own_.fd, &status) != 0 || status.st_uid != geteuid() ||
      (status.st_mode & (S_IRWXG | S_IRWXO)) != 0) {
    throw Failure(path_ + " is not the installer's own");
  }
  empty();
}

Installer::~Installer() {
  try {
    empty();
  } catch (const Failure &) {
    return;
  }
  unlinkat(parent_.fd, kOwnFolder, AT_REMOVEDIR);
}

void Installer::install(const std::string &source, const std::string &id) {
  const std::string staged = fresh_name();
  const fs::path root = path_ + "/" + staged;
  const auto make_folder = [&](const fs::path &path) {
    if (mkdir(path.c_str(), kOwnFolderMode) != 0) fail("make", path);
  };
  make_folder(root);
  make_folder(root / "shared");
  for (const char *folder : kDataDirs) {
    const fs::path from = fs::path(source) / folder;
    if (fs::is_directory(from)) {
      // A folder of the source that is a link stands for where it leads.
      copy_tree(fs::canonical(from), root / folder, id);
    } else {
      make_folder(root / folder);
      dress(root / folder, kFolderMode, false, id);
    }
  }
  const fs::path resources = fs::path(source) / "res";
  if (fs::is_directory(resources)) copy_tree(fs::canonical(resources), root / "res", id);
  dress(root / "shared", kFolderMode, false, id);
  dress(root, kFolderMode, false, id);
  // What was left in its place by one that was killed is nobody's.
  const std::string shown = std::string(kApps) + "/" + id;
  for (int i = 0; i < kTries; ++i) {
    move_out(apps_.fd, id.c_str(), shown);
    if (move_in(staged, apps_.fd, id.c_str(), shown)) return;
  }
  throw Failure(shown + " is in the way");
}

void Installer::update(const std::string &source, const std::string &id) {
  const std::string shown = std::string(kApps) + "/" + id;
  make_missing_folder(apps_.fd, id.c_str(), id, shown);
  const Fd root(open_applications_folder(apps_.fd, id.c_str(), shown));
  make_missing_folder(root.fd, "shared", id, shown + "/shared");
  const Fd shared(open_applications_folder(root.fd, "shared", shown + "/shared"));
  for (const std::string folder : kDataDirs) {
    const bool below_shared = folder.find('/') != std::string::npos;
    const int at = below_shared ? shared.fd : root.fd;
    const std::string name = folder.substr(below_shared ? folder.find('/') + 1 : 0);
    make_missing_folder(at, name.c_str(), id, shown + "/" + folder);
    const Fd to(open_applications_folder(at, name.c_str(), shown + "/" + folder));
    const fs::path from = fs::path(source) / folder;
    if (fs::is_directory(from)) add_entries(to.fd, from, id, shown + "/" + folder);
  }
  replace_resources(root.fd, source, id);
}

void Installer::remove(const std::string &id) {
  if (move_out(apps_.fd, id.c_str(), std::string(kApps) + "/" + id)) empty();
}

std::string Installer::fresh_name() { return "p" + std::to_string(names_++); }

std::string Installer::stage(const std::string &from, const std::string &label) {
  const std::string name = fresh_name();
  copy_tree(from, path_ + "/" + name, label);
  return name;
}

void Installer::add_entries(int to, const std::string &from, const std::string &label,
                            const std::string &shown) {
  for (const fs::directory_entry &entry : fs::directory_iterator(from)) {
    const std::string name = entry.path().filename();
    add_missing(to, name, entry.path(), label, shown + "/" + name);
  }
}

void Installer::add_missing(int to, const std::string &name, const std::string &from,
                            const std::string &label, const std::string &shown) {
  struct stat present {};
  if (fstatat(to, name.c_str(), &present, AT_SYMLINK_NOFOLLOW) != 0) {
    if (errno != ENOENT) fail("look at", shown);
    // The application, or a restore, may put something there meanwhile: it stays.
    if (move_in(stage(from, label), to, name.c_str(), shown)) return;
  }
  struct stat source {};
  if (lstat(from.c_str(), &source) != 0) fail("read", from);
  if (!S_ISDIR(source.st_mode)) return;
  // Whatever else lies there, a link or a folder that is not the application's, stays as it is.
  const Fd below(openat(to, name.c_str(), kFolderFlags));
  if (below.fd >= 0 && is_applications_folder(below.fd)) {
    add_entries(below.fd, from, label, shown);
  }
}

void Installer::make_missing_folder(int to, const char *name, const std::string &label,
                                    const std::string &shown) {
  struct stat present {};
  if (fstatat(to, name, &present, AT_SYMLINK_NOFOLLOW) == 0) return;
  const std::string staged = fresh_name();
  const std::string path = path_ + "/" + staged;
  if (mkdir(path.c_str(), kOwnFolderMode) != 0) fail("make", path);
  dress(path, kFolderMode, false, label);
  move_in(staged, to, name, shown);
}

void Installer::replace_resources(int root, const std::string &source, const std::string &label) {
  const fs::path from = fs::path(source) / "res";
  const bool wanted = fs::is_directory(from);
  const std::string staged = wanted ? stage(fs::canonical(from), label) : "";
  for (int i = 0; i < kTries; ++i) {
    move_out(root, "res", "res");
    if (!wanted || move_in(staged, root, "res", "res")) return;
  }
  throw Failure("res is in the way");
}

bool Installer::move_in(const std::string &staged, int to, const char *name,
                        const std::string &shown) {
  if (renameat2(own_.fd, staged.c_str(), to, name, RENAME_NOREPLACE) == 0) return true;
  if (errno != EEXIST) fail("make", shown);
  return false;
}

bool Installer::move_out(int from, const char *name, const std::string &shown) {
  if (renameat(from, name, own_.fd, fresh_name().c_str()) == 0) return true;
  if (errno != ENOENT) fail("remove", shown);
  return false;
}

bool Installer::bring_up(const std::string &name) {
  const Fd folder(openat(own_.fd, name.c_str(), kFolderFlags));
  bool some = false;
  for (const std::string &entry : names_in(folder.fd)) {
    some = unlinkat(folder.fd, entry.c_str(), 0) == 0 ||
           unlinkat(folder.fd, entry.c_str(), AT_REMOVEDIR) == 0 ||
           (errno == ENOTEMPTY && renameat2(folder.fd, entry.c_str(), own_.fd, fresh_name().c_str(),
                                            RENAME_NOREPLACE) == 0) ||
           some;
  }
  return some;
}

void Installer::empty() {
  int error = 0;
  // An application that is still running may keep making something in what is its.
  int fruitless = 0;
  for (int round = 0; round < kMaxRounds && fruitless < kTries; ++round) {
    const std::vector<std::string> names = names_in(own_.fd);
    if (names.empty()) return;
    bool some = false;
    for (const std::string &name : names) {
      // What lies deeper comes up one by one: neither depth nor the length of paths matters.
      some = unlinkat(own_.fd, name.c_str(), 0) == 0 || bring_up(name) || some;
      if (unlinkat(own_.fd, name.c_str(), AT_REMOVEDIR) == 0) {
        some = true;
      } else if (errno != ENOENT) {
        error = errno;
      }
    }
    if (!some) ++fruitless;
  }
  throw Failure(std::string("cannot remove the package's files: ") + std::strerror(error));
}
