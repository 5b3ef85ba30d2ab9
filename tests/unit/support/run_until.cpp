#include "run_until.h"

#include <glib.h>

bool run_until(const std::function<bool()> &done, std::chrono::milliseconds patience) {
  constexpr guint kTickMs = 5;
  const auto end = std::chrono::steady_clock::now() + patience;
  const guint ticker = g_timeout_add(
      kTickMs, [](gpointer) -> gboolean { return G_SOURCE_CONTINUE; }, nullptr);
  bool met = done();
  while (!met && std::chrono::steady_clock::now() < end) {
    g_main_context_iteration(nullptr, TRUE);
    met = done();
  }
  g_source_remove(ticker);
  return met;
}

void run_pending() {
  while (g_main_context_iteration(nullptr, FALSE) != FALSE) {
  }
}
