/**
 * @file quarn_d_status.h
 * @brief A second, read-only object that tells what the daemon knows of itself.
 *
 * "/org/orvane/Quarn/Status" serves the interface "org.orvane.Quarn.Status":
 * properties with change signals (quarn_d_status_properties.h), nothing to call. Its further
 * interface "org.orvane.Quarn.CleanUp" is read at every look and walks over the packages. It is
 * beside the daemon's own object, whose one interface stays as it is.
 */
#ifndef QUARN_D_STATUS_H
#define QUARN_D_STATUS_H

#include <gio/gio.h>

/** Path of the status object. */
inline constexpr char kStatusObjectPath[] = "/org/orvane/Quarn/Status";
/** Its interface. */
inline constexpr char kStatusInterface[] = "org.orvane.Quarn.Status";

/** A further interface of that object: what a backup would leave in the cloud. */
inline constexpr char kCleanUpInterface[] = "org.orvane.Quarn.CleanUp";

/** Serve the object on @p connection, which the caller keeps alive. Main thread. */
void quarnd_status_export(GDBusConnection *connection);

/** Take the object back. Safe when nothing is served. Main thread. */
void quarnd_status_unexport();

/**
 * Compare the properties with what was last told and send what changed, from
 * the main loop. Cheap when nothing is served. Any thread.
 */
void quarnd_status_refresh();

#endif
