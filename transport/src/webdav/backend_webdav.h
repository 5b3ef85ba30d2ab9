/**
 * @file backend_webdav.h
 * @brief A store that is a collection of a WebDAV server.
 */
#ifndef BACKUP_TRANSPORT_BACKEND_WEBDAV_H
#define BACKUP_TRANSPORT_BACKEND_WEBDAV_H

#include <memory>
#include <string>

#include "core/backend.h"
#include "core/config.h"
#include "http/url.h"

namespace transport {

/** The servers answer with single slashes whatever they are asked for. */
inline constexpr StoreScheme kWebdavScheme{"webdav", Slashes::kOne};

/** Null with @p problem when nothing can be meant by the configuration. */
[[nodiscard]] std::shared_ptr<Backend> make_webdav_backend(const StoreUrl &url,
                                                           const Config &config,
                                                           std::string *problem);

}  // namespace transport

#endif
