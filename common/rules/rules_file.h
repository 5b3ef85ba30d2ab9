/**
 * @file rules_file.h
 * @brief An application's rules file as the daemon reads it.
 */
#ifndef QUARN_D_UTILS_RULES_FILE_H
#define QUARN_D_UTILS_RULES_FILE_H

#include <libxml/tree.h>

#include <cstddef>

#include "quarn_d_utils/handles.h"
#include "quarn_d_utils/rules_state.h"

/** Larger files are not parsed: a document takes many times its text. Bytes. */
inline constexpr std::size_t kMaxRulesSize = 256U << 10;

/** Owner of a parsed document. */
using RulesDoc = Handle<xmlDoc, &xmlFreeDoc>;

/**
 * Read and parse a rules file without network, external parts or entities.
 * @param[out] state what became of it: loaded, when there is a document, or why there is none
 */
RulesDoc load_rules(const char *path, rules_state *state);

#endif
