/**
 * @file dav_folders.h
 * @brief The folders of a WebDAV store: made as needed, remembered, and gone with their last
 * object.
 */
#ifndef BACKUP_TRANSPORT_DAV_FOLDERS_H
#define BACKUP_TRANSPORT_DAV_FOLDERS_H

#include <set>
#include <string>

#include "thread_annotations.h"
#include "webdav/dav_client.h"
#include "webdav/dav_locks.h"

namespace transport {

/** Any thread; the client and the watch outlive it. */
class DavFolders {
 public:
  DavFolders(const DavClient &client, LockWatch &locks) : client_(client), locks_(locks) {}

  /**
   * Have a folder there, and those that it lies in.
   * @param made receives the innermost one that was not there before; else stays as it is
   */
  Outcome ensure(Ticket &ticket, const std::string &folder, std::string *made);

  /** Was it seen or made, and not forgotten since? */
  [[nodiscard]] bool is_known(const std::string &folder);
  void remember(const std::string &folder);
  /** What is not known to be there any more: @p folder and everything in it; "" is everything. */
  void forget(const std::string &folder);

  /**
   * Folders that hold nothing vanish, from @p folder outwards, while nobody can put something into
   * them.
   */
  void prune(Ticket &ticket, std::string folder);

 private:
  Outcome find(Ticket &ticket, const std::string &folder, const HttpAnswer &answer);
  bool is_empty(Ticket &ticket, const std::string &folder) const;
  bool prune_one(Ticket &ticket, const std::string &folder);

  const DavClient &client_;
  LockWatch &locks_;
  Mutex mutex_;
  std::set<std::string> known_ QUARN_GUARDED_BY(mutex_);
};

}  // namespace transport

#endif
