#include "quarn_common.h"

const char *quarn_result_text(int result) {
  switch (result) {
    case QUARN_OK:
      return "success";
    case QUARN_BAD_ARGUMENT:
      return "bad argument or unknown package";
    case QUARN_TRANSFER_FAILED:
      return "the transfer failed or Wi-Fi was lost";
    case QUARN_LIST_CHECK_FAILED:
      return "the cloud's application list could not be checked, or a request was not accepted";
    case QUARN_OUT_OF_MEMORY:
      return "out of memory while unpacking";
    case QUARN_CANCELLED:
      return "cancelled";
    case QUARN_NO_FILE_INFO:
      return "the archive has no file-info table";
    case QUARN_PRELOADED:
      return "preloaded packages are not backed up or restored";
    case QUARN_UNREADABLE:
      return "the archive or its file-info table is unreadable";
    case QUARN_UNCHANGED:
      return "unchanged since the last backup";
    case QUARN_NO_SESSION:
      return "no Wi-Fi, or no session with the cloud";
    case QUARN_SKIPPED:
      return "skipped: external storage, no space, or over the size limit";
    case QUARN_REFUSED:
      return "refused, or information or files could not be read or written";
    case QUARN_DISABLED:
      return "the package does not allow backup";
    case QUARN_FAILED:
      return "failed";
    default:
      return "unknown result";
  }
}
