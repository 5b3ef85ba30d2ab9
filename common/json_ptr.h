/**
 * @file json_ptr.h
 * @brief Owner for a reference to a JSON object, used as those of quarn_handles.h.
 */
#ifndef JSON_PTR_H
#define JSON_PTR_H

#include <json-c/json_object.h>

#include "quarn_handles.h"

using JsonPtr = Handle<json_object, &json_object_put>;

#endif
