/**
 * @file backend.h
 * @brief What a kind of store has to do for the session.
 *
 * Thread: every function is called on a worker thread of the session, several
 * at a time, and may block. Lifetime: the session holds a reference for as long
 * as a call runs, also when the configuration has changed meanwhile. Cancel:
 * each function returns soon after Ticket::cancelled() has become true, leaves
 * nothing half done, and asks Ticket::begin_commit() right before the step that
 * makes its result visible where that step cannot be taken back. The outcome of
 * a call that was cancelled is not looked at.
 *
 * A call is one attempt. Outcome::transient asks the session for another one;
 * what a later attempt has to know about the earlier ones is kept in
 * Attempt::memory.
 */
#ifndef BACKUP_TRANSPORT_BACKEND_H
#define BACKUP_TRANSPORT_BACKEND_H

#include <any>
#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "core/local_file.h"
#include "core/outcome.h"
#include "core/ticket.h"

namespace transport {

struct ObjectInfo {
  std::string path; /**< absolute, without a trailing slash */
  bool is_file = false;
  uint64_t size = 0;
  int64_t timestamp_ms = 0;
};

struct ListPage {
  std::vector<ObjectInfo> children;
  bool more = false;
};

/** A store's name for an object's present content; none while it is absent. */
using Version = std::optional<std::string>;

/** What the attempts at one request have in common. */
struct Attempt {
  Ticket &ticket;
  int number = 1;  /**< counted from one */
  std::any memory; /**< the backend's own, kept from attempt to attempt */
};

struct Upload {
  const std::string &path;
  LocalSource &source;
  int64_t timestamp_ms;
  const std::string &content_type;
  /** The content that is replaced; null when that does not matter. */
  const Version *basis;
};

/** What is known of the object that an upload has made. */
inline ObjectInfo info_of(const Upload &upload) {
  ObjectInfo info;
  info.path = upload.path;
  info.is_file = true;
  info.size = upload.source.size();
  info.timestamp_ms = upload.timestamp_ms;
  return info;
}

class Backend {
 public:
  Backend() = default;
  Backend(const Backend &) = delete;
  Backend &operator=(const Backend &) = delete;
  virtual ~Backend() = default;

  /**
   * @param version null, or receives what was found, also with
   *                #BACKUP_TRANS_ERROR_NO_SUCH_OBJECT
   */
  virtual Outcome download(Attempt &attempt, const std::string &path, LocalTarget &target,
                           Version *version) = 0;

  /** @param info receives what is stored */
  virtual Outcome upload(Attempt &attempt, const Upload &upload, ObjectInfo *info) = 0;

  /** @param folder without a trailing slash; "" is the root */
  virtual Outcome list(Attempt &attempt, const std::string &folder, int start, int count,
                       ListPage *page) = 0;

  /** @param folder as for list(), never the root */
  virtual Outcome remove_folder(Attempt &attempt, const std::string &folder) = 0;
};

}  // namespace transport

#endif
