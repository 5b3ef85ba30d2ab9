/**
 * @file platform_telephony.h
 * @brief The modem, whose IMEI is the device's serial number. Any thread.
 */
#ifndef QUARN_PLATFORM_TELEPHONY_H
#define QUARN_PLATFORM_TELEPHONY_H

#ifdef __cplusplus
extern "C" {
#endif

#define TAPI_API_SUCCESS 0

typedef struct tapi_handle TapiHandle;

/** Open the modem @p cp_name (NULL: the only one); NULL when there is none. */
TapiHandle *tel_init(const char *cp_name);
/** Close it. */
int tel_deinit(TapiHandle *handle);
/** The IMEI, malloc'd and the caller's; NULL when it cannot be read. */
char *tel_get_misc_me_imei_sync(TapiHandle *handle);

#ifdef __cplusplus
}
#endif
#endif
