#include "core/remote_path.h"
#include "webdav/dav_upload.h"

namespace transport {
namespace {

using Found = DavPlace::Found;
using Next = DavPlace::Next;

}  // namespace

// A server that cannot move gets the bytes where they belong. One that is cut off may keep a part
// of them there, which is looked for, and does not stay.
Outcome DavUploads::put_in_place(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
  drop_temporary(uploaded);
  if (upload.basis == nullptr) return replace_plainly(ticket, upload, uploaded);
  const std::string folder = parent_of(upload.path);
  const Outcome result = folders_.ensure(ticket, folder, &uploaded->made_folder);
  if (!result.ok()) return result;
  return while_locked(ticket, folder, uploaded, [&](const HeldLock &lock) {
    return replace_if_unchanged(ticket, upload, uploaded, lock);
  });
}

void DavUploads::drop_temporary(Uploaded *uploaded) {
  Ticket own;
  if (!uploaded->temporary.empty()) delete_temporary(own, *uploaded);
  uploaded->temporary.clear();
  uploaded->complete = false;
  uploaded->move_asked = false;
}

Outcome DavUploads::replace_plainly(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
  Found found = Found::nothing;
  const Outcome looked = look_at_earlier(ticket, upload, *uploaded, &found);
  if (!looked.ok() || found == Found::whole) return looked;
  // A part of it does not become what was there before.
  if (found != Found::part) {
    const Outcome noted = note_place(ticket, upload, uploaded);
    if (!noted.ok()) return noted;
  }
  return send(ticket, upload, uploaded, {upload.path, "", ""});
}

Outcome DavUploads::replace_if_unchanged(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                                         const HeldLock &lock) {
  const std::string &token = lock.token;
  Destination destination{upload.path, "", ""};
  if (!token.empty()) destination.lock = client_.lock_condition(parent_of(upload.path), token);
  Found found = Found::nothing;
  Outcome result = look_at_earlier(ticket, upload, *uploaded, &found);
  if (!result.ok() || found == Found::whole) return result;
  if (found == Found::part) result = uploaded->place->mend(destination.lock, Next::another_attempt);
  if (result.ok()) result = note_place(ticket, upload, uploaded);
  if (!result.ok()) return result;
  std::string tag;
  std::optional<std::string> content;
  result = compare_basis(ticket, upload, &tag, &content);
  if (!result.ok()) return result;
  uploaded->place->keep(std::move(content));
  // A condition on what the request is for is known to more servers than the lock's header.
  if (!upload.basis->has_value())
    destination.condition = "If-None-Match: *";
  else if (token.empty() && !tag.empty() && uploaded->failed_preconditions == 0)
    destination.condition = "If-Match: " + tag;
  result = lock.check();
  if (!result.ok()) return result;
  result = send(ticket, upload, uploaded, destination);
  if (result.ok()) return result;
  if (result.code == BACKUP_TRANS_ERROR_CONFLICT)
    return explain_refusal(ticket, upload, uploaded, result);
  // Nobody shall see a part of it once the lock is gone. What cannot be mended now is looked at by
  // the next attempt; this one ends with what was in its way.
  static_cast<void>(uploaded->place->mend(destination.lock, Next::another_attempt));
  return result;
}

// What an earlier attempt that seemed to fail has brought about.
Outcome DavUploads::look_at_earlier(Ticket &ticket, const Upload &upload, const Uploaded &uploaded,
                                    Found *found) {
  if (!uploaded.place) return success();
  const Outcome looked = uploaded.place->look(ticket, found);
  if (!looked.ok() || *found != Found::whole || upload.source.unchanged()) return of_upload(looked);
  return failure(BACKUP_TRANS_ERROR_LOCAL_FILE, "the local file changed while it was sent");
}

// From here on a part of the content may come to lie in the object's place.
Outcome DavUploads::note_place(Ticket &ticket, const Upload &upload, Uploaded *uploaded) const {
  const Outcome looked = look_for_folder(ticket, upload.path);
  if (!looked.ok()) return looked;
  DavPlace place(client_, upload.path, upload.source);
  const Outcome noted = place.note(ticket);
  if (noted.ok()) uploaded->place.emplace(std::move(place));
  return noted;
}

}  // namespace transport
