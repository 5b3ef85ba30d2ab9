/**
 * @file installer.h
 * @brief The installer's work on the files of packages, whose applications may be working there.
 *
 * Whatever is new is made in a folder of root's own, with owner, mode and label,
 * and then moved to its place in one step, which replaces nothing. What an
 * application has is entered by descriptors and only where it is the
 * application's: no name of its is ever followed to a place of somebody else's.
 */
#ifndef QUARN_DEVICE_INSTALLER_H
#define QUARN_DEVICE_INSTALLER_H

#include <string>

#include "device.h"

/** Held by whoever holds the installer's lock. Failures are thrown as Failure. */
class Installer {
 public:
  /** Empties what an installer that was killed has left. */
  explicit Installer(const std::string &device);
  /** Leaves nothing of the work behind, or it stays for the next one. */
  ~Installer();
  Installer(const Installer &) = delete;
  Installer &operator=(const Installer &) = delete;

  /**
   * The files of a package that is not installed, in one step: all or none.
   * @param source folder with the package's files, of whoever runs the tool
   * @param id the package's, which is its label as well
   */
  void install(const std::string &source, const std::string &id);
  /** Replace res/, and add what the data folders lack; what they have stays as it is. */
  void update(const std::string &source, const std::string &id);
  /** Take a package's files away, in one step, and delete them. No files: fine. */
  void remove(const std::string &id);

 private:
  std::string fresh_name();
  /** Make a copy of @p from in the own folder. @return its name there */
  std::string stage(const std::string &from, const std::string &label);
  void add_missing(int to, const std::string &name, const std::string &from,
                   const std::string &label, const std::string &shown);
  void add_entries(int to, const std::string &from, const std::string &label,
                   const std::string &shown);
  void make_missing_folder(int to, const char *name, const std::string &label,
                           const std::string &shown);
  void replace_resources(int root, const std::string &source, const std::string &label);
  /** False when there is something of the name already. */
  bool move_in(const std::string &staged, int to, const char *name, const std::string &shown);
  /** False when there is nothing of the name. */
  bool move_out(int from, const char *name, const std::string &shown);
  /** Delete everything in the own folder; fails when that cannot be done. */
  void empty();
  /** Delete what lies in a folder of the own folder, or move it up. False when nothing was. */
  bool bring_up(const std::string &name);

  std::string path_;
  Fd parent_;
  Fd apps_;
  Fd own_;
  unsigned int names_ = 0;
};

#endif
