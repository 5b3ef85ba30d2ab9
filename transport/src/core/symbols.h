/**
 * @file symbols.h
 * @brief Functions of libraries that are loaded when they are needed.
 */
#ifndef BACKUP_TRANSPORT_SYMBOLS_H
#define BACKUP_TRANSPORT_SYMBOLS_H

#include <dlfcn.h>

namespace transport {

/** The function @p name of @p library, or of one it depends on. @return false when there is none */
template <typename Function>
bool find_symbol(void *library, const char *name, Function *function) {
  *function = reinterpret_cast<Function>(dlsym(library, name));
  return *function != nullptr;
}

}  // namespace transport

#endif
