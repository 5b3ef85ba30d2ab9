#include "quarn_d_handler/cancel_own.h"

#include "quarn_d_backup/cancel.h"
#include "quarn_d_restore/quarn_d_restore.h"
#include "quarn_d_utils/admission.h"
#include "quarn_d_utils/nested_loop.h"
#include "quarn_log.h"

std::uint32_t quarnd_cancel_own(const std::string &sender) {
  std::uint32_t count = quarnd_cancel_starting_backups(&sender) + cancel_backups_of(sender);
  for (const std::uint64_t fiber : fibers_of_caller(sender)) {
    if (withdraw_waits(fiber)) ++count;
  }
  count += withdraw_app_lists(sender);
  if (withdraw_restore_mode(sender)) ++count;
  LOGI("%u requests of (%s) are withdrawn", count, sender.c_str());
  return count;
}
