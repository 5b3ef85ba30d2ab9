/**
 * @file quarn_dbus_limits.h
 * @brief How much a call may bring. Any thread.
 */
#ifndef QUARN_DBUS_LIMITS_H
#define QUARN_DBUS_LIMITS_H

#include <glib.h>

#include <cstddef>
#include <string>

/** Bytes of all arguments of a call; beyond it they are not even kept until they are refused. */
inline constexpr std::size_t kMostArgumentBytes = 4096;
/** The same of restore_enable, which brings a list. */
inline constexpr std::size_t kMostListArgumentBytes = 524288;
/** Bytes of the text that lists the candidates of restore mode. */
inline constexpr std::size_t kMostListBytes = 262144;
/** Packages in it. */
inline constexpr std::size_t kMostCandidates = 4096;
/** Bytes of a package id or a serial number: it has to be a file's name. */
inline constexpr std::size_t kMostNameBytes = 255;

inline constexpr char kArgumentsTooLarge[] = "The arguments are too large";

/** How many bytes the arguments of a method may have, before anyone looks into them. */
[[nodiscard]] std::size_t most_argument_bytes(const char *member);

/**
 * What is too much in a call's arguments.
 * @param arguments those of the interface's method, or null
 * @return a sentence, empty when all is within the bounds
 */
[[nodiscard]] std::string excess_of_arguments(const std::string &member, GVariant *arguments);

/** Elements of the JSON array @p text: never less than it has, without parsing it. */
[[nodiscard]] std::size_t most_elements_of(const char *text);

#endif
