/**
 * @file package_files.h
 * @brief The name of every file and folder of a package that the system knows, in one place.
 *
 * Names only: nothing is looked at or made. Any thread.
 */
#ifndef QUARN_PACKAGE_FILES_H
#define QUARN_PACKAGE_FILES_H

#include <array>
#include <string>

/** The folders of a package's data below its root, in the order in which they are visited. */
inline constexpr std::array<const char *, 3> kDataDirs = {"data", "shared/data", "shared/trusted"};
/** The one of them that the daemon's own files for the package lie in. */
inline constexpr char kSharedDataDir[] = "shared/data";

/** True when an id may name a file or folder: not empty, not "." or "..", no "/", no NUL. */
[[nodiscard]] bool is_safe_path_component(const std::string &text);

/** The rules file of a package below its root; static. @param type the package's, as "tpk" */
[[nodiscard]] const char *rules_file_of(const std::string &type);
/** Where the other types have theirs; static. */
[[nodiscard]] const char *rules_file_of_others(const std::string &type);

/**
 * True for the name of a file that the transport makes beside a download where the file system has
 * no nameless ones, and that the daemon makes so.
 */
[[nodiscard]] bool is_part_name(const char *name);

/** The table of one package below its root, and as the last entry of its archive. */
[[nodiscard]] std::string archived_table_name(const std::string &pkg_id);

/** The folder of a package in the cloud, and that of one of its versions. */
[[nodiscard]] std::string cloud_package_folder(const std::string &serial,
                                               const std::string &pkg_id);
[[nodiscard]] std::string cloud_version_folder(const std::string &serial, const std::string &pkg_id,
                                               const std::string &version);
/** A package's archive in the cloud. */
[[nodiscard]] std::string cloud_archive(const std::string &serial, const std::string &pkg_id,
                                        const std::string &version);

/** Where a package's archive is exported to. */
[[nodiscard]] std::string exported_archive(const std::string &pkg_id);

/** The companion's folder, where what is for it lies and what comes from it; a slash at its end. */
[[nodiscard]] std::string companion_folder();
/** A package's archive in that folder. */
[[nodiscard]] std::string companion_archive_name(const std::string &pkg_id,
                                                 const std::string &version);
/** The list of what the companion has. */
[[nodiscard]] std::string companion_list();

/** The paths of one package, id and root together. */
class package_files {
 public:
  /** @param root absolute, no slash at its end */
  package_files(const std::string &pkg_id, const std::string &root);

  /** The folders of its data, as kDataDirs. */
  std::array<std::string, kDataDirs.size()> data_dirs() const;

  /** Where all of the daemon's files for it lie. */
  const std::string &folder() const { return folder_; }
  /** The archive that is to be uploaded, and where it is staged whose name an application has. */
  const std::string &upload() const { return upload_; }
  std::string upload_aside() const { return snapshot_ + "." + id_ + "_upload.zip"; }
  /** The archive that is downloaded, and where to when the application has that name. */
  const std::string &download() const { return download_; }
  std::string download_aside() const { return snapshot_ + "." + id_ + "_download.zip"; }
  /** The table on its way out of an archive; the application's own may have the name. */
  std::string table() const;
  /** Everything of ours that is not an archive begins with this, the snapshot as a rule. */
  const std::string &snapshot() const { return snapshot_; }
  /** The snapshot where the application has a file of that name. */
  std::string snapshot_beside() const { return snapshot_ + ".snapshot"; }
  /** Says that a restore has not brought the data back yet; outlives the process. */
  std::string owed() const { return snapshot_ + ".owed"; }
  /** A snapshot that counts no more, but is kept, while a further restore runs and after it. */
  std::string snapshot_aside() const { return snapshot_ + ".kept"; }
  /** Holds the application's own file of the table's name. */
  std::string table_aside() const { return snapshot_ + ".table"; }
  /** Lies there while the package's icon is hidden. */
  std::string hidden_icon() const { return snapshot_ + ".icon"; }
  /** Lies there while what nothing would undo is unpacked. */
  std::string unpacking() const { return snapshot_ + ".unpacking"; }

  /** True for an archive in transit. */
  bool is_archive(const std::string &path) const { return path == upload_ || path == download_; }
  /** True for both archives and for every path that begins with the snapshot's. */
  bool names(const std::string &path) const {
    return path.compare(0, snapshot_.size(), snapshot_) == 0 || is_archive(path);
  }

 private:
  std::string id_;
  std::string root_;
  std::string folder_;
  std::string upload_;
  std::string download_;
  std::string snapshot_;
};

/** The parts of a snapshot, in the folder @p snapshot. */
struct snapshot_files {
  snapshot_files(const std::string &pkg_id, const std::string &snapshot);

  std::string table;            /**< written last: a snapshot that has it is complete */
  std::string unfinished_table; /**< the same before it is whole */
  std::string stamps;           /**< which files there were, and which copies of them */
  std::string unpacked;         /**< which files the restore has unpacked */
  std::string told;             /**< the table of a snapshot that counts no more, but is kept */
};

#endif
