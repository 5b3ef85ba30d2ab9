/**
 * @file run_until.h
 * @brief Running the main loop: until what a test is about has come, or as long as there is work.
 */
#ifndef RUN_UNTIL_H
#define RUN_UNTIL_H

#include <chrono>
#include <functional>

/**
 * Run the default main context until @p done, at most @p patience. It is asked after each round and
 * every few milliseconds, so that what no source of the context brings about is seen as well.
 * @return what @p done said last
 */
bool run_until(const std::function<bool()> &done,
               std::chrono::milliseconds patience = std::chrono::seconds(30));

/** Run what is ready in the default main context, and what becomes ready by that; wait for nothing.
 */
void run_pending();

#endif
