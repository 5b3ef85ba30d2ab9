#include "backend_file.h"
#include "session.h"

namespace transport {

std::shared_ptr<Backend> make_backend(const Config &config, std::string *problem) {
  std::string path = path_of_file_url(config.url);
  if (!path.empty()) return make_file_backend(std::move(path));
  *problem = "the url names no store that is known";
  return nullptr;
}

}  // namespace transport
