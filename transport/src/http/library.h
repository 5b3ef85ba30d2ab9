/**
 * @file library.h
 * @brief The HTTP library, loaded when the network is first needed.
 */
#ifndef BACKUP_TRANSPORT_HTTP_LIBRARY_H
#define BACKUP_TRANSPORT_HTTP_LIBRARY_H

// The checking macros would want the functions themselves, which are looked up at run time.
#define CURL_DISABLE_TYPECHECK
#include <curl/curl.h>

namespace transport {

/** Its name, for people; the first of those that it is looked for under. */
extern const char *const kHttpLibrary;

/** Its functions. */
struct Curl {
  decltype(&::curl_global_init) global_init = nullptr;
  decltype(&::curl_easy_init) easy_init = nullptr;
  decltype(&::curl_easy_setopt) easy_setopt = nullptr;
  decltype(&::curl_easy_getinfo) easy_getinfo = nullptr;
  decltype(&::curl_easy_cleanup) easy_cleanup = nullptr;
  decltype(&::curl_easy_strerror) easy_strerror = nullptr;
  decltype(&::curl_slist_append) slist_append = nullptr;
  decltype(&::curl_slist_free_all) slist_free_all = nullptr;
  decltype(&::curl_multi_init) multi_init = nullptr;
  decltype(&::curl_multi_setopt) multi_setopt = nullptr;
  decltype(&::curl_multi_add_handle) multi_add_handle = nullptr;
  decltype(&::curl_multi_remove_handle) multi_remove_handle = nullptr;
  decltype(&::curl_multi_perform) multi_perform = nullptr;
  decltype(&::curl_multi_poll) multi_poll = nullptr;
  decltype(&::curl_multi_wakeup) multi_wakeup = nullptr;
  decltype(&::curl_multi_info_read) multi_info_read = nullptr;
  decltype(&::curl_multi_cleanup) multi_cleanup = nullptr;
};

/** Load and set it up, with what it brings along. @return false when it cannot be; @p curl is void
 */
[[nodiscard]] bool load_http_library(Curl *curl);

}  // namespace transport

#endif
