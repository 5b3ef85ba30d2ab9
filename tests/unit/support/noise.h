/**
 * @file noise.h
 * @brief Content that does not compress.
 */
#ifndef NOISE_H
#define NOISE_H

#include <cstddef>
#include <string>

/** @p size bytes, the same at each call with the same @p seed. */
std::string noise(std::size_t size, unsigned int seed = 1);

#endif
