/**
 * @file fault_table.h
 * @brief Every fault, and what must come of it; docs/faults.md shows the same.
 */
#ifndef TRANSPORT_FAULT_TABLE_H
#define TRANSPORT_FAULT_TABLE_H

#include <array>
#include <string>
#include <vector>

#include "certificates.h"
#include "network_store.h"

/** Where a session finds its server. */
enum class Place {
  plain,        /**< HTTP on loopback */
  silent_port,  /**< nothing listens */
  unknown_name, /**< the host's name cannot be resolved */
  tls,          /**< HTTPS, with FaultRow::certificate_name and validity */
  tls_unknown,  /**< the same, vouched for by nobody */
  tls_plain,    /**< HTTPS is asked for, HTTP is spoken */
  tls_silent,   /**< HTTPS is asked for, and nothing comes back */
};

/** What a step ends with: "RESULT ATTEMPTS LEFT"; null: the fault makes no sense there. */
using Expected = std::array<const char *, kSteps>;

struct FaultRow {
  std::string name;
  front::Fault fault;
  int last = front::kForEver;
  bool takes_effect = false;
  bool at_look = false; /**< hits the look at what was uploaded, instead of the step */
  Place place = Place::plain;
  bool refused_once = false;
  std::string certificate_name;
  Validity validity = kValidNow;
  Expected dav{};
  Expected s3{};
  Expected in_place{}; /**< WebDAV on a server that cannot move, and keeps what was cut off */
};

/** @param elsewhere origin of a server that nobody has a reason to talk to */
std::vector<FaultRow> fault_table(const std::string &elsewhere);

/** One store's columns as a table of a document; steps that the store does not have are left out.
 */
std::string fault_document(Expected FaultRow::*cells);

#endif
