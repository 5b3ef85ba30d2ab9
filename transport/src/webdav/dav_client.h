/**
 * @file dav_client.h
 * @brief The requests that a WebDAV store is made of.
 *
 * Paths are those of the store ("/a/b"); "" is its root. Any thread.
 */
#ifndef BACKUP_TRANSPORT_DAV_CLIENT_H
#define BACKUP_TRANSPORT_DAV_CLIENT_H

#include <chrono>
#include <string>
#include <vector>

#include "core/config.h"
#include "core/outcome.h"
#include "core/ticket.h"
#include "http/http_store.h"
#include "http/url.h"
#include "webdav/dav_xml.h"

namespace transport {

constexpr int kHttpCreated = 201;
constexpr int kHttpMultiStatus = 207;
constexpr int kHttpLocked = 423;
constexpr int kHttpFailedDependency = 424;
constexpr int kHttpServerError = 500;

/** How long a lock lasts whose holder does not give it back. */
constexpr std::chrono::seconds kLockDuration{30};

/** Seconds that a request may take that clears up behind another one. */
constexpr long kTidyUpSeconds = 5;
/** How long a server may take to notice that nobody sends any more what it receives. */
constexpr std::chrono::milliseconds kTidyUpPauses[] = {
    std::chrono::milliseconds(50), std::chrono::milliseconds(200), std::chrono::milliseconds(800)};

/**
 * How a component of a path is named on the server. Some servers never list names
 * that begin with a dot, so a dot in front becomes "%2E", and a percent sign "%25".
 */
std::string stored_name(const std::string &name);
/** The inverse of stored_name(); other names are what they are. */
std::string name_of_stored(const std::string &stored);
/** stored_name() of every component. */
std::string stored_path(const std::string &path);

/** Did the server answer, and with that status? */
bool has_status(const HttpAnswer &answer, int status);

/** Does the server not know the request's method, or not there? */
bool is_unsupported(const HttpAnswer &answer);

/** The entity tag, where it stands for the content to the byte; else "". */
std::string strong_tag(const HttpAnswer &answer);

/** outcome_of(); somebody else's lock goes away by itself. */
Outcome dav_outcome(const HttpAnswer &answer, const char *what);

/** An upload cannot end with what is said of objects that are asked for. */
Outcome of_upload(Outcome outcome);

/** What lies in a folder. */
struct DavListing {
  std::vector<DavEntry> children; /**< with their paths in the store */
  /** Something else lies there: being sent, or under a name that no object of this store has. */
  bool has_others = false;
};

class DavClient {
 public:
  DavClient(const StoreUrl &url, const Config &config)
      : url_(url), user_(config.user), password_(config.password), ca_file_(config.ca_file) {}

  std::string url_of(const std::string &path) const;
  /** A request for an object; for a folder @p path ends with a slash. */
  HttpRequest request_for(const char *method, const std::string &path) const;
  HttpAnswer send(Ticket &ticket, const char *method, const std::string &path) const;

  /**
   * The children of a folder. What was left lying there by uploads that ended more
   * than a day ago is deleted on the way, and never listed.
   * @return #BACKUP_TRANS_ERROR_NO_SUCH_OBJECT when there is no such folder
   */
  Outcome list(Ticket &ticket, const std::string &folder, DavListing *listing) const;

  /** Make the folder that the store is, and those that it lies in where they are missing. */
  HttpAnswer make_top(Ticket &ticket) const;

  /**
   * Is there a folder of that name?
   * @param found is false when there is none, and when the server finds the question too odd to say
   * @return a failure when that is not known, transient where it is worth another attempt
   */
  Outcome find_folder(Ticket &ticket, const std::string &folder, bool *found) const;

  /**
   * Lock a folder with everything in it.
   * @param token receives the lock's name; stays empty on a server without locks
   * @return #BACKUP_TRANS_ERROR_NO_SUCH_OBJECT when there is no such folder
   */
  Outcome lock(Ticket &ticket, const std::string &folder, std::string *token) const;
  /** Also after a cancellation: others would wait until the lock ends by itself. */
  void unlock(const std::string &folder, const std::string &token) const;
  /**
   * The lock of one of our devices that keeps others out of a folder.
   * @return false when there is none, or the server does not tell
   */
  [[nodiscard]] bool find_foreign_lock(Ticket &ticket, const std::string &folder,
                                       DavLock *lock) const;
  /** Take it from its holder. */
  void break_lock(Ticket &ticket, const std::string &folder, const DavLock &lock) const;
  /** The header that proves a lock. */
  std::string lock_condition(const std::string &folder, const std::string &token) const;
  /** The header that demands that an object is still the one with that tag. */
  std::string tag_condition(const std::string &path, const std::string &tag) const;

  /** Delete everything in @p folder whose name begins with @p temporary. */
  void delete_pieces(Ticket &ticket, const std::string &folder, const std::string &temporary) const;

  /** Does the answer send whoever asked for a folder as for an object to its name with a slash? */
  [[nodiscard]] bool means_folder(const HttpAnswer &answer, const std::string &path) const;

 private:
  HttpRequest question(const char *body, const std::string &folder, const char *depth) const;
  HttpAnswer make_collection(Ticket &ticket, const std::string &path) const;
  std::string find_lock(const std::string &folder, const std::string &owner) const;
  HttpAnswer propfind(Ticket &ticket, const std::string &folder, const char *depth) const;
  bool is_object(Ticket &ticket, std::string path) const;
  bool read_listing(const HttpAnswer &answer, const std::string &folder, DavListing *listing,
                    std::vector<DavEntry> *temporary, bool *is_folder) const;

  const StoreUrl url_;
  const std::string user_;
  const std::string password_;
  const std::string ca_file_;
};

}  // namespace transport

#endif
