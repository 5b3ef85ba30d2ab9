/**
 * @file this_process.h
 * @brief What this process has in use: memory, threads, descriptors.
 */
#ifndef THIS_PROCESS_H
#define THIS_PROCESS_H

#include <cstddef>

/** Bytes of it that lie in memory now. */
std::size_t resident_bytes();

/** The most that was, in whole kilobytes; since its start, or since 5 was written to clear_refs of
 * proc(5). */
std::size_t peak_resident_bytes();

int threads_in_use();

/** With the one that counting takes. */
int descriptors_in_use();

#endif
