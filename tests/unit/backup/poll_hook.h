/**
 * @file poll_hook.h
 * @brief The pipeline's pauses, without the time: each runs a hook instead.
 */
#ifndef POLL_HOOK_H
#define POLL_HOOK_H

#include <functional>

/** Called for every pause, with the number of those before it. */
void set_poll_hook(std::function<void(int pause)> hook);
/** Pauses since the hook was set. */
int polls();

#endif
