/**
 * @file rules_file.h
 * @brief An application's rules file as the daemon reads it.
 */
#ifndef QUARN_D_UTILS_RULES_FILE_H
#define QUARN_D_UTILS_RULES_FILE_H

#include <libxml/tree.h>

#include <cstddef>

#include "quarn_d_utils/handles.h"

/** Larger files are ignored: a parsed document takes many times its text. Bytes. */
inline constexpr std::size_t kMaxRulesSize = 256U << 10;

/** Owner of a parsed document. */
using RulesDoc = Handle<xmlDoc, &xmlFreeDoc>;

/**
 * Read and parse a rules file without network, external parts or entities.
 * @return null when the daemon ignores the file: not readable, too large,
 *         malformed, or with a document type of its own declarations
 */
RulesDoc load_rules(const char *path);

#endif
