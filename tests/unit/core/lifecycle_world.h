/**
 * @file lifecycle_world.h
 * @brief The scripted world of the tests of the daemon's end.
 */
#ifndef LIFECYCLE_WORLD_H
#define LIFECYCLE_WORLD_H

/** What is_idle_status() says. */
extern bool lifecycle_idle;
/** How often the main loop was quit. */
extern int lifecycle_quits;

#endif
