// Certificates, protocols, connections and passwords, over TLS with apache.
#include <sched.h>
#include <sys/mount.h>

#include <set>
#include <sstream>

#include "dav_server.h"
#include "harness.h"
#include "session/session.h"

using namespace harness;
using std::chrono::milliseconds;

namespace {

// Lets every pause pass at once, and counts them.
class CountingClock : public transport::RetryClock {
 public:
  Point now() override { return transport::RetryClock::system().now(); }
  bool pause(transport::Ticket &ticket, milliseconds) override {
    ++pauses;
    return !ticket.cancelled();
  }
  double random() override { return 0; }

  std::atomic<int> pauses{0};
};

/** Certificates as they are needed, made by openssl in a folder. */
class Authority {
 public:
  explicit Authority(const std::string &dir, const std::string &name = "Authority") : dir_(dir) {
    write_file(dir_ + "/ca.conf",
               "[ca]\ndefault_ca=c\n[c]\ndatabase=" + dir_ + "/index\nserial=" + dir_ +
                   "/serial\nnew_certs_dir=" + dir_ +
                   "\ndefault_md=sha256\npolicy=p\nunique_subject=no\ncopy_extensions=copy\n"
                   "[p]\ncommonName=supplied\n");
    write_file(dir_ + "/index", "");
    write_file(dir_ + "/serial", "01\n");
    run("req -x509 " + key("ca.key") + " -out " + file() + " -days 2 -subj /CN=" + name);
  }

  /** PEM file to trust. */
  std::string file() const { return dir_ + "/ca.pem"; }

  void issue(const std::string &server_dir, const std::string &name, const std::string &from,
             const std::string &until) const {
    request(server_dir, name, "req -new -out " + dir_ + "/request");
    run("ca -batch -notext -config " + dir_ + "/ca.conf -cert " + file() + " -keyfile " + dir_ +
        "/ca.key -startdate " + from + " -enddate " + until + " -in " + dir_ + "/request -out " +
        server_dir + "/cert.pem");
  }
  void self_sign(const std::string &server_dir, const std::string &name) const {
    request(server_dir, name, "req -x509 -days 2 -out " + server_dir + "/cert.pem");
  }

 private:
  std::string key(const std::string &path) const {
    return "-newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -keyout " +
           (path[0] == '/' ? path : dir_ + "/" + path);
  }
  void request(const std::string &server_dir, const std::string &name,
               const std::string &command) const {
    run(command + " " + key(server_dir + "/key.pem") +
        " -subj /CN=server -addext subjectAltName=" + name);
  }
  void run(const std::string &arguments) const {
    const std::string command = "openssl " + arguments + " 2>>" + dir_ + "/openssl.log";
    EXPECT_EQ(std::system(command.c_str()), 0) << read_file(dir_ + "/openssl.log");
  }

  const std::string dir_;
};

constexpr char kEarlier[] = "20200101000000Z";
constexpr char kYesterday[] = "20200102000000Z";
constexpr char kLater[] = "20491231000000Z";
constexpr char kThisMachine[] = "DNS:localhost,IP:127.0.0.1";

class TlsTest : public ::testing::Test {
 protected:
  TlsTest() : authority(dir.path()) { transport::set_retry_clock(&clock, {}); }
  ~TlsTest() override { transport::set_retry_clock(nullptr, {}); }

  void start(const std::function<void(const std::string &)> &certify,
             std::vector<std::string> defines = {"TLS"}) {
    server = std::make_unique<DavServer>("apache", defines, certify);
  }
  void start_good(std::vector<std::string> defines = {"TLS"}) {
    start([this](const std::string &to) { authority.issue(to, kThisMachine, kEarlier, kLater); },
          std::move(defines));
  }
  std::string config(const std::string &ca_file, const std::string &password = "right",
                     const std::string &host = "localhost") const {
    return "[cloud]\nurl=webdav+https://" + host + ":" + std::to_string(server->tls_port()) +
           "/dav/store\nuser=device\npassword=" + password +
           (ca_file.empty() ? "" : "\nca-file=" + ca_file) + "\n";
  }

  // The words of each request's line in the server's log: client port, protocol, method, status.
  std::vector<std::vector<std::string>> requests() const {
    std::vector<std::vector<std::string>> all;
    std::istringstream log(read_file(server->state() + "/tls.log"));
    for (std::string line; std::getline(log, line);) {
      std::istringstream words(line);
      all.emplace_back(std::istream_iterator<std::string>(words),
                       std::istream_iterator<std::string>());
    }
    return all;
  }
  std::set<std::string> column(std::size_t index) const {
    std::set<std::string> values;
    for (const auto &request : requests()) values.insert(request.at(index));
    return values;
  }

