#include "backup_transport.h"

extern "C" {

const char *backup_trans_error_text(backup_trans_error_code error) {
  switch (error) {
    case BACKUP_TRANS_ERROR_NONE:
      return "success";
    case BACKUP_TRANS_ERROR_ARGUMENT:
      return "the request cannot be made like this";
    case BACKUP_TRANS_ERROR_NOT_INITIALIZED:
      return "no cloud is set up";
    case BACKUP_TRANS_ERROR_AUTHENTICATION:
      return "the cloud refused the user name or password";
    case BACKUP_TRANS_ERROR_NETWORK:
      return "the cloud cannot be reached";
    case BACKUP_TRANS_ERROR_NO_SUCH_OBJECT:
      return "not in the cloud";
    case BACKUP_TRANS_ERROR_QUOTA:
      return "the cloud is full";
    case BACKUP_TRANS_ERROR_CONFLICT:
      return "changed in the cloud meanwhile";
    case BACKUP_TRANS_ERROR_CANCELLED:
      return "cancelled";
    case BACKUP_TRANS_ERROR_SERVER:
      return "the cloud answered with an error";
    case BACKUP_TRANS_ERROR_LOCAL_FILE:
      return "a file on the device cannot be read or written";
    case BACKUP_TRANS_ERROR_CERTIFICATE:
      return "the server is not the one it says it is";
    case BACKUP_TRANS_ERROR_TOO_LARGE:
      return "larger than it may be";
  }
  return "unknown error";
}

const char *backup_trans_cause_word(backup_trans_cause cause) {
  switch (cause) {
    case BACKUP_TRANS_CAUSE_NONE:
      return "ok";
    case BACKUP_TRANS_CAUSE_ADDRESS:
      return "address";
    case BACKUP_TRANS_CAUSE_CERTIFICATE:
      return "certificate";
    case BACKUP_TRANS_CAUSE_PASSWORD:
      return "password";
    case BACKUP_TRANS_CAUSE_SPACE:
      return "space";
    case BACKUP_TRANS_CAUSE_NETWORK:
      return "network";
    case BACKUP_TRANS_CAUSE_SERVER:
      return "server";
    case BACKUP_TRANS_CAUSE_DEVICE:
      return "device";
  }
  return "unknown";
}

}  // extern "C"
