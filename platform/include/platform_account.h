/**
 * @file platform_account.h
 * @brief Accounts that are signed in on the device. Main thread.
 *
 * Functions return #ACCOUNT_ERROR_NONE or a negative error.
 */
#ifndef QUARN_PLATFORM_ACCOUNT_H
#define QUARN_PLATFORM_ACCOUNT_H

#include <stdbool.h>

#ifdef __cplusplus
extern "C" {
#endif

#define ACCOUNT_ERROR_NONE 0
#define ACCOUNT_ERROR_INVALID_PARAMETER (-22)
#define ACCOUNT_ERROR_RECORD_NOT_FOUND (-3)
#define ACCOUNT_ERROR_DB_FAILED (-5)

typedef struct account_s *account_h;

/** One account of a query; it belongs to the service. Return false to stop. */
typedef bool (*account_cb)(account_h account, void *user_data);

int account_connect(void);
int account_disconnect(void);
/** Visit the accounts of one package; #ACCOUNT_ERROR_RECORD_NOT_FOUND when there is none. */
int account_query_account_by_package_name(account_cb callback, const char *package_name,
                                          void *user_data);
/** The user's name, malloc'd and the caller's. */
int account_get_user_name(account_h account, char **user_name);

#ifdef __cplusplus
}
#endif
#endif
