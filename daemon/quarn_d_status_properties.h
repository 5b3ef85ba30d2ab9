/**
 * @file quarn_d_status_properties.h
 * @brief The properties of the status object: the one list of their names, types, values and of
 * which of them tell when they change. Main thread only.
 *
 * What is read, what is told of changes and the introspection document come from it.
 */
#ifndef QUARN_D_STATUS_PROPERTIES_H
#define QUARN_D_STATUS_PROPERTIES_H

#include <gio/gio.h>

#include <cstddef>
#include <string>

/** Whether a property tells when it changes. */
enum class change_signal { told, not_told, constant };

struct status_property {
  const char *name;
  const char *type;
  change_signal changes;
  /** @return the value, floating; null with @p error, which may be null itself */
  GVariant *(*read)(GError **error);
};

/** One interface of the object. */
struct status_interface {
  const char *name;
  const status_property *properties;
  std::size_t count;

  const status_property *begin() const { return properties; }
  const status_property *end() const { return properties + count; }
};

/** What the daemon knows of itself. */
extern const status_interface kStatus;
/** What a backup would leave in the cloud. */
extern const status_interface kCleanUp;

/** The object's introspection document; data/org.orvane.Quarn.Status.xml is the same. */
extern const char *const kStatusIntrospection;

/** @return null: the interface has no such property */
[[nodiscard]] const status_property *find_status_property(const status_interface &of,
                                                          const std::string &name);

#endif
