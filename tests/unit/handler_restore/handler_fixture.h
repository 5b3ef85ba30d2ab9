/**
 * @file handler_fixture.h
 * @brief The restore fixture's package, as the device's package services tell of it.
 */
#ifndef HANDLER_FIXTURE_H
#define HANDLER_FIXTURE_H

#include <functional>
#include <string>
#include <vector>

#include "quarn_d_handler/quarn_d_handler.h"
#include "restore_fixture.h"

/** The cloud session that the handlers ask for. */
struct FakeSession {
  bool ready = true;
  int asked = 0;
  std::function<void()> meanwhile; /**< what is served while the session starts */
};
extern FakeSession session;

class HandlerTest : public RestoreTest {
 protected:
  HandlerTest();
  ~HandlerTest() override;

  using Answers = std::vector<Outside::Answer>;

  /** Run @p action once the main context is idle: in a nested loop, that is. */
  void later(std::function<void()> action);

  std::vector<std::string> apps = {"org.example.notes", "org.example.notes.service"};
  bool opted_out = false;
  std::vector<package_manager_event_cb> subscriptions;

  /** Uploads that were accepted and not answered yet. */
  struct Upload {
    std::string local;
    std::string remote;
    void *user_data;
    backup_trans_upload_cb callback;
  };
  std::vector<Upload> uploads;
  int upload_result = 0;
  void answer_upload(backup_trans_error_code error = BACKUP_TRANS_ERROR_NONE);
};

#endif
