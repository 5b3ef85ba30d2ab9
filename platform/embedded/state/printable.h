/**
 * @file printable.h
 * @brief Texts that hold names anybody may have chosen, as a log or a terminal may have them.
 */
#ifndef QUARN_EMBEDDED_PRINTABLE_H
#define QUARN_EMBEDDED_PRINTABLE_H

#include "quarn_printable.h"

namespace embedded {

inline std::string printable(const std::string &text) { return quarn_printable(text); }

}  // namespace embedded

#endif
