/**
 * @file network_kinds.h
 * @brief The network stores that the fault matrix runs over.
 */
#ifndef TRANSPORT_NETWORK_KINDS_H
#define TRANSPORT_NETWORK_KINDS_H

#include <memory>

#include "network_store.h"

std::unique_ptr<NetworkStore> make_dav_network_store();
/** A server that cannot move, and keeps what it got of an upload that was cut off. */
std::unique_ptr<NetworkStore> make_dav_in_place_store();
std::unique_ptr<NetworkStore> make_s3_network_store();

#endif
