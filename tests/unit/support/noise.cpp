#include "noise.h"

#include <cstdint>

std::string noise(std::size_t size, unsigned int seed) {
  std::string text(size, '\0');
  std::uint32_t state = seed * 2654435761U + 1;
  for (char &c : text) {
    state = state * 1664525U + 1013904223U;
    c = static_cast<char>(state >> 24);
  }
  return text;
}
