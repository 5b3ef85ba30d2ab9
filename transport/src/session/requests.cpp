#include "session/requests.h"

#include <utility>
#include <vector>

#include "session/check.h"

namespace transport {
namespace {

backup_trans_file_info_s public_info(const ObjectInfo &info) {
  return {info.path.c_str(), info.is_file, info.size, info.timestamp_ms};
}

std::string description(const Outcome &outcome) {
  if (outcome.ok()) return "objects can be put there, read and removed";
  return outcome.said.empty() ? outcome.message : outcome.message + " (" + outcome.said + ")";
}

}  // namespace

Request::Request(backup_trans_handle_h handle, std::shared_ptr<Backend> backend, void *user_data)
    : handle_(handle), backend_(std::move(backend)), user_data_(user_data) {}

Outcome Request::with_retries(const Means &means, const std::function<Outcome(Attempt &)> &once) {
  Attempt attempt{ticket, 0, {}};
  return run_with_retries(ticket, means.clock, means.limits, [&](int number) {
    attempt.number = number;
    return once(attempt);
  });
}

Outcome DownloadRequest::run(const Means &means) {
  Outcome result = fetch(means);
  target.discard();
  return result;
}

Outcome DownloadRequest::fetch(const Means &means) {
  Version found;
  Outcome result = with_retries(means, [&](Attempt &attempt) {
    return backend().download(attempt, path, target, basis ? &found : nullptr);
  });
  const bool known = result.ok() || result.code == BACKUP_TRANS_ERROR_NO_SUCH_OBJECT;
  if (basis && known) {
    const MutexLock lock(session_mutex);
    handle()->bases[path] = {std::move(found), shared_backend()};
  }
  return result;
}

void DownloadRequest::call_back(const Outcome &outcome) {
  std::string message = outcome.message;
  callback(outcome.code, callers_data(), outcome.ok() ? nullptr : message.data());
}

std::optional<Basis> UploadRequest::take_basis() {
  const MutexLock lock(session_mutex);
  const auto it = handle()->bases.find(path);
  if (it == handle()->bases.end()) return std::nullopt;
  Basis basis = std::move(it->second);
  handle()->bases.erase(it);
  return basis;
}

Outcome UploadRequest::run(const Means &means) {
  const std::optional<Basis> basis = take_basis();
  if (basis && basis->store.lock() != shared_backend())
    return failure(BACKUP_TRANS_ERROR_CONFLICT, "the object was read from another store");
  const Upload upload{path, source, timestamp_ms, content_type, basis ? &basis->version : nullptr};
  Outcome uploaded = with_retries(
      means, [&](Attempt &attempt) { return backend().upload(attempt, upload, &info_); });
  means.pages.forget();
  return uploaded;
}

void UploadRequest::call_back(const Outcome &outcome) {
  // Without a success a worker that was left behind may still write it.
  const backup_trans_file_info_s info =
      outcome.ok() ? public_info(info_) : backup_trans_file_info_s{};
  callback(outcome.code, callers_data(), outcome.ok() ? &info : nullptr);
}

Outcome ListRequest::run(const Means &means) {
  return with_retries(means, [&](Attempt &attempt) {
    page_ = {};
    return means.pages.get(
        {shared_backend(), folder, start, count}, means.clock.now(),
        [&](int first, int most, ListPage *read) {
          return backend().list(attempt, folder, first, most, read);
        },
        &page_);
  });
}

void ListRequest::call_back(const Outcome &outcome) {
  if (!outcome.ok()) {
    callback(outcome.code, callers_data(), nullptr);
    return;
  }
  std::vector<backup_trans_file_info_s> children;
  for (const ObjectInfo &child : page_.children) children.push_back(public_info(child));
  const backup_trans_child_list_s list = {children.data(), static_cast<int>(children.size()),
                                          page_.more};
  callback(outcome.code, callers_data(), &list);
}

Outcome RemoveRequest::run(const Means &means) {
  Outcome removed = with_retries(
      means, [&](Attempt &attempt) { return backend().remove_folder(attempt, folder); });
  means.pages.forget();
  return removed;
}

void RemoveRequest::call_back(const Outcome &outcome) {
  const backup_trans_file_info_s info = {folder.c_str(), false, 0, 0};
  callback(outcome.code, callers_data(), &info);
}

Outcome CheckRequest::run(const Means &) { return check_store(ticket, backend()); }

void CheckRequest::call_back(const Outcome &outcome) {
  const std::string message = description(outcome);
  callback(outcome.code, callers_data(), cause_of(outcome), message.c_str());
}

}  // namespace transport
