/**
 * @file private_bus.h
 * @brief A bus daemon of the test's own.
 */
#ifndef PRIVATE_BUS_H
#define PRIVATE_BUS_H

#include <gio/gio.h>

#include <string>

#include "quarn_handles.h"

using ConnectionHandle = Handle<GDBusConnection, &g_object_unref>;

/** It runs as long as this lives, or until it is stopped. Nobody's connection keeps it. */
class PrivateBus {
 public:
  PrivateBus();
  ~PrivateBus();
  PrivateBus(const PrivateBus &) = delete;
  PrivateBus &operator=(const PrivateBus &) = delete;

  std::string address() const;
  /** A connection of one's own; a failure of the test, and null, when there is none. */
  ConnectionHandle connect() const;
  /** End it, as a bus does that dies. */
  void stop();

 private:
  GTestDBus *bus_;
};

#endif
