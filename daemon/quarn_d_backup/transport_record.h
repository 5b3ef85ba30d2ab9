/**
 * @file transport_record.h
 * @brief Records on their way through the transport, which knows them as opaque pointers.
 */
#ifndef QUARN_D_BACKUP_TRANSPORT_RECORD_H
#define QUARN_D_BACKUP_TRANSPORT_RECORD_H

#include "backup_transport.h"

/**
 * Hand @p record to the transport by @p request, which is given the opaque pointer and answers with
 * the transport's code. Once accepted it is its callback's; refused it stays the caller's.
 * The callback may have come before this returns.
 */
template <typename RecordPtr, typename Request>
[[nodiscard]] int hand_to_transport(RecordPtr &record, Request request) {
  const int ret = request(static_cast<void *>(record.get()));
  if (ret == BACKUP_TRANS_ERROR_NONE) static_cast<void>(record.release());
  return ret;
}

/** The record is its callback's again, at the callback's start. */
template <typename RecordPtr>
[[nodiscard]] RecordPtr take_back(void *user_data) {
  return RecordPtr(static_cast<typename RecordPtr::element_type *>(user_data));
}

#endif
