/**
 * @file quarn_d_packages.h
 * @brief The object /org/orvane/Quarn/Packages. Main thread only.
 */
#ifndef QUARN_D_PACKAGES_H
#define QUARN_D_PACKAGES_H

#include <gio/gio.h>

inline constexpr char kPackagesObjectPath[] = "/org/orvane/Quarn/Packages";

/** Its introspection document. */
extern const char kPackagesIntrospection[];

/** Serve the object on a connection; a failure is logged. */
void quarnd_packages_export(GDBusConnection *connection);
/** Serve it no longer. Harmless when it is not served. */
void quarnd_packages_unexport();

#endif
