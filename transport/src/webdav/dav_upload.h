/**
 * @file dav_upload.h
 * @brief How objects come to lie in a WebDAV store.
 *
 * An object is sent to a temporary name beside its place and moved (dav_move.cpp). A server that
 * cannot move gets it straight to its place (dav_in_place.cpp).
 */
#ifndef BACKUP_TRANSPORT_DAV_UPLOAD_H
#define BACKUP_TRANSPORT_DAV_UPLOAD_H

#include <atomic>
#include <functional>
#include <optional>
#include <string>

#include "core/backend.h"
#include "webdav/dav_client.h"
#include "webdav/dav_folders.h"
#include "webdav/dav_locks.h"
#include "webdav/dav_place.h"
#include "webdav/leftovers.h"

namespace transport {

/** Any thread. The client, the folders and the watch outlive it. */
class DavUploads {
 public:
  DavUploads(const DavClient &client, DavFolders &folders, LockWatch &locks)
      : client_(client), folders_(folders), locks_(locks) {}

  /** One attempt, as Backend::upload(). */
  Outcome attempt(Attempt &attempt, const Upload &upload);

 private:
  // What an upload has done so far; what is not moved to its place, or not whole there, is deleted.
  struct Uploaded {
    explicit Uploaded(std::function<void(const Uploaded &)> give_up)
        : give_up_(std::move(give_up)) {}
    Uploaded(const Uploaded &) = delete;
    Uploaded &operator=(const Uploaded &) = delete;
    ~Uploaded() { give_up(); }

    void give_up() {
      if (!temporary.empty() || !made_folder.empty() || place) give_up_(*this);
      settle();
    }
    void settle() {
      temporary.clear();
      made_folder.clear();
      place.reset();
      answered = false;
      complete = false;
      move_asked = false;
    }

    std::string temporary;    // that may lie there
    std::string made_folder;  // to go again when nothing comes to lie in it
    bool answered = false;    // the server has come to an end with it
    bool complete = false;
    bool move_asked = false;
    bool is_immovable = false;
    bool was_lost = false;         // its folder was deleted before it was moved
    int refusals = 0;              // of content where there was room for a name
    int failed_preconditions = 0;  // that should have held

    std::optional<DavPlace> place;  // where a part of the content may lie

   private:
    std::function<void(const Uploaded &)> give_up_;
  };

  // What has to be so for a move to be done.
  struct Conditions {
    std::string header;
    bool overwrite = true;
  };

  // Where an upload's bytes go, and what has to be so.
  struct Destination {
    std::string path;
    std::string lock;       // the header that proves it; may be empty
    std::string condition;  // on what lies there; may be empty
  };

  // What the server has shown of its moves.
  enum class Moving { unknown, done, refused };

  Outcome send(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
               const Destination &destination);
  HttpAnswer put(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                 const Destination &destination);
  Outcome refused(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                  const Destination &destination, const HttpAnswer &answer) const;
  static Outcome outcome_under(const std::string &condition, const HttpAnswer &answer);
  Outcome start_over(Outcome result, Uploaded *uploaded);
  Outcome look_for_folder(Ticket &ticket, const std::string &path) const;
  static Outcome folder_in_its_place();
  Outcome while_locked(Ticket &ticket, const std::string &folder, Uploaded *uploaded,
                       const std::function<Outcome(const HeldLock &lock)> &step);
  Outcome explain_refusal(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                          const Outcome &result) const;
  Outcome read_version(Ticket &ticket, const std::string &path, Version *version, std::string *tag,
                       std::optional<std::string> *content = nullptr) const;
  static Version version_of(const LocalSource &source);
  Outcome compare_basis(Ticket &ticket, const Upload &upload, std::string *tag,
                        std::optional<std::string> *content = nullptr) const;
  void tidy_up(const Uploaded &left);
  HttpRequest deletion_of(const std::string &temporary) const;
  bool delete_temporary(Ticket &ticket, const Uploaded &left);
  void sweep(Ticket &ticket);

  // dav_move.cpp
  Outcome put_and_move(Ticket &ticket, const Upload &upload, Uploaded *uploaded);
  Outcome move(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
               const Conditions &conditions);
  Outcome move_plainly(Ticket &ticket, const Upload &upload, Uploaded *uploaded);
  Outcome look_at_move(Ticket &ticket, const Upload &upload, Uploaded *uploaded, bool *done) const;
  Outcome find_moved(Ticket &ticket, const Upload &upload, Uploaded *uploaded) const;
  Outcome move_locked(Ticket &ticket, const Upload &upload, Uploaded *uploaded);
  Outcome move_if_unchanged(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                            const HeldLock &lock);

  // dav_in_place.cpp
  Outcome put_in_place(Ticket &ticket, const Upload &upload, Uploaded *uploaded);
  void drop_temporary(Uploaded *uploaded);
  Outcome replace_plainly(Ticket &ticket, const Upload &upload, Uploaded *uploaded);
  Outcome replace_if_unchanged(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                               const HeldLock &lock);
  static Outcome look_at_earlier(Ticket &ticket, const Upload &upload, const Uploaded &uploaded,
                                 DavPlace::Found *found);
  Outcome note_place(Ticket &ticket, const Upload &upload, Uploaded *uploaded) const;

  const DavClient &client_;
  DavFolders &folders_;
  LockWatch &locks_;
  Leftovers leftovers_;
  std::atomic<Moving> moving_{Moving::unknown};
};

}  // namespace transport

#endif
