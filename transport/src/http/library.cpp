#include "http/library.h"

#include <dlfcn.h>

#include <cstdint>

#include "core/checksum.h"
#include "core/symbols.h"

namespace transport {
namespace {

constexpr const char *kLibraries[] = {"libcurl.so.4", "libcurl-gnutls.so.4"};

// The TLS library would otherwise take itself down when the process exits, under a thread that is
// only just setting it up.
void keep_tls_until_the_end(void *library) {
  constexpr uint64_t kNoExitHandler = 0x00080000;  // OPENSSL_INIT_NO_ATEXIT of <openssl/crypto.h>
  int (*init)(uint64_t, const void *) = nullptr;
  if (find_symbol(library, "OPENSSL_init_crypto", &init)) init(kNoExitHandler, nullptr);
}

}  // namespace

const char *const kHttpLibrary = kLibraries[0];

bool load_http_library(Curl *curl) {
  void *library = nullptr;
  for (const char *name : kLibraries) {
    if (library == nullptr) library = dlopen(name, RTLD_NOW | RTLD_LOCAL);
  }
  if (library == nullptr) return false;
  keep_tls_until_the_end(library);
  count_checksums_with(library);
  return find_symbol(library, "curl_global_init", &curl->global_init) &&
         find_symbol(library, "curl_easy_init", &curl->easy_init) &&
         find_symbol(library, "curl_easy_setopt", &curl->easy_setopt) &&
         find_symbol(library, "curl_easy_getinfo", &curl->easy_getinfo) &&
         find_symbol(library, "curl_easy_cleanup", &curl->easy_cleanup) &&
         find_symbol(library, "curl_easy_strerror", &curl->easy_strerror) &&
         find_symbol(library, "curl_slist_append", &curl->slist_append) &&
         find_symbol(library, "curl_slist_free_all", &curl->slist_free_all) &&
         find_symbol(library, "curl_multi_init", &curl->multi_init) &&
         find_symbol(library, "curl_multi_setopt", &curl->multi_setopt) &&
         find_symbol(library, "curl_multi_add_handle", &curl->multi_add_handle) &&
         find_symbol(library, "curl_multi_remove_handle", &curl->multi_remove_handle) &&
         find_symbol(library, "curl_multi_perform", &curl->multi_perform) &&
         find_symbol(library, "curl_multi_poll", &curl->multi_poll) &&
         find_symbol(library, "curl_multi_wakeup", &curl->multi_wakeup) &&
         find_symbol(library, "curl_multi_info_read", &curl->multi_info_read) &&
         find_symbol(library, "curl_multi_cleanup", &curl->multi_cleanup) &&
         curl->global_init(CURL_GLOBAL_DEFAULT) == CURLE_OK;
}

}  // namespace transport
