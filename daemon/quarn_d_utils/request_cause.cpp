#include "quarn_d_utils/request_cause.h"

#include <sys/statvfs.h>

#include <atomic>
#include <cstdint>

namespace {

// What a file system has left when it is full for all that is written here.
constexpr std::uint64_t kFullBelow = 256U << 10;

std::atomic<request_cause> last_cause{request_cause::none};

request_cause cause_of_store(backup_trans_cause cause) {
  switch (cause) {
    case BACKUP_TRANS_CAUSE_ADDRESS:
      return request_cause::address;
    case BACKUP_TRANS_CAUSE_CERTIFICATE:
      return request_cause::certificate;
    case BACKUP_TRANS_CAUSE_PASSWORD:
      return request_cause::password;
    case BACKUP_TRANS_CAUSE_SPACE:
      return request_cause::space;
    case BACKUP_TRANS_CAUSE_NETWORK:
      return request_cause::network;
    case BACKUP_TRANS_CAUSE_SERVER:
      return request_cause::server;
    default:
      return request_cause::none;
  }
}

bool is_full(const std::string &folder) {
  struct statvfs space = {};
  if (statvfs(folder.c_str(), &space) != 0) return false;
  const bool no_room = static_cast<std::uint64_t>(space.f_bfree) * space.f_frsize < kFullBelow;
  return no_room || (space.f_files != 0 && space.f_ffree == 0);
}

/** The nearest folder above @p path that exists. */
std::string folder_above(std::string path) {
  struct statvfs space = {};
  do {
    const std::size_t slash = path.rfind('/');
    path.resize(slash == std::string::npos ? 0 : slash);
  } while (!path.empty() && statvfs(path.c_str(), &space) != 0);
  return path.empty() ? "/" : path;
}

}  // namespace

const char *request_cause_word(request_cause cause) {
  switch (cause) {
    case request_cause::none:
      return "";
    case request_cause::address:
      return "address";
    case request_cause::certificate:
      return "certificate";
    case request_cause::password:
      return "password";
    case request_cause::space:
      return "space";
    case request_cause::network:
      return "network";
    case request_cause::server:
      return "server";
    case request_cause::wifi:
      return "wifi";
    case request_cause::device_full:
      return "device-full";
    case request_cause::device_file:
      return "device-file";
    case request_cause::removed:
      return "removed";
    case request_cause::list_foreign:
      return "list-foreign";
    case request_cause::list_too_large:
      return "list-too-large";
    case request_cause::list_unreadable:
      return "list-unreadable";
    case request_cause::list_changed:
      return "list-changed";
  }
  return "";
}

request_cause cause_of_transfer(int code, const std::string &local_path) {
  switch (code) {
    case BACKUP_TRANS_ERROR_NONE:
    case BACKUP_TRANS_ERROR_NO_SUCH_OBJECT:
    case BACKUP_TRANS_ERROR_CANCELLED:
      return request_cause::none;
    case BACKUP_TRANS_ERROR_LOCAL_FILE:
      return cause_of_local_file(local_path);
    case BACKUP_TRANS_ERROR_CONFLICT:
      return request_cause::list_changed;
    case BACKUP_TRANS_ERROR_AUTHENTICATION:
      return request_cause::password;
    case BACKUP_TRANS_ERROR_QUOTA:
      return request_cause::space;
    case BACKUP_TRANS_ERROR_CERTIFICATE:
      return request_cause::certificate;
    default:
      break;
  }
  // the code does not tell a wrong address from a server that errs
  const request_cause told = cause_of_store(backup_trans_last_cause());
  if (told == request_cause::address) return told;
  return code == BACKUP_TRANS_ERROR_NETWORK ? request_cause::network : request_cause::server;
}

request_cause cause_of_local_file(const std::string &local_path) {
  return is_full(folder_above(local_path)) ? request_cause::device_full
                                           : request_cause::device_file;
}

void note_request_end(request_cause cause) { last_cause = cause; }

request_cause last_request_cause() { return last_cause; }
