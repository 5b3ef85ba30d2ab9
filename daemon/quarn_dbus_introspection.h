/**
 * @file quarn_dbus_introspection.h
 * @brief The introspection document of the interface "org.orvane.Quarn". Any thread.
 */
#ifndef QUARN_DBUS_INTROSPECTION_H
#define QUARN_DBUS_INTROSPECTION_H

/**
 * The document, with tabs between its elements, made by the compiler from kQuarnMethods;
 * data/org.orvane.Quarn.xml says the same.
 */
extern const char *const quarn_introspection_xml;

#endif
