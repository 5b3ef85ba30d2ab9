#include "dav_server.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <glib.h>
#include <netinet/in.h>
#include <pwd.h>
#include <sched.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <vector>

#include "http/http.h"
#include "loopback.h"

using namespace harness;

namespace {

constexpr char kUser[] = "device";

// Its file systems are nobody else's.
bool prepare_process() {
  return unshare(CLONE_NEWNS) == 0 &&
         mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0;
}
const bool prepared = prepare_process();

// On it a connection has just ended, first from the side of the port: for a minute the system gives
// it to nobody who asks for any, and a server that names it (SO_REUSEADDR) gets it.
int free_port() {
  const int listener = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const int client = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  constexpr int kOn = 1;
  setsockopt(listener, SOL_SOCKET, SO_REUSEADDR, &kOn, sizeof kOn);
  sockaddr_in address = loopback(0);
  socklen_t length = sizeof address;
  EXPECT_EQ(bind(listener, reinterpret_cast<sockaddr *>(&address), length), 0);
  EXPECT_EQ(getsockname(listener, reinterpret_cast<sockaddr *>(&address), &length), 0);
  EXPECT_EQ(listen(listener, 1), 0);
  EXPECT_EQ(connect(client, reinterpret_cast<sockaddr *>(&address), length), 0);
  close(accept4(listener, nullptr, nullptr, SOCK_CLOEXEC));
  char end = 0;
  EXPECT_EQ(read(client, &end, 1), 0);
  close(client);
  close(listener);
  return ntohs(address.sin_port);
}

bool answers(int port) {
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const sockaddr_in address = loopback(port);
  const bool connected =
      connect(fd, reinterpret_cast<const sockaddr *>(&address), sizeof address) == 0;
  close(fd);
  return connected;
}

std::string replaced(std::string text, const std::string &what, const std::string &by) {
  for (auto at = text.find(what); at != std::string::npos; at = text.find(what, at + by.size()))
    text.replace(at, what.size(), by);
  return text;
}

using Words = std::vector<std::string>;

std::string loopback_name(int port) { return "127.0.0.1:" + std::to_string(port); }

// The command line, given that the file of the kind's name lies filled in at @p config.
Words command(const std::string &kind, const std::string &config, const std::string &dir, int port,
              int control_port) {
  if (kind == "apache") return {"/usr/sbin/apache2", "-f", config, "-DFOREGROUND"};
  if (kind == "nginx") return {"/usr/sbin/nginx", "-c", config, "-e", dir + "/state/error.log"};
  if (kind == "lighttpd") return {"/usr/sbin/lighttpd", "-D", "-f", config};
  return {"/usr/bin/rclone",
          "serve",
          "webdav",
          dir + "/disk",
          "--addr",
          loopback_name(port),
          "--baseurl",
          "/dav",
          "--htpasswd",
          dir + "/htpasswd",
          "--config",
          "/dev/null",
          "--cache-dir",
          dir + "/state/cache",
          "--log-file",
          dir + "/state/error.log",
          "--rc",
          "--rc-no-auth",
          "--rc-addr",
          loopback_name(control_port)};
}

}  // namespace

DavServer::DavServer(const std::string &kind, const Words &defines, const Certify &certify)
    : kind_(kind) {
  EXPECT_TRUE(prepared);
  const passwd *nobody = getpwnam("nobody");
  chmod(base_.path().c_str(), 0755);
  for (const char *name : {"disk", "htdocs", "state"}) {
    const std::string path = base_ / name;
    EXPECT_EQ(mkdir(path.c_str(), 0755), 0);
    if (std::string(name) == "disk") {
      EXPECT_EQ(mount("none", path.c_str(), "tmpfs", 0, "size=256m,mode=0755"), 0);
    }
    EXPECT_EQ(chown(path.c_str(), nobody->pw_uid, nobody->pw_gid), 0);
  }
  accept_password("right");
  port_ = free_port();
  tls_port_ = free_port();
  if (certify) certify(base_.path());
  start(defines);
  EXPECT_TRUE(run_until([this] {
    return answers(port_) && (kind_ != "rclone" || answers(tls_port_));
  })) << read_file(base_ / "state/error.log");
}

DavServer::~DavServer() {
  if (pid_ > 0) {
    kill(-pid_, SIGCONT);
    kill(-pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  umount2(root().c_str(), MNT_DETACH);
}

void DavServer::start(const Words &defines) {
  const std::string config = base_ / "server.conf";
  if (kind_ != "rclone") {
    std::string text = read_file(std::string(CLOUD_CONFIG_DIR) + "/" + kind_ + ".conf");
    text = replaced(text, "@DIR@", base_.path());
    text = replaced(text, "@PORT@", std::to_string(port_));
    write_file(config, replaced(text, "@TLS_PORT@", std::to_string(tls_port_)), 0644);
  }
  Words words = command(kind_, config, base_.path(), port_, tls_port_);
  for (const std::string &define : defines) words.push_back("-D" + define);
  std::vector<char *> argv;
  for (std::string &word : words) argv.push_back(word.data());
  argv.push_back(nullptr);
  const passwd *nobody = getpwnam("nobody");
  pid_ = fork();
  if (pid_ != 0) return;
  setpgid(0, 0);
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  // The others become nobody themselves.
  if (kind_ == "rclone" && (setgid(nobody->pw_gid) != 0 || setuid(nobody->pw_uid) != 0)) _exit(126);
  execv(argv[0], argv.data());
  _exit(127);
}

void DavServer::accept_password(const std::string &password) {
  guint8 digest[20];
  gsize length = sizeof digest;
  GChecksum *checksum = g_checksum_new(G_CHECKSUM_SHA1);
  g_checksum_update(checksum, reinterpret_cast<const guchar *>(password.data()),
                    static_cast<gssize>(password.size()));
  g_checksum_get_digest(checksum, digest, &length);
  g_checksum_free(checksum);
  char *text = g_base64_encode(digest, length);
  write_file(base_ / "htpasswd.new", std::string(kUser) + ":{SHA}" + text + "\n", 0644);
  g_free(text);
  EXPECT_EQ(rename((base_ / "htpasswd.new").c_str(), (base_ / "htpasswd").c_str()), 0);
}

void DavServer::freeze() const { EXPECT_EQ(kill(-pid_, SIGSTOP), 0); }

void DavServer::thaw() const { EXPECT_EQ(kill(-pid_, SIGCONT), 0); }

void DavServer::changed_behind_its_back() const {
  if (kind_ != "rclone") return;
  transport::Ticket ticket;
  transport::HttpRequest request;
  request.method = "POST";
  request.url = "http://" + loopback_name(tls_port_) + "/vfs/forget";
  EXPECT_TRUE(transport::http_perform(ticket, request).good());
}
