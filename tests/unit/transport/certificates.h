/**
 * @file certificates.h
 * @brief Certificates for servers on loopback, made when they are needed.
 */
#ifndef TRANSPORT_CERTIFICATES_H
#define TRANSPORT_CERTIFICATES_H

#include <string>

#include "http_front.h"

struct Validity {
  long from_seconds; /**< counted from now */
  long to_seconds;
};

constexpr long kDaySeconds = 24 * 60 * 60;
constexpr Validity kValidNow{-kDaySeconds, kDaySeconds};
constexpr Validity kExpired{-2 * kDaySeconds, -kDaySeconds};
constexpr Validity kNotYet{kDaySeconds, 2 * kDaySeconds};

/** A certificate that vouches for itself; @p name is an IP address or a host name. */
front::Identity make_identity(const std::string &name, const Validity &validity = kValidNow);

#endif
