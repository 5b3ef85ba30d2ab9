/**
 * @file platform_log.h
 * @brief The device's logging service.
 *
 * One call writes one message. Any thread may call it; a message never
 * interleaves with another. There is no error to handle: a log that cannot be
 * written is lost.
 */
#ifndef QUARN_PLATFORM_LOG_H
#define QUARN_PLATFORM_LOG_H

#ifdef __cplusplus
extern "C" {
#endif

/** Log buffers: ordinary messages and those of the system itself. */
typedef enum { LOG_ID_MAIN = 0, LOG_ID_SYSTEM = 3 } log_id_t;

/** Severity, least first. */
typedef enum { DLOG_DEBUG = 3, DLOG_INFO = 4, DLOG_WARN = 5, DLOG_ERROR = 6 } log_priority;

/**
 * Write one message.
 * @param id    buffer
 * @param prio  severity
 * @param tag   the program's tag, at most 31 characters
 * @param fmt   printf format; the daemon begins it with "%s: %s(%d) > " for
 *              file name, function and line, which the service may take apart
 * @return number of bytes written, negative when the message was lost
 */
int dlog_print(log_id_t id, log_priority prio, const char *tag, const char *fmt, ...)
    __attribute__((format(printf, 4, 5)));

#ifdef __cplusplus
}
#endif
#endif