  void expect_refused(const std::string &config_text, const std::string &message) {
    Cloud cloud(config_text);
    const AnswerPtr up = cloud.upload(cloud.file("x"), "/a");
    const AnswerPtr down = cloud.download("/a", cloud.place());
    const AnswerPtr list = cloud.list("/");
    const AnswerPtr removal = cloud.remove("/a");
    ASSERT_TRUE(cloud.settle());
    for (const AnswerPtr &answer : {up, down, list, removal})
      EXPECT_EQ(answer->code, BACKUP_TRANS_ERROR_CERTIFICATE);
    EXPECT_EQ(down->message, message);
    EXPECT_EQ(clock.pauses, 0);
    EXPECT_TRUE(requests().empty());
  }

  TempDir dir;
  Authority authority;
  CountingClock clock;
  std::unique_ptr<DavServer> server;
};

TEST_F(TlsTest, AuthorityOfTheConfigurationIsTrusted) {
  start_good();
  for (const char *host : {"localhost", "127.0.0.1"}) {
    Cloud cloud(config(authority.file(), "right", host));
    EXPECT_EQ(cloud.put("/a", host), 0);
    EXPECT_EQ(cloud.get("/a"), host);
  }
}

TEST_F(TlsTest, UnknownAuthorityIsRefused) {
  start_good();
  const TempDir other_dir;
  const Authority other(other_dir.path());
  const std::string message = "SSL certificate problem: unable to get local issuer certificate";
  expect_refused(config(other.file()), message);
  expect_refused(config(""), message);
}

// Where libcurl has the system's authorities from in Debian.
constexpr char kSystemAuthorities[] = "/etc/ssl/certs";
constexpr int kNoNamespace = 125;

// Uploads where the system's authorities are those of a directory: CONFIG-PATH DIRECTORY. Its exit
// status is the result.
int trusting_role(int argc, char **argv) {
  if (argc != 2 || unshare(CLONE_NEWNS) != 0 ||
      mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
      mount(argv[1], kSystemAuthorities, nullptr, MS_BIND, nullptr) != 0)
    return kNoNamespace;
  Cloud cloud(read_file(argv[0]));
  return cloud.put("/a", "x");
}
const bool trusting_added = add_role("trusting", trusting_role);

TEST_F(TlsTest, AuthorityOfTheConfigurationReplacesThoseOfTheSystem) {
  start_good();
  const TempDir system;
  write_file(system / "authority.pem", read_file(authority.file()));
  ASSERT_EQ(std::system(("openssl rehash " + system.path()).c_str()), 0);
  write_file(system / "ca-certificates.crt", read_file(authority.file()));
  const TempDir other_dir;
  // By another name: the directory is not looked into for one that the file has.
  const Authority other(other_dir.path(), "Another");
  const auto put = [&](const std::string &ca_file) {
    write_file(dir / "cloud.conf", config(ca_file));
    return run_role({"trusting", dir / "cloud.conf", system.path()});
  };
  EXPECT_EQ(put(""), 0);
  EXPECT_EQ(put(other.file()), BACKUP_TRANS_ERROR_CERTIFICATE);
}

TEST_F(TlsTest, AuthorityFileThatIsReplacedCountsAtOnce) {
  start_good();
  const TempDir other_dir;
  const Authority other(other_dir.path());
  const std::string trusted = dir / "trusted.pem";
  write_file(trusted, read_file(other.file()));
  Cloud cloud(config(trusted));
  EXPECT_EQ(cloud.put("/a", "x"), BACKUP_TRANS_ERROR_CERTIFICATE);
  write_file(trusted, read_file(authority.file()));
  EXPECT_EQ(cloud.put("/a", "x"), 0);
}

TEST_F(TlsTest, CertificateOfAnotherHostIsRefused) {
  start([this](const std::string &to) {
    authority.issue(to, "DNS:other.example.org", kEarlier, kLater);
  });
  expect_refused(config(authority.file()),
                 "SSL: no alternative certificate subject name matches target host name "
                 "'localhost'");
}

TEST_F(TlsTest, ExpiredCertificateIsRefused) {
  start([this](const std::string &to) { authority.issue(to, kThisMachine, kEarlier, kYesterday); });
  expect_refused(config(authority.file()), "SSL certificate problem: certificate has expired");
}

TEST_F(TlsTest, CertificateOfTheFutureIsRefused) {
  start([this](const std::string &to) {
    authority.issue(to, kThisMachine, "20480101000000Z", kLater);
  });
  expect_refused(config(authority.file()), "SSL certificate problem: certificate is not yet valid");
}

TEST_F(TlsTest, SelfSignedCertificateIsRefused) {
  start([this](const std::string &to) { authority.self_sign(to, kThisMachine); });
  expect_refused(config(authority.file()), "SSL certificate problem: self-signed certificate");
}

TEST_F(TlsTest, SelfSignedCertificateThatIsTheAuthorityItselfIsTrusted) {
  const TempDir copy;
  start([&](const std::string &to) {
    authority.self_sign(to, kThisMachine);
    write_file(copy / "trusted.pem", read_file(to + "/cert.pem"));
  });
  Cloud cloud(config(copy / "trusted.pem"));
  EXPECT_EQ(cloud.put("/a", "x"), 0);
}

TEST_F(TlsTest, AuthorityFileThatIsNoneIsTold) {
  start_good();
  write_file(dir / "garbage.pem", "garbage");
  for (const char *name : {"absent.pem", "garbage.pem"})
    expect_refused(config(dir / name), "error setting certificate file: " + (dir / name));
}

TEST_F(TlsTest, Http2IsUsedOnOneConnection) {
  start_good();
  Cloud cloud(config(authority.file()));
  std::vector<AnswerPtr> answers;
  for (int i = 0; i < 40; ++i)
    answers.push_back(cloud.upload(cloud.file(bytes(20000)), "/f/" + std::to_string(i)));
  ASSERT_TRUE(cloud.settle());
  for (const AnswerPtr &answer : answers) EXPECT_EQ(answer->code, 0);
  EXPECT_GT(requests().size(), 120U);
  EXPECT_EQ(column(1), std::set<std::string>{"HTTP/2.0"});
  EXPECT_EQ(column(0).size(), 1U);
}

TEST_F(TlsTest, ConnectionsAreKeptWithoutHttp2) {
  start_good({"TLS", "HTTP1"});
  Cloud cloud(config(authority.file()));
  for (int i = 0; i < 40; ++i) cloud.upload(cloud.file(bytes(20000)), "/f/" + std::to_string(i));
  ASSERT_TRUE(cloud.settle());
  for (const AnswerPtr &answer : cloud.answers()) EXPECT_EQ(answer->code, 0);
  EXPECT_GT(requests().size(), 120U);
  EXPECT_EQ(column(1), std::set<std::string>{"HTTP/1.1"});
  EXPECT_LE(column(0).size(), static_cast<std::size_t>(BACKUP_TRANS_MAX_CONCURRENT_TRANSFERS));
}

TEST_F(TlsTest, WrongPasswordIsNotTriedAgain) {
  start_good();
  Cloud cloud(config(authority.file(), "wrong"));
  EXPECT_EQ(cloud.get("/a"), "<10>");
  ASSERT_EQ(requests().size(), 1U);
  EXPECT_EQ(requests()[0].at(3), "401");
  EXPECT_EQ(clock.pauses, 0);
  EXPECT_EQ(cloud.put("/a", "x"), BACKUP_TRANS_ERROR_AUTHENTICATION);
  EXPECT_EQ(cloud.drop("/a"), BACKUP_TRANS_ERROR_AUTHENTICATION);
  EXPECT_EQ(clock.pauses, 0);
}

TEST_F(TlsTest, TimeOfAnObjectIsSentAsCloudsUnderstandIt) {
  start_good();
  Cloud cloud(config(authority.file()));
  const AnswerPtr answer = cloud.upload(cloud.file("x"), "/a", 1234567890999);
  ASSERT_TRUE(cloud.settle());
  ASSERT_EQ(answer->code, 0);
  for (const auto &request : requests())
    EXPECT_EQ(request.at(4), request.at(2) == "PUT" ? "1234567890" : "-");
}

constexpr char kSecret[] = "s3cret-Pa55-word";

// Uploads with a password, and looks at what others see of the process meanwhile: CONFIG-PATH.
int secret_role(int argc, char **argv) {
  if (argc != 1) return 125;
  setenv("G_MESSAGES_DEBUG", "all", 1);
  Cloud cloud(read_file(argv[0]));
  cloud.put("/a", "x");
  const AnswerPtr answer = cloud.download("/b", cloud.place());
  cloud.settle();
  fprintf(stderr, "message: %s\n", answer->message.c_str());
  for (const char *name : {"cmdline", "environ", "comm"}) {
    if (read_file(std::string("/proc/self/") + name).find(kSecret) != std::string::npos) return 1;
  }
  // A configuration that cannot be used is complained about.
  cloud.configure(std::string("[cloud]\nurl=webdav+https://device:") + kSecret +
                  "@localhost/\npassword=" + kSecret + "\n");
  cloud.get("/a");
  return 0;
}
const bool added = add_role("secret", secret_role);

TEST_F(TlsTest, PasswordIsSeenNowhere) {
  start_good();
  for (const bool right : {false, true}) {
    server->accept_password(right ? kSecret : "another");
    write_file(dir / "secret.conf", config(authority.file(), kSecret));
    const std::string command = "exec /proc/" + std::to_string(getpid()) + "/exe --role secret " +
                                (dir / "secret.conf") + " >" + (dir / "output") + " 2>&1";
    EXPECT_EQ(std::system(command.c_str()), 0);
    const std::string output = read_file(dir / "output");
    EXPECT_NE(output.find("message: "), std::string::npos) << output;
    EXPECT_NE(output.find("the url holds a user or password"), std::string::npos) << output;
    EXPECT_EQ(output.find(kSecret), std::string::npos) << output;
    for (const auto &request : requests()) EXPECT_EQ(request.at(3) == "401", !right);
    write_file(server->state() + "/tls.log", "", 0644);
  }
}

}  // namespace
