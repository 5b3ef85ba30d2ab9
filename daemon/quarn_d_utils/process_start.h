/**
 * @file process_start.h
 * @brief When this process began, as the file system's clock tells it.
 */
#ifndef QUARN_D_UTILS_PROCESS_START_H
#define QUARN_D_UTILS_PROCESS_START_H

#include <ctime>

/**
 * A file whose status changed at this time or later was made by this process,
 * not left behind by an earlier one. Set once, before main().
 */
extern timespec quarn_process_start;

#endif
