/**
 * @file kernel_settings.h
 * @brief What the daemon expects of the kernel it runs on, looked at once at its start.
 *
 * Nothing of the daemon rests on these settings alone; they are a second line
 * of defence, and one that a device lacks is told.
 */
#ifndef QUARN_D_UTILS_KERNEL_SETTINGS_H
#define QUARN_D_UTILS_KERNEL_SETTINGS_H

/**
 * Log a warning for each setting that protects less than expected, or that
 * cannot be read: no line where all is well. Changes nothing. Any thread.
 * @param settings the folder of the settings, as a rule /proc/sys
 * @return the number of lines
 */
int tell_kernel_settings(const char *settings = "/proc/sys");

#endif
