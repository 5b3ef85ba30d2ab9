#include "quarn_d_handler/export_turn.h"

#include <glib.h>

#include <algorithm>
#include <cstdint>
#include <map>
#include <string>
#include <utility>
#include <vector>

#include "quarn_d_utils/nested_loop.h"

namespace {

std::vector<ExportTurn *> waiting;
ExportTurn *running = nullptr;
/** When those who ask began last, of all beginnings. */
std::map<std::string, std::uint64_t> began;
std::uint64_t beginnings = 0;

}  // namespace

ExportTurn::ExportTurn(std::string whose) : whose_(std::move(whose)), loop_(new_wait_loop()) {}

ExportTurn::~ExportTurn() { end(); }

bool ExportTurn::wait() {
  if (waits_are_ended()) return false;
  waiting.push_back(this);
  give_to_next();
  if (running == this) return true;
  run_nested_loop(loop_.get());
  if (running == this && !waits_are_ended()) return true;
  end();
  return false;
}

void ExportTurn::end() {
  const auto place = std::find(waiting.begin(), waiting.end(), this);
  if (place != waiting.end()) waiting.erase(place);
  if (running != this) return;
  running = nullptr;
  give_to_next();
}

void ExportTurn::give_to_next() {
  if (running != nullptr) return;
  if (waiting.empty()) {
    began.clear();
    return;
  }
  const auto last_of = [](const ExportTurn *turn) {
    const auto entry = began.find(turn->whose_);
    return entry == began.end() ? 0 : entry->second;
  };
  const auto next = std::min_element(waiting.begin(), waiting.end(),
                                     [&](const ExportTurn *one, const ExportTurn *other) {
                                       return last_of(one) < last_of(other);
                                     });
  running = *next;
  waiting.erase(next);
  began[running->whose_] = ++beginnings;
  g_main_loop_quit(running->loop_.get());
}
