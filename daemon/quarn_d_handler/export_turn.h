/**
 * @file export_turn.h
 * @brief Exports are made one after the other.
 *
 * One package is packed at a time whatever asks for it, so that more threads
 * than one would only wait, each with its stack, and whoever ends an export
 * would wait with them. Main thread.
 */
#ifndef QUARN_D_HANDLER_EXPORT_TURN_H
#define QUARN_D_HANDLER_EXPORT_TURN_H

#include <string>

#include "glib_handles.h"

/** One export's place among all. */
class ExportTurn {
 public:
  /** @param whose who asks, and for what: who was served longest ago comes next */
  explicit ExportTurn(std::string whose);
  ~ExportTurn();
  ExportTurn(const ExportTurn &) = delete;
  ExportTurn &operator=(const ExportTurn &) = delete;

  /**
   * Wait, on the request's fiber, until it comes.
   * @return false when it is not wanted any more: it was withdrawn, or the process ends
   */
  [[nodiscard]] bool wait();
  /** The next one comes. Goes by itself with the object. */
  void end();

 private:
  static void give_to_next();

  const std::string whose_;
  const GMainLoopPtr loop_;
};

#endif
