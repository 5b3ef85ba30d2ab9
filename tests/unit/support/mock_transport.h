/**
 * @file mock_transport.h
 * @brief The cloud transport, scripted: GoogleMock behind its C symbols.
 *
 * Make one (a NiceMock, say) in the test or fixture: while it lives, the C
 * functions call it. Defaults are those of a working device; script the rest
 * with ON_CALL and EXPECT_CALL.
 */
#ifndef MOCK_TRANSPORT_H
#define MOCK_TRANSPORT_H

#include <gmock/gmock.h>

#include "backup_transport.h"

class MockTransport {
 public:
  MockTransport();
  virtual ~MockTransport();
  MockTransport(const MockTransport &) = delete;
  MockTransport &operator=(const MockTransport &) = delete;

  /** The one that lives; the process ends with a message when there is none. */
  static MockTransport &current();

  MOCK_METHOD(int, backup_trans_init, (void *, backup_trans_init_cb));
  MOCK_METHOD(void, backup_trans_deinit, ());
  MOCK_METHOD(backup_trans_handle_h, backup_trans_create_handle, ());
  MOCK_METHOD(int, backup_trans_download_file_ors_async,
              (backup_trans_handle_h, const char *, const char *, void *, backup_trans_download_cb,
               int));
  MOCK_METHOD(int, backup_trans_download_file_ors,
              (backup_trans_handle_h, const char *, const char *, int));
  MOCK_METHOD(int, backup_trans_upload_file_ors_async,
              (backup_trans_handle_h, const char *, const char *, backup_trans_upload_cb, int64_t,
               int, void *, const char *));
  MOCK_METHOD(int, backup_trans_get_folder_child_list_async,
              (backup_trans_handle_h, const char *, int, int, int, void *,
               backup_trans_child_list_cb));
  MOCK_METHOD(int, backup_trans_delete_folder_ors_async,
              (backup_trans_handle_h, const char *, void *, backup_trans_delete_cb));
  MOCK_METHOD(backup_trans_cause, backup_trans_last_cause, ());
  MOCK_METHOD(const char *, backup_trans_cause_word, (backup_trans_cause));
  MOCK_METHOD(void, backup_trans_cancel_request, (backup_trans_handle_h));
  MOCK_METHOD(int, backup_trans_abort_request, (backup_trans_handle_h, void *));

  /** What the latest download was limited to; its other arguments are those of the mock above. */
  uint64_t last_max_size = 0;
};

#endif
