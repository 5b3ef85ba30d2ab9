/**
 * @file dav_test.h
 * @brief A session on a WebDAV server in this process, where other devices and odd servers come in
 * between.
 */
#ifndef TRANSPORT_DAV_TEST_H
#define TRANSPORT_DAV_TEST_H

#include <gtest/gtest.h>

#include <functional>
#include <map>
#include <string>

#include "dav_model.h"
#include "harness.h"
#include "http_front.h"
#include "virtual_clock.h"

using Content = std::map<std::string, std::string>;

constexpr char kObject[] = "/f/o";
constexpr char kForeign[] = "of another device";

/** Pauses pass at once. */
class DavTest : public ::testing::Test {
 protected:
  DavTest();
  ~DavTest() override;

  std::string config() const;
  /** Requests so far of a method whose target holds a text. */
  int requests(const std::string &method, const std::string &target) const;
  /** @p change gets the server's answer to the object's nth such request, once it is made up. */
  static front::Rule after(const char *method, int nth,
                           std::function<void(front::Response *)> change);
  /** The first @p last requests of a method get that answer, and are not done. */
  static front::Rule refusal(const char *method, const char *target, int status, int last = 1);
  /** An object is there, and its content the basis of the next upload. */
  void read_as_basis(const std::string &content);

  VirtualClock clock;
  DavModel model;
  front::Front server{model};
  harness::Cloud cloud;
};

#endif
