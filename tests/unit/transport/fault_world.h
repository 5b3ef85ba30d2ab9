/**
 * @file fault_world.h
 * @brief A session, its server, and everything that is seen of them while a fault is there.
 */
#ifndef TRANSPORT_FAULT_WORLD_H
#define TRANSPORT_FAULT_WORLD_H

#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "core/backend.h"
#include "fault_table.h"
#include "harness.h"
#include "virtual_clock.h"

/** One attempt of the session at a request. */
struct Tried {
  transport::Outcome outcome;
  transport::RetryClock::Point began;
  transport::RetryClock::Point ended;
};

/** A server that only takes notes. */
class Stranger : public front::Service {
 public:
  front::Response serve(const front::Request &) override { return 200; }
};

/** The step's operation, run once into the row's fault. */
class FaultWorld {
 public:
  /** What takes time passes at once, or stands still until it is cancelled. */
  enum class Time { passes, stands };

  FaultWorld(const FaultRow &row, Step step, std::unique_ptr<NetworkStore> store,
             Time time = Time::passes);
  FaultWorld(const FaultWorld &) = delete;
  FaultWorld &operator=(const FaultWorld &) = delete;
  ~FaultWorld();

  /** Begin the step's operation. */
  harness::AnswerPtr start();
  /** Wait until the fault holds it up, or it has ended. */
  bool wait_held_up();
  /** Wait for its end. @return false when it did not come */
  bool finish();

  /** What came of it: "RESULT ATTEMPTS LEFT". */
  std::string summary() const;
  /** "" when all is well; else what is wrong with the device, the store or the time it took. */
  std::string objection() const;
  /** The same without the time. */
  std::string damage() const;

  /** Everything that was told, to look for what must not be. */
  std::string told() const;

  std::vector<Tried> tried() const;
  VirtualClock &clock() { return clock_; }
  front::Front &front() { return *front_; }
  harness::Cloud &cloud() { return *cloud_; }
  NetworkStore &store() { return *store_; }

 private:
  class Recorder;

  std::string origin() const;
  void spoil();
  std::string left() const;

  const FaultRow row_;
  const Step step_;
  VirtualClock clock_;
  VirtualClock tidying_clock_;  // stands still for nobody
  std::unique_ptr<NetworkStore> store_;
  const harness::TempDir certificates_;
  front::SilentPort silent_port_;
  std::unique_ptr<front::Identity> identity_;
  std::unique_ptr<front::Front> front_;
  mutable std::mutex mutex_;
  std::vector<Tried> tried_;
  std::unique_ptr<harness::Cloud> cloud_;
  std::string local_;
  harness::AnswerPtr answer_;
  std::size_t files_before_ = 0;
};

#endif
