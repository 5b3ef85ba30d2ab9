// The S3 backend's store, seen over the service's other interface.
#include "conformance.h"
#include "s3_server.h"

using namespace harness;

namespace {

constexpr char kKind[] = CLOUD_SERVER;
constexpr auto &kBucket = S3Server::kBucket;

std::unique_ptr<S3Server> &the_server() {
  static std::unique_ptr<S3Server> server;
  return server;
}

class Server : public ::testing::Environment {
 public:
  void SetUp() override {
    the_server() = S3Server::make(kKind);
    the_server()->make_bucket(kBucket);
  }
  void TearDown() override { the_server().reset(); }
};
::testing::Environment *const server = ::testing::AddGlobalTestEnvironment(new Server);

class S3Store : public TestStore {
 public:
  S3Store() : server_(*the_server()), name_("store" + std::to_string(++count_)) {}

  std::string config() const override { return config_for(name_); }
  std::string other_config() override { return config_for(name_ + "%20other"); }
  std::map<std::string, std::string> content() const override {
    return server_.content(kBucket, name_);
  }
  void put(const std::string &path, const std::string &content) override {
    server_.put(kBucket, name_ + path, content);
  }
  void hold() override { server_.freeze(); }
  void release() override { server_.thaw(); }
  void fill(std::size_t bytes) override { server_.limit(kBucket, bytes); }
  void unfill() override { server_.unlimit(kBucket); }
  void lock_out() override { server_.accept_secret("another"); }
  void let_in() override { server_.accept_secret(S3Server::kSecret); }
  bool lists_timestamps() const override { return false; }

 private:
  std::string config_for(const std::string &name) const {
    return "[cloud]\nurl=s3+http://127.0.0.1:" + std::to_string(server_.port()) + "/" + kBucket +
           "/" + name + "\nuser=" + server_.user() + "\npassword=" + S3Server::kSecret + "\n";
  }

  static int count_;
  S3Server &server_;
  const std::string name_;
};
int S3Store::count_ = 0;

INSTANTIATE_TEST_SUITE_P(S3, Conformance,
                         ::testing::Values(StoreKind{kKind,
                                                     []() -> std::unique_ptr<TestStore> {
                                                       return std::make_unique<S3Store>();
                                                     }}),
                         [](const auto &info) { return std::string(info.param.name); });

}  // namespace

S3Server &the_s3_server() { return *the_server(); }
