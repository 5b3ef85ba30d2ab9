#include "quarn_d_packages.h"

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "glib_handles.h"
#include "log_capture.h"
#include "quarn_d_gate.h"
#include "quarn_d_handler/cancel_own.h"
#include "quarn_d_lifecycle.h"
#include "quarn_d_turn.h"
#include "quarn_dbus_server.h"
#include "scripted_client.h"
#include "test_files.h"

namespace {

/** What the object did, in order. */
std::vector<std::string> steps;
std::uint32_t withdrawn = 0;

}  // namespace

bool predecessor = false;
bool tell_quarn_predecessor(const std::string &line, int signo) {
  if (predecessor) steps.push_back("pass on " + line + (signo == kWithdrawSignal ? "" : "?"));
  return predecessor;
}
void cancel_quarn_terminate() { steps.emplace_back("cancel"); }
std::uint32_t quarnd_cancel_own(const std::string &sender) {
  steps.push_back(sender);
  return withdrawn;
}

namespace {

class Packages : public ::testing::Test {
 protected:
  void SetUp() override {
    private_bus_address();
    steps.clear();
    clear_captured_log();
    set_caller_source([this](const std::string &, caller_work answer) { answer(told_); });
    connection_ = connect_to_private_bus();
    client_ = connect_to_private_bus();
    quarnd_packages_export(connection_.get());
  }
  void TearDown() override {
    quarnd_packages_unexport();
    forget_callers();
    set_caller_source(nullptr);
  }

  struct Outcome {
    bool finished = false;
    std::string text;
  };

  /** Call the object from the other connection. @return the printed reply, or the error's name */
  std::string call(const char *method) {
    Outcome outcome;
    g_dbus_connection_call(
        client_.get(), g_dbus_connection_get_unique_name(connection_.get()), kPackagesObjectPath,
        "org.orvane.Quarn.Packages", method, nullptr, nullptr, G_DBUS_CALL_FLAGS_NONE, -1, nullptr,
        [](GObject *source, GAsyncResult *result, gpointer data) {
          auto *into = static_cast<Outcome *>(data);
          GErrorPtr error;
          const GVariantPtr reply(
              g_dbus_connection_call_finish(G_DBUS_CONNECTION(source), result, out(error)));
          const GText text(reply ? g_variant_print(reply.get(), FALSE)
                                 : g_dbus_error_get_remote_error(error.get()));
          into->text = text.get();
          into->finished = true;
        },
        &outcome);
    EXPECT_TRUE(run_until([&outcome] { return outcome.finished; }));
    return outcome.text;
  }

  quarn_caller told_{true, 0, {}, ""};
  ConnectionHandle connection_;
  ConnectionHandle client_;
};

TEST_F(Packages, CancelOwnWithdrawsForTheCallerAndSaysHowMany) {
  withdrawn = 3;
  EXPECT_EQ(call("CancelOwn"), "(3,)");
  EXPECT_EQ(steps,
            (std::vector<std::string>{"cancel", g_dbus_connection_get_unique_name(client_.get())}));
}

TEST_F(Packages, CancelOwnReachesAnEarlierProcessThatStillFinishes) {
  predecessor = true;
  EXPECT_EQ(call("CancelOwn"), "(" + std::to_string(withdrawn) + ",)");
  predecessor = false;
  const std::string caller = g_dbus_connection_get_unique_name(client_.get());
  EXPECT_EQ(steps, (std::vector<std::string>{"cancel", "pass on " + caller, caller}));
  EXPECT_EQ(count_logged(DLOG_INFO, "withdrawal passed on"), 1);
}

TEST_F(Packages, AnApplicationWithdrawsItsOwnAndAStrangerNothing) {
  told_ = {true, 5000, {5000}, "org.example.notes"};
  withdrawn = 1;
  EXPECT_EQ(call("CancelOwn"), "(1,)");
  steps.clear();
  clear_captured_log();
  forget_callers();
  told_ = {true, 5000, {5000}, ""};
  EXPECT_EQ(call("CancelOwn"), "org.freedesktop.DBus.Error.AccessDenied");
  EXPECT_EQ(steps, std::vector<std::string>{"cancel"});
  EXPECT_EQ(captured_texts(),
            std::vector<std::string>{"refused : CancelOwn of (" +
                                     std::string(g_dbus_connection_get_unique_name(client_.get())) +
                                     ") : its security label is no package's"});
}

TEST_F(Packages, OtherMethodsAreUnknown) {
  EXPECT_EQ(call("CancelAll"), "org.freedesktop.DBus.Error.UnknownMethod");
  EXPECT_TRUE(steps.empty());
}

TEST_F(Packages, IsServedNoLongerOnceTakenBack) {
  quarnd_packages_unexport();
  EXPECT_EQ(call("CancelOwn"), "org.freedesktop.DBus.Error.UnknownMethod");
  quarnd_packages_unexport();
}

TEST_F(Packages, AnObjectThatIsServedAlreadyIsLogged) {
  quarnd_packages_export(connection_.get());
  EXPECT_FALSE(captured_texts().empty());
  EXPECT_EQ(captured_texts().back().rfind("packages object is not available: ", 0), 0U);
}

/** The signature of each method and argument. */
std::string interface_text(const char *xml) {
  GErrorPtr error;
  GDBusNodeInfo *node = g_dbus_node_info_new_for_xml(xml, out(error));
  EXPECT_NE(node, nullptr);
  if (node == nullptr) return "";
  GString *text = g_string_new(nullptr);
  g_dbus_node_info_generate_xml(node, 0, text);
  g_dbus_node_info_unref(node);
  const GText owned(g_string_free(text, FALSE));
  return owned.get();
}

TEST(PackagesDocument, IsTheOneThatIsInstalled) {
  const std::string installed = read_text(QUARN_PACKAGES_FILE);
  EXPECT_EQ(interface_text(installed.c_str()), interface_text(kPackagesIntrospection));
}

}  // namespace
