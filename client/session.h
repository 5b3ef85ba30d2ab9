/**
 * @file session.h
 * @brief Carries out one command of quarnctl.
 */
#ifndef QUARN_CLIENT_SESSION_H
#define QUARN_CLIENT_SESSION_H

#include "arguments.h"

namespace quarn_client {

/**
 * Runs the command to its end on the default main context.
 * @return the exit code; everything has been printed
 */
int run_command(const Command &command);

/** Prints why the arguments were not understood. @return the exit code */
int report_usage_error(const Command &command, const std::string &error);

}  // namespace quarn_client

#endif
