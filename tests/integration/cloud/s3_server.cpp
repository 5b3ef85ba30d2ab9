#include "s3_server.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <sstream>

#include "http/http.h"
#include "http/url.h"

using namespace harness;

namespace {

constexpr milliseconds kStartPatience{120000};

transport::HttpAnswer perform(const char *method, const std::string &url,
                              const std::vector<std::string> &headers, const std::string &body) {
  transport::Ticket ticket;
  transport::HttpRequest request;
  request.method = method;
  request.url = url;
  request.headers = headers;
  request.has_body = std::string(method) == "PUT" || std::string(method) == "POST";
  request.body = body;
  return transport::http_perform(ticket, request);
}

class SwiftServer : public S3Server {
 public:
  SwiftServer() : S3Server("swift_cluster.py") { wait_ready(1); }

  std::string user() const override { return "test:device"; }
  void accept_secret(const std::string &secret) override {
    write_file(path("secret"), secret);
    tell(SIGHUP);
    wait_ready(++starts_);
  }
  void limit(const std::string &bucket, uint64_t bytes) override {
    const uint64_t used = std::stoull(bucket_header(bucket, "x-container-bytes-used"));
    call("POST", bucket, {"X-Container-Meta-Quota-Bytes: " + std::to_string(used + bytes)});
  }
  void unlimit(const std::string &bucket) override {
    call("POST", bucket, {"X-Remove-Container-Meta-Quota-Bytes: x"});
  }
  void kill_nodes(int count) override {
    for (int node = 1; node <= count; ++node) {
      for (const char *server : {"object-", "container-", "account-"})
        EXPECT_EQ(kill(pid_of(server + std::to_string(node)), SIGKILL), 0);
    }
  }
  void restart_nodes() override {
    tell(SIGHUP);
    wait_ready(++starts_);
  }
  bool has_conditions() const override { return false; }

 protected:
  std::string front() const override { return "proxy"; }
  std::vector<std::string> login() const override {
    return {"X-Auth-User: test:admin", "X-Auth-Key: admin"};
  }

 private:
  int starts_ = 1;
};

class CephServer : public S3Server {
 public:
  CephServer() : S3Server("ceph_gateway.py") { wait_ready(1); }

  std::string user() const override { return "device"; }
  void accept_secret(const std::string &secret) override {
    administer({"user", "modify", "--uid=device", "--access-key=device", "--secret=" + secret});
  }
  void limit(const std::string &bucket, uint64_t bytes) override {
    const uint64_t used = std::stoull(bucket_header(bucket, "x-container-bytes-used"));
    administer({"quota", "set", "--quota-scope=bucket", "--bucket=" + bucket,
                "--max-size=" + std::to_string(used + bytes)});
    administer({"quota", "enable", "--quota-scope=bucket", "--bucket=" + bucket});
  }
  void unlimit(const std::string &bucket) override {
    administer({"quota", "disable", "--quota-scope=bucket", "--bucket=" + bucket});
  }
  void kill_nodes(int count) override {
    for (int node = 0; node < count; ++node)
      EXPECT_EQ(kill(pid_of("osd" + std::to_string(node)), SIGKILL), 0);
  }
  void restart_nodes() override {
    tell(SIGHUP);
    wait_ready(++starts_);
  }
  bool has_conditions() const override { return true; }

 protected:
  std::string front() const override { return "gateway"; }
  std::vector<std::string> login() const override {
    return {"X-Auth-User: device:swift", "X-Auth-Key: admin"};
  }

 private:
  void administer(std::vector<std::string> words) const {
    const std::string config = path("ceph.conf");
    words.insert(words.begin(), {"radosgw-admin", "-c", config});
    std::vector<char *> argv;
    for (std::string &word : words) argv.push_back(word.data());
    argv.push_back(nullptr);
    const pid_t pid = fork();
    if (pid == 0) {
      const int null = open("/dev/null", O_WRONLY);
      dup2(null, STDOUT_FILENO);
      dup2(null, STDERR_FILENO);
      execvp(argv[0], argv.data());
      _exit(127);
    }
    EXPECT_EQ(wait_role(pid), 0) << words[3] << " " << words[4];
  }

