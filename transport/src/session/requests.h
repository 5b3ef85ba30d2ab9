/**
 * @file requests.h
 * @brief The kinds of request.
 *
 * Thread: made by the caller, who sets what is public before it is accepted; see Request.
 */
#ifndef BACKUP_TRANSPORT_REQUESTS_H
#define BACKUP_TRANSPORT_REQUESTS_H

#include <cstdint>
#include <optional>
#include <string>

#include "session/request.h"

namespace transport {

class DownloadRequest : public Request {
 public:
  using Request::Request;
  Outcome run(const Means &means) override;
  void call_back(const Outcome &outcome) override;

  std::string path;
  LocalTarget target;
  bool basis = false; /**< what comes is what the handle's next upload to the path replaces */
  backup_trans_download_cb callback = nullptr;

 private:
  Outcome fetch(const Means &means);
};

class UploadRequest : public Request {
 public:
  using Request::Request;
  Outcome run(const Means &means) override;
  void call_back(const Outcome &outcome) override;

  std::string path;
  LocalSource source;
  int64_t timestamp_ms = 0;
  std::string content_type;
  backup_trans_upload_cb callback = nullptr;

 private:
  std::optional<Basis> take_basis();

  ObjectInfo info_;
};

class ListRequest : public Request {
 public:
  using Request::Request;
  Outcome run(const Means &means) override;
  void call_back(const Outcome &outcome) override;

  std::string folder;
  int start = 0;
  int count = 0;
  backup_trans_child_list_cb callback = nullptr;

 private:
  ListPage page_;
};

class RemoveRequest : public Request {
 public:
  using Request::Request;
  Outcome run(const Means &means) override;
  void call_back(const Outcome &outcome) override;

  std::string folder;
  backup_trans_delete_cb callback = nullptr;
};

class CheckRequest : public Request {
 public:
  using Request::Request;
  Outcome run(const Means &means) override;
  void call_back(const Outcome &outcome) override;

  backup_trans_check_cb callback = nullptr;
};

}  // namespace transport

#endif
