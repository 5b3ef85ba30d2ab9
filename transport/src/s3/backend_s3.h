/**
 * @file backend_s3.h
 * @brief A store that is a bucket, or a part of one, of an S3 service.
 */
#ifndef BACKUP_TRANSPORT_BACKEND_S3_H
#define BACKUP_TRANSPORT_BACKEND_S3_H

#include <memory>
#include <string>

#include "core/backend.h"
#include "core/config.h"
#include "http/url.h"

namespace transport {

/** An object's name is any text, so that nothing of an address is taken for the same. */
inline constexpr StoreScheme kS3Scheme{"s3", Slashes::kKept};

/** @return null with @p problem when the configuration cannot be meant */
[[nodiscard]] std::shared_ptr<Backend> make_s3_backend(const StoreUrl &url, const Config &config,
                                                       std::string *problem);

}  // namespace transport

#endif
