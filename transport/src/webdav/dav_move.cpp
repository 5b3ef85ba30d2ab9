#include "core/remote_path.h"
#include "webdav/dav_upload.h"

namespace transport {

Outcome DavUploads::put_and_move(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
  if (!uploaded->complete) {
    uploaded->give_up();
    const std::string temporary = parent_of(upload.path) + "/" + make_temporary_name();
    const Outcome sent = send(ticket, upload, uploaded, {temporary, "", ""});
    if (!sent.ok()) return sent;
    uploaded->complete = true;
  }
  return upload.basis == nullptr ? move_plainly(ticket, upload, uploaded)
                                 : move_locked(ticket, upload, uploaded);
}

Outcome DavUploads::move(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                         const Conditions &conditions) {
  HttpRequest request = client_.request_for("MOVE", uploaded->temporary);
  request.headers = {"Destination: " + client_.url_of(upload.path),
                     conditions.overwrite ? "Overwrite: T" : "Overwrite: F"};
  if (!conditions.header.empty()) request.headers.push_back(conditions.header);
  uploaded->move_asked = true;
  const HttpAnswer answer = http_perform(ticket, request);
  if (has_status(answer, kHttpMultiStatus))
    return failure(BACKUP_TRANS_ERROR_SERVER, "upload: the server did not move it");
  if (answer.good()) {
    moving_ = Moving::done;
    return success();
  }
  Outcome result = outcome_under(conditions.header, answer);
  // What has moved something before can do it.
  if (is_unsupported(answer) && moving_ != Moving::done) {
    const Outcome looked = look_for_folder(ticket, upload.path);
    if (!looked.ok()) return looked;
    moving_ = Moving::refused;
    uploaded->is_immovable = true;
    return result;
  }
  if (is_absent(answer) || has_status(answer, kHttpConflict)) {
    const Outcome looked = look_for_folder(ticket, upload.path);
    if (!looked.ok()) return looked;
    return start_over(std::move(result), uploaded);
  }
  return result;
}

// To most servers a folder in the object's place is a thing that may be replaced with everything
// in it, and some put the object into it.
Outcome DavUploads::move_plainly(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
  bool done = false;
  Outcome result = look_at_move(ticket, upload, uploaded, &done);
  if (!result.ok() || done) return result;
  Conditions conditions;
  conditions.overwrite = false;
  result = move(ticket, upload, uploaded, conditions);
  if (result.code == BACKUP_TRANS_ERROR_CONFLICT) {
    uploaded->move_asked = false;
    result = look_for_folder(ticket, upload.path);
    if (!result.ok()) return result;
    conditions.overwrite = true;
    return move(ticket, upload, uploaded, conditions);
  }
  // What lies alone in a new folder came to lie where it should.
  const std::string &made = uploaded->made_folder;
  if (!result.ok() || (!made.empty() && made == parent_of(upload.path))) return result;
  const HttpAnswer moved = client_.send(ticket, "HEAD", upload.path);
  if (moved.good() && has_size(moved, upload.source.size())) return result;
  if (!moved.complete()) return moved.problem;
  bool is_folder = false;
  result = client_.find_folder(ticket, upload.path, &is_folder);
  if (!result.ok()) return result;
  if (!is_folder) return of_upload(dav_outcome(moved, "upload"));
  client_.delete_pieces(ticket, upload.path, upload.path + "/" + name_of(uploaded->temporary));
  return folder_in_its_place();
}

// What became of an earlier attempt's move, whose answer was lost or an error, which does not
// tell whether it was done. One that was not is asked for again like the first one: meanwhile
// another device may have been there.
Outcome DavUploads::look_at_move(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                                 bool *done) const {
  if (!uploaded->move_asked) return success();
  const HttpAnswer left = client_.send(ticket, "HEAD", uploaded->temporary);
  if (is_absent(left)) {
    *done = true;
    return find_moved(ticket, upload, uploaded);
  }
  if (!left.good()) return dav_outcome(left, "upload");
  uploaded->move_asked = false;
  return success();
}

Outcome DavUploads::find_moved(Ticket &ticket, const Upload &upload, Uploaded *uploaded) const {
  if (upload.basis != nullptr) {
    // Another device may have replaced it since, which nobody can tell from its never having
    // been there.
    Version present;
    const Outcome found = read_version(ticket, upload.path, &present, nullptr);
    if (!found.ok()) return found;
    return present == version_of(upload.source)
               ? success()
               : failure(BACKUP_TRANS_ERROR_CONFLICT, "the object changed since it was read");
  }
  const HttpAnswer moved = client_.send(ticket, "HEAD", upload.path);
  if (moved.good() && has_size(moved, upload.source.size())) return success();
  if (!moved.good() && !is_absent(moved)) return dav_outcome(moved, "upload");
  uploaded->settle();
  return again("upload: it did not last");
}

// The comparison and the move happen while nobody else may change the folder.
Outcome DavUploads::move_locked(Ticket &ticket, const Upload &upload, Uploaded *uploaded) {
  return while_locked(ticket, parent_of(upload.path), uploaded, [&](const HeldLock &lock) {
    return move_if_unchanged(ticket, upload, uploaded, lock);
  });
}

Outcome DavUploads::move_if_unchanged(Ticket &ticket, const Upload &upload, Uploaded *uploaded,
                                      const HeldLock &lock) {
  const std::string &token = lock.token;
  bool done = false;
  Outcome result = look_at_move(ticket, upload, uploaded, &done);
  if (!result.ok() || done) return result;
  std::string tag;
  result = compare_basis(ticket, upload, &tag);
  if (!result.ok()) return result;
  Conditions conditions;
  conditions.overwrite = upload.basis->has_value();
  // Where there is no lock, the server may be able to compare at the last moment.
  if (!token.empty())
    conditions.header = client_.lock_condition(parent_of(upload.path), token);
  else if (!tag.empty() && uploaded->failed_preconditions == 0)
    conditions.header = client_.tag_condition(upload.path, tag);
  result = lock.check();
  if (!result.ok()) return result;
  result = move(ticket, upload, uploaded, conditions);
  if (result.code != BACKUP_TRANS_ERROR_CONFLICT || !uploaded->complete) return result;
  uploaded->move_asked = false;
  return explain_refusal(ticket, upload, uploaded, result);
}

}  // namespace transport
