/**
 * @file rules_private.h
 * @brief What the files of "quarnctl rules" share.
 */
#ifndef QUARNCTL_RULES_PRIVATE_H
#define QUARNCTL_RULES_PRIVATE_H

#include <json-c/json.h>

#include <string>

/** The verbs' names in documents. */
inline constexpr char kCheckVerb[] = "rules check";
inline constexpr char kExplainVerb[] = "rules explain";

/** Adds the members with which every verb's object ends. @return the object's line */
std::string finish_rules_document(json_object *object, int code, const std::string &message);

#endif
