#include "dav_server.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <glib.h>
#include <netinet/in.h>
#include <pwd.h>
#include <signal.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <vector>

using namespace harness;

namespace {

constexpr char kUser[] = "device";

sockaddr_in loopback(int port) {
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  address.sin_port = htons(static_cast<uint16_t>(port));
  return address;
}

int free_port() {
  const int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in address = loopback(0);
  socklen_t length = sizeof address;
  EXPECT_EQ(bind(fd, reinterpret_cast<sockaddr *>(&address), length), 0);
  EXPECT_EQ(getsockname(fd, reinterpret_cast<sockaddr *>(&address), &length), 0);
  close(fd);
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

std::string apache_config(const std::string &dir, int port) {
  std::string text;
  for (const char *module : {"mpm_event", "authn_core", "authn_file", "authz_core", "authz_user",
                             "auth_basic", "alias", "dav", "dav_fs"}) {
    text += std::string("LoadModule ") + module + "_module /usr/lib/apache2/modules/mod_" + module +
            ".so\n";
  }
  return text + "ServerRoot " + dir + "\nServerName localhost\nPidFile " + dir +
         "/httpd.pid\nDefaultRuntimeDir " + dir + "\nMutex file:" + dir + " default\nErrorLog " +
         dir + "/locks/error.log\nListen 127.0.0.1:" + std::to_string(port) +
         "\nUser nobody\nGroup nogroup\nStartServers 1\nThreadsPerChild 25\n"
         "MinSpareThreads 25\nMaxSpareThreads 75\nMaxRequestWorkers 100\nDavLockDB " +
         dir + "/locks/db\nDocumentRoot " + dir + "/htdocs\nAlias /dav " + dir +
         "/disk\n<Directory " + dir +
         "/disk>\nDav On\nAuthType Basic\nAuthName cloud\nAuthBasicProvider file\nAuthUserFile " +
         dir + "/htpasswd\nRequire valid-user\n</Directory>\n";
}

std::string lighttpd_config(const std::string &dir, int port) {
  return "server.modules = (\"mod_alias\",\"mod_auth\",\"mod_authn_file\",\"mod_webdav\")\n"
         "server.bind = \"127.0.0.1\"\nserver.port = " +
         std::to_string(port) + "\nserver.username = \"nobody\"\nserver.groupname = \"nogroup\"\n" +
         "server.document-root = \"" + dir + "/htdocs\"\nserver.errorlog = \"" + dir +
         "/locks/error.log\"\nserver.upload-dirs = (\"" + dir +
         "/disk\")\nmimetype.assign = (\"\" => \"application/octet-stream\")\n"
         "alias.url = (\"/dav\" => \"" +
         dir +
         "/disk\")\nauth.backend = \"htpasswd\"\n"
         "auth.backend.htpasswd.userfile = \"" +
         dir +
         "/htpasswd\"\n"
         "auth.require = (\"/dav\" => (\"method\"=>\"basic\",\"realm\"=>\"cloud\","
         "\"require\"=>\"valid-user\"))\n"
         "$HTTP[\"url\"] =~ \"^/dav($|/)\" {\n  webdav.activate = \"enable\"\n"
         "  webdav.is-readonly = \"disable\"\n  webdav.sqlite-db-name = \"" +
         dir + "/locks/db\"\n}\n";
}

}  // namespace

DavServer::DavServer(const std::string &kind) {
  const passwd *nobody = getpwnam("nobody");
  chmod(base_.path().c_str(), 0755);
  for (const char *name : {"disk", "htdocs", "locks"}) {
    const std::string path = base_ / name;
    EXPECT_EQ(mkdir(path.c_str(), 0755), 0);
    if (std::string(name) == "disk") {
      EXPECT_EQ(mount("none", path.c_str(), "tmpfs", 0, "size=256m,mode=0755"), 0);
    }
    EXPECT_EQ(chown(path.c_str(), nobody->pw_uid, nobody->pw_gid), 0);
  }
  accept_password("right");
  port_ = free_port();
  start(kind);
  EXPECT_TRUE(run_until([this] { return answers(port_); })) << read_file(base_ / "locks/error.log");
}

DavServer::~DavServer() {
  if (pid_ > 0) {
    kill(-pid_, SIGCONT);
    kill(-pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  umount2(root().c_str(), MNT_DETACH);
}

void DavServer::start(const std::string &kind) {
  const std::string config = base_ / "server.conf";
  const bool apache = kind == "apache";
  write_file(config,
             apache ? apache_config(base_.path(), port_) : lighttpd_config(base_.path(), port_));
  pid_ = fork();
  if (pid_ != 0) return;
  setpgid(0, 0);
  prctl(PR_SET_PDEATHSIG, SIGKILL);
  if (apache)
    execl("/usr/sbin/apache2", "apache2", "-f", config.c_str(), "-DFOREGROUND", nullptr);
  else
    execl("/usr/sbin/lighttpd", "lighttpd", "-D", "-f", config.c_str(), nullptr);
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
