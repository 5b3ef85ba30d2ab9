/**
 * @file loopback.h
 * @brief Addresses of servers that only this machine reaches.
 */
#ifndef LOOPBACK_H
#define LOOPBACK_H

#include <netinet/in.h>

#include <cstdint>

/** @param port 0: one that the system chooses when the address is bound */
inline sockaddr_in loopback(int port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  address.sin_port = htons(static_cast<std::uint16_t>(port));
  return address;
}

#endif
