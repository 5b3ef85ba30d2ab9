/**
 * @file make_backend.h
 * @brief Which kinds of store there are.
 */
#ifndef BACKUP_TRANSPORT_MAKE_BACKEND_H
#define BACKUP_TRANSPORT_MAKE_BACKEND_H

#include <memory>
#include <string>

#include "core/backend.h"
#include "core/config.h"

namespace transport {

/**
 * The store that a configuration names.
 * @return null, with @p problem, when it names none that can be
 */
[[nodiscard]] std::shared_ptr<Backend> make_backend(const Config &config, std::string *problem);

}  // namespace transport

#endif
