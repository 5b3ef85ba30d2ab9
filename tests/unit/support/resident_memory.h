/**
 * @file resident_memory.h
 * @brief How much memory this process has in use.
 */
#ifndef RESIDENT_MEMORY_H
#define RESIDENT_MEMORY_H

#include <cstddef>

/** Bytes of it that lie in memory now. */
std::size_t resident_bytes();

#endif
