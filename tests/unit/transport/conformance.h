/**
 * @file conformance.h
 * @brief The cases that every store must pass, and what they need to know of one.
 */
#ifndef TRANSPORT_CONFORMANCE_H
#define TRANSPORT_CONFORMANCE_H

#include <map>
#include <memory>
#include <string>

#include "harness.h"

/** A store as a test sees it from outside. */
class TestStore {
 public:
  TestStore() = default;
  TestStore(const TestStore &) = delete;
  TestStore &operator=(const TestStore &) = delete;
  virtual ~TestStore() = default;

  /** Text of the configuration file. */
  virtual std::string config() const = 0;
  /** The same for another, empty store. */
  virtual std::string other_config() = 0;

  /** Everything that lies in the store, by path; an empty folder with a trailing slash. */
  virtual std::map<std::string, std::string> content() const = 0;
  /** Store an object past the library. */
  virtual void put(const std::string &path, const std::string &content) = 0;

  /** From now on the store finishes nothing, until release(). */
  virtual void hold() = 0;
  virtual void release() = 0;

  /** There is no room for more than @p bytes in an object, until unfill(). */
  virtual void fill(std::size_t bytes) = 0;
  virtual void unfill() = 0;

  /** It no longer accepts who we are, until let_in(). */
  virtual void lock_out() = 0;
  virtual void let_in() = 0;

  /** Children of a listing carry the time given at the upload. */
  virtual bool lists_timestamps() const = 0;
};

/** A kind of store; what the suite is instantiated with. */
struct StoreKind {
  const char *name;
  std::unique_ptr<TestStore> (*make)();
};
inline std::ostream &operator<<(std::ostream &out, const StoreKind &kind) {
  return out << kind.name;
}

class Conformance : public ::testing::TestWithParam<StoreKind> {
 protected:
  Conformance() : store(GetParam().make()), cloud(store->config()) {}

  std::unique_ptr<TestStore> store;
  harness::Cloud cloud;
};

#endif