  int starts_ = 1;
};

}  // namespace

std::unique_ptr<S3Server> S3Server::make(const std::string &kind) {
  if (kind == "ceph") return std::make_unique<CephServer>();
  return std::make_unique<SwiftServer>();
}

S3Server::S3Server(const std::string &script) {
  chmod(dir_.path().c_str(), 0755);
  write_file(dir_ / "secret", kSecret);
  const std::string program = std::string(CLOUD_CONFIG_DIR) + "/" + script;
  pid_ = fork();
  if (pid_ != 0) return;
  setpgid(0, 0);
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  execl(program.c_str(), program.c_str(), dir_.path().c_str(), nullptr);
  _exit(127);
}

S3Server::~S3Server() {
  if (pid_ <= 0) return;
  kill(-pid_, SIGCONT);
  kill(-pid_, SIGKILL);
  waitpid(pid_, nullptr, 0);
}

void S3Server::wait_ready(int times) {
  const auto is_ready = [&] {
    std::istringstream text(read_file(dir_ / "ready"));
    int seen = 0;
    if (!(text >> port_ >> seen) || seen != times) return false;
    text >> tls_port_;
    return true;
  };
  EXPECT_TRUE(run_until(is_ready, kStartPatience));
}

pid_t S3Server::pid_of(const std::string &server) const {
  return std::stoi(read_file(dir_ / ("run/" + server + ".pid")));
}

void S3Server::tell(int signal) const { EXPECT_EQ(kill(pid_, signal), 0); }

std::string S3Server::logs() const {
  std::string all;
  for (const auto &[name, content] : tree(dir_ / "log")) all += content;
  return all;
}

void S3Server::freeze() const { EXPECT_EQ(kill(pid_of(front()), SIGSTOP), 0); }

void S3Server::thaw() const { EXPECT_EQ(kill(pid_of(front()), SIGCONT), 0); }

void S3Server::log_in() {
  const transport::HttpAnswer answer =
      perform("GET", "http://127.0.0.1:" + std::to_string(port_) + "/auth/v1.0", login(), "");
  EXPECT_TRUE(answer.good()) << answer.status << answer.problem.message;
  storage_ = answer.header("x-storage-url");
  token_ = answer.header("x-auth-token");
}

std::string S3Server::call(const char *method, const std::string &what,
                           const std::vector<std::string> &headers, const std::string &body) {
  if (token_.empty()) log_in();
  std::vector<std::string> all = headers;
  all.push_back("X-Auth-Token: " + token_);
  const transport::HttpAnswer answer = perform(method, storage_ + "/" + what, all, body);
  EXPECT_TRUE(answer.good()) << method << " " << what << ": " << answer.status
                             << answer.problem.message;
  return answer.body;
}

std::string S3Server::bucket_header(const std::string &bucket, const std::string &name) {
  if (token_.empty()) log_in();
  return perform("HEAD", storage_ + "/" + bucket, {"X-Auth-Token: " + token_}, "").header(name);
}

void S3Server::make_bucket(const std::string &bucket) { call("PUT", bucket); }

void S3Server::put(const std::string &bucket, const std::string &key, const std::string &content) {
  call("PUT", bucket + "/" + transport::encode_path(key), {}, content);
}

std::map<std::string, std::string> S3Server::content(const std::string &bucket,
                                                     const std::string &prefix) {
  std::istringstream names(call("GET", bucket + "?prefix=" + transport::encode_path(prefix)));
  std::map<std::string, std::string> found;
  for (std::string name; std::getline(names, name);)
    found[name.substr(prefix.size())] = call("GET", bucket + "/" + transport::encode_path(name));
  return found;
}
