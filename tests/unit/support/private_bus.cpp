#include "private_bus.h"

#include <gtest/gtest.h>

#include "glib_handles.h"

PrivateBus::PrivateBus() : bus_(g_test_dbus_new(G_TEST_DBUS_NONE)) { g_test_dbus_up(bus_); }

PrivateBus::~PrivateBus() {
  stop();
  g_object_unref(bus_);
}

void PrivateBus::stop() {
  if (g_test_dbus_get_bus_address(bus_) != nullptr) g_test_dbus_stop(bus_);
}

std::string PrivateBus::address() const { return g_test_dbus_get_bus_address(bus_); }

ConnectionHandle PrivateBus::connect() const {
  const auto flags =
      static_cast<GDBusConnectionFlags>(G_DBUS_CONNECTION_FLAGS_AUTHENTICATION_CLIENT |
                                        G_DBUS_CONNECTION_FLAGS_MESSAGE_BUS_CONNECTION);
  GErrorPtr error;
  ConnectionHandle connection(g_dbus_connection_new_for_address_sync(address().c_str(), flags,
                                                                     nullptr, nullptr, out(error)));
  EXPECT_TRUE(connection) << (error ? error->message : "");
  return connection;
}
