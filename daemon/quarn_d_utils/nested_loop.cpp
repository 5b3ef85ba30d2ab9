#include <vector>

#include "quarn_d_utils/quarn_d_utils.h"

namespace {

/** Outermost first. */
std::vector<GMainLoop *> nested_loops;
bool refuse_nested_loops = false;

}  // namespace

void run_nested_loop(GMainLoop *loop) {
  if (refuse_nested_loops) return;
  nested_loops.push_back(loop);
  g_main_loop_run(loop);
  nested_loops.pop_back();
}

void quit_nested_loops() {
  refuse_nested_loops = true;
  for (auto loop = nested_loops.rbegin(); loop != nested_loops.rend(); ++loop) {
    g_main_loop_quit(*loop);
  }
}
