#include "session/check.h"

#include <glib.h>
#include <unistd.h>

#include <cerrno>
#include <functional>
#include <memory>
#include <string>

#include "core/local_file.h"

namespace transport {
namespace {

constexpr char kFolder[] = "/quarn-check-";
constexpr char kObject[] = "/probe";
constexpr char kContent[] = "this can be deleted\n";
constexpr char kContentType[] = "text/plain";
constexpr int64_t kMicrosecondsPerMillisecond = 1000;

/** A directory for the object's two local files, gone with it. */
class Workspace {
 public:
  Workspace() : path_(g_dir_make_tmp("quarn-check-XXXXXX", nullptr)) {}
  Workspace(const Workspace &) = delete;
  Workspace &operator=(const Workspace &) = delete;
  ~Workspace() {
    if (path_ == nullptr) return;
    unlink(sent().c_str());
    unlink(returned().c_str());
    rmdir(path_);
    g_free(path_);
  }

  bool usable() const {
    return path_ != nullptr && g_file_set_contents(sent().c_str(), kContent, -1, nullptr) != FALSE;
  }
  std::string sent() const { return std::string(path_) + "/sent"; }
  std::string returned() const { return std::string(path_) + "/returned"; }

 private:
  char *path_;
};

std::string new_folder() {
  char *uuid = g_uuid_string_random();
  std::string folder = std::string(kFolder) + uuid;
  g_free(uuid);
  return folder;
}

Outcome local_problem() {
  return failure(BACKUP_TRANS_ERROR_LOCAL_FILE,
                 std::string("the temporary directory cannot be used: ") + g_strerror(errno));
}

/**
 * One attempt with a ticket of its own, which @p ticket cancels along: a step
 * that commits must not keep the later ones from being cancelled.
 */
Outcome step(Ticket &ticket, const std::function<Outcome(Attempt &attempt)> &run) {
  // A canceller may still call the waker when the step is over.
  const auto own = std::make_shared<Ticket>();
  ticket.set_waker([own] { own->cancel(); });
  Attempt attempt{*own, 1, {}};
  const Outcome outcome = ticket.cancelled() ? cancelled() : run(attempt);
  ticket.set_waker(nullptr);
  return outcome;
}

Outcome put(Attempt &attempt, Backend &backend, const Workspace &workspace,
            const std::string &path) {
  LocalSource source;
  if (!source.open(workspace.sent())) return local_problem();
  const std::string type = kContentType;
  ObjectInfo info;
  return backend.upload(
      attempt, {path, source, g_get_real_time() / kMicrosecondsPerMillisecond, type, nullptr},
      &info);
}

Outcome get(Attempt &attempt, Backend &backend, const Workspace &workspace,
            const std::string &path) {
  LocalTarget target;
  if (!target.open(workspace.returned())) return local_problem();
  const Outcome outcome = backend.download(attempt, path, target, nullptr);
  if (!outcome.ok()) return outcome;
  char *content = nullptr;
  const bool same =
      g_file_get_contents(workspace.returned().c_str(), &content, nullptr, nullptr) != FALSE &&
      g_strcmp0(content, kContent) == 0;
  g_free(content);
  if (same) return success();
  return failure(BACKUP_TRANS_ERROR_SERVER,
                 "the store gave back something else than was put there");
}

}  // namespace

Outcome check_store(Ticket &ticket, Backend &backend) {
  const Workspace workspace;
  if (!workspace.usable()) return local_problem();
  Outcome outcome = step(ticket, [&](Attempt &attempt) {
    ListPage page;
    return backend.list(attempt, "", 0, 1, &page);
  });
  if (!outcome.ok()) return outcome;
  const std::string folder = new_folder();
  const std::string object = folder + kObject;
  outcome =
      step(ticket, [&](Attempt &attempt) { return put(attempt, backend, workspace, object); });
  if (outcome.ok()) {
    outcome =
        step(ticket, [&](Attempt &attempt) { return get(attempt, backend, workspace, object); });
  }
  // Not cancelled along: what was put there goes again.
  Ticket own;
  Attempt attempt{own, 1, {}};
  const Outcome removed = backend.remove_folder(attempt, folder);
  return outcome.ok() ? removed : outcome;
}

backup_trans_cause cause_of(const Outcome &outcome) {
  if (outcome.wrong_address) return BACKUP_TRANS_CAUSE_ADDRESS;
  switch (outcome.code) {
    case BACKUP_TRANS_ERROR_NONE:
      return BACKUP_TRANS_CAUSE_NONE;
    case BACKUP_TRANS_ERROR_NO_SUCH_OBJECT:
      return BACKUP_TRANS_CAUSE_ADDRESS;
    case BACKUP_TRANS_ERROR_CERTIFICATE:
      return BACKUP_TRANS_CAUSE_CERTIFICATE;
    case BACKUP_TRANS_ERROR_AUTHENTICATION:
      return BACKUP_TRANS_CAUSE_PASSWORD;
    case BACKUP_TRANS_ERROR_QUOTA:
      return BACKUP_TRANS_CAUSE_SPACE;
    case BACKUP_TRANS_ERROR_NETWORK:
      return BACKUP_TRANS_CAUSE_NETWORK;
    case BACKUP_TRANS_ERROR_LOCAL_FILE:
      return BACKUP_TRANS_CAUSE_DEVICE;
    default:
      return BACKUP_TRANS_CAUSE_SERVER;
  }
}

}  // namespace transport
