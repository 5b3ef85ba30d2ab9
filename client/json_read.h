/**
 * @file json_read.h
 * @brief Reading JSON that may hold anything, and writing texts into it.
 *
 * Every reader accepts a null object and answers with nothing when a member is
 * missing or of another type.
 */
#ifndef QUARN_CLIENT_JSON_READ_H
#define QUARN_CLIENT_JSON_READ_H

#include <json-c/json.h>

#include <cstdint>
#include <optional>
#include <string>

#include "json_ptr.h"

namespace quarn_client {

/** The document of @p text; null when it is not JSON, is nested too deeply or has a tail. */
JsonPtr json_parse(const std::string &text);

/** A member of the given type, borrowed; null when there is none. */
json_object *json_member(json_object *object, const char *name, json_type type);

/** A string member, NULs included. */
std::optional<std::string> json_string(json_object *object, const char *name);

/** An integer member. */
std::optional<std::int64_t> json_integer(json_object *object, const char *name);

/** Adds a string member. */
void json_add(json_object *object, const char *name, const std::string &value);

}  // namespace quarn_client

#endif
