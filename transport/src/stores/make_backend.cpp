#include "stores/make_backend.h"

#include "file/backend_file.h"
#include "http/url.h"
#include "s3/backend_s3.h"
#include "webdav/backend_webdav.h"

namespace transport {

std::shared_ptr<Backend> make_backend(const Config &config, std::string *problem) {
  std::string path = path_of_file_url(config.url);
  if (!path.empty()) return make_file_backend(std::move(path));
  StoreUrl url;
  if (parse_store_url(config.url, kWebdavScheme, &url, problem))
    return make_webdav_backend(url, config, problem);
  if (problem->empty() && parse_store_url(config.url, kS3Scheme, &url, problem))
    return make_s3_backend(url, config, problem);
  if (problem->empty()) *problem = "the url names no store that is known";
  return nullptr;
}

}  // namespace transport
