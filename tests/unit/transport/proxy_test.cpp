// The proxies that a shell's environment names.
#include <gtest/gtest.h>

#include "dav_model.h"
#include "harness.h"

using namespace harness;

namespace {

std::string local_url(const front::Front &front) {
  return "http://127.0.0.1:" + std::to_string(front.port());
}

// Uploads with a proxy in the environment: CONFIG-PATH PROXY. Its exit status is the result.
int proxied_role(int argc, char **argv) {
  if (argc != 2) return 125;
  for (const char *name : {"http_proxy", "ALL_PROXY", "all_proxy"}) setenv(name, argv[1], 1);
  for (const char *name : {"NO_PROXY", "no_proxy"}) unsetenv(name);
  Cloud cloud(read_file(argv[0]));
  return cloud.put("/a", "x");
}
const bool added = add_role("proxied", proxied_role);

TEST(Proxy, IsNotTakenForThisMachineItself) {
  DavModel model;
  const front::Front server(model);
  DavModel proxy_model;
  const front::Front proxy(proxy_model);
  const TempDir dir;
  write_file(dir / "cloud.conf", "[cloud]\nurl=webdav+" + local_url(server) + DavModel::kRoot +
                                     "\nuser=device\npassword=right\n");
  EXPECT_EQ(run_role({"proxied", dir / "cloud.conf", local_url(proxy)}), 0);
  EXPECT_EQ(proxy.log(), std::vector<std::string>{});
  EXPECT_EQ(model.content().count("/a"), 1U);
}

}  // namespace
