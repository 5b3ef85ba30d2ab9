/**
 * @file dav_place.h
 * @brief What an upload that goes straight to its place finds there, and leaves.
 *
 * A server that is cut off may keep a part of what it got. Such a part is known by its end, which
 * is compared, so that what another device put there meanwhile is left alone.
 */
#ifndef BACKUP_TRANSPORT_DAV_PLACE_H
#define BACKUP_TRANSPORT_DAV_PLACE_H

#include <cstdint>
#include <optional>
#include <string>

#include "core/local_file.h"
#include "webdav/dav_client.h"

namespace transport {

/** One worker's, which sends. The client and the source outlive it. */
class DavPlace {
 public:
  /** What lies there. */
  enum class Found {
    nothing,
    before, /**< what was there before */
    part,   /**< of what was sent, or of what was put back */
    whole,  /**< as it was sent */
    foreign /**< anything else */
  };

  /** What is known once a failure has to be made good. */
  enum class Next { another_attempt, nothing };

  DavPlace(const DavClient &client, std::string path, const LocalSource &source)
      : client_(client), path_(std::move(path)), source_(source) {}

  /** Remember what lies there, before anything is sent. */
  Outcome note(Ticket &ticket);
  /** The content that lies there, to be put back where the new one does not arrive. */
  void keep(std::optional<std::string> content) { replaced_ = std::move(content); }

  /** Something was sent. @param answered the server has come to an end with it */
  void sent(bool answered) { answered_ = answered; }
  /** What arrived is not what should have been sent. */
  void spoil() { spoilt_ = true; }

  Outcome look(Ticket &ticket, Found *found) const;
  /** After a good answer to what was sent, with a good one to a HEAD: is it there? */
  [[nodiscard]] bool arrived(Ticket &ticket, const HttpAnswer &head) const;

  /**
   * Take a part away: what was there before comes back where it was kept, else the object goes;
   * where there is no other attempt, it also goes when nothing comes back. Also after a
   * cancellation.
   * @param lock the header that proves the lock on the folder; empty: there is none
   * @return a failure when a part may still lie there
   */
  Outcome mend(const std::string &lock, Next next) const;

 private:
  struct Seen {
    Found found = Found::nothing;
    std::string tag; /**< empty when it is none to rely on */
  };

  HttpRequest short_request(const char *method) const;
  Outcome look(Ticket &ticket, Seen *seen) const;
  Outcome look_for_late(Ticket &ticket, Seen *seen) const;
  [[nodiscard]] bool read_end(Ticket &ticket, uint64_t size, std::string *end) const;
  Found compare(uint64_t size, const std::string &end) const;
  Found compare_source(uint64_t size, const std::string &end) const;

  const DavClient &client_;
  const std::string path_;
  const LocalSource &source_;
  std::string before_;  // what the server said of what was there
  std::optional<std::string> replaced_;
  bool answered_ = true;
  bool spoilt_ = false;
};

}  // namespace transport

#endif
