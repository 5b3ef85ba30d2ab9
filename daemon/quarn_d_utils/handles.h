/**
 * @file handles.h
 * @brief The owners of C handles, which the daemon shares with client code.
 */
#ifndef QUARN_D_UTILS_HANDLES_H
#define QUARN_D_UTILS_HANDLES_H

#include "quarn_handles.h"

#endif
