/**
 * @file backend_file.h
 * @brief A store that is a folder.
 *
 * The folder holds the objects and nothing else. Commits of several processes
 * are serialised by a flock on the folder itself.
 */
#ifndef BACKUP_TRANSPORT_BACKEND_FILE_H
#define BACKUP_TRANSPORT_BACKEND_FILE_H

#include <memory>
#include <string>

#include "core/backend.h"

namespace transport {

/** @return the local path of a file:// URL, "" when it is none */
std::string path_of_file_url(const std::string &url);

/** @param root absolute; made when something is first stored */
[[nodiscard]] std::shared_ptr<Backend> make_file_backend(std::string root);

}  // namespace transport

#endif
