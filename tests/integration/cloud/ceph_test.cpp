// The S3 store over TLS, which Ceph's gateway offers.
#include "s3_service.h"

using namespace harness;

namespace {

TEST_F(S3ServiceTest, TlsIsVerified) {
  const std::string url = "[cloud]\nurl=s3+https://localhost:" + std::to_string(server.tls_port()) +
                          "/" + S3Server::kBucket + "/" + name_ + credentials();
  cloud.configure(url);
  EXPECT_EQ(cloud.get("/a"), "<18>");
  cloud.configure(url + "ca-file=" + server.authority() + "\n");
  expect_service("/f");
  EXPECT_EQ(cloud.get("/list", BACKUP_TRANS_OPTION_BASIS), "<12>");
  EXPECT_EQ(cloud.put("/list", "one"), 0);
  EXPECT_EQ(cloud.get("/list", BACKUP_TRANS_OPTION_BASIS), "one");
  EXPECT_EQ(cloud.put("/list", "two"), 0);
}

}  // namespace
