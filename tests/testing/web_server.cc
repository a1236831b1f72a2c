#include "testing/web_server.h"

#include <cstdio>
#include <cstdlib>
#include <dirent.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "testing/temp_root.h"

#include <arpa/inet.h>
#include <netinet/in.h>

namespace {

sockaddr_in Loopback(int port) {
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(static_cast<uint16_t>(port));
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  return addr;
}

bool Accepts(int port) {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr = Loopback(port);
  bool ok = connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) == 0;
  close(fd);
  return ok;
}

}  // namespace

int FreeLoopbackPort() {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr = Loopback(0);
  socklen_t len = sizeof(addr);
  bind(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr));
  getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len);
  close(fd);
  return ntohs(addr.sin_port);
}

const char* WebModeName(WebMode mode) { return mode == WebMode::kScgi ? "scgi" : "cgi"; }

namespace {

WebServerOptions CgiOptions(const std::string& entry_cgi) {
  WebServerOptions options;
  options.entry_cgi = entry_cgi;
  return options;
}

}  // namespace

WebServer::WebServer(const std::string& root, const std::string& entry_cgi)
    : WebServer(root, CgiOptions(entry_cgi)) {}

WebServer::WebServer(const std::string& root, const WebServerOptions& o) {
  WebConfigOptions options;
  options.root = root;
  options.mode = o.mode;
  options.entry_cgi = o.entry_cgi.empty() ? BuildDir() + "/bin/entry.cgi" : o.entry_cgi;
  options.webd = BuildDir() + "/bin/kivo-webd";
  options.module_dir = o.module_dir;
  options.max_children = o.max_children;
  options.read_timeout_seconds = o.read_timeout_seconds;
  options.max_upload_bytes = o.max_upload_bytes;
  options.port = port_ = FreeLoopbackPort();
  std::string conf = root + "/lighttpd-" + std::to_string(port_) + ".conf";
  if (!WebConfigProblem(options).empty()) return;
  if (!KIVOWriteFileAtomic(conf, KIVOWebConfig(options), SyncToDisk::No)) return;
  pid_t pid = fork();
  if (pid == 0) {
    execl("/usr/sbin/lighttpd", "lighttpd", "-D", "-f", conf.c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  pid_ = pid;
  for (int i = 0; i < 500 && !Accepts(port_); ++i) usleep(10000);
  // lighttpd starts kivo-webd as it starts; wait until it runs the program.
  for (int i = 0; i < 500 && o.mode == WebMode::kScgi && WebdPid() <= 0; ++i) usleep(10000);
  if (!Accepts(port_) || (o.mode == WebMode::kScgi && WebdPid() <= 0)) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
    pid_ = -1;
  }
}

pid_t WebServer::WebdPid() const {
  DIR* proc = opendir("/proc");
  if (!proc) return -1;
  pid_t found = -1;
  while (struct dirent* e = readdir(proc)) {
    std::string stat;
    if (!KIVOReadFile(std::string("/proc/") + e->d_name + "/stat", &stat)) continue;
    // "<pid> (<comm>) <state> <ppid> ..."
    size_t close = stat.rfind(')');
    if (close == std::string::npos || stat.find("(kivo-webd)") == std::string::npos) continue;
    char state = 0;
    int ppid = 0;
    if (sscanf(stat.c_str() + close + 1, " %c %d", &state, &ppid) == 2 && ppid == pid_ &&
        state != 'Z')
      found = atoi(e->d_name);
  }
  closedir(proc);
  return found;
}

WebServer::~WebServer() {
  if (pid_ <= 0) return;
  kill(pid_, SIGTERM);
  waitpid(pid_, nullptr, 0);
}

std::string WebServer::EntryURL() const {
  return "http://127.0.0.1:" + std::to_string(port_) + "/webapi/entry.cgi";
}

size_t LoopbackGet(int port, const std::string& target, const std::string& headers) {
  return LoopbackExchange(port,
                          "GET " + target + " HTTP/1.0\r\nHost: 127.0.0.1\r\n" + headers + "\r\n")
      .size();
}

std::string LoopbackExchange(int port, const std::string& request) {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr = Loopback(port);
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    close(fd);
    return "";
  }
  std::string response;
  // A server that closes early must not end the test with SIGPIPE.
  if (send(fd, request.data(), request.size(), MSG_NOSIGNAL) ==
      static_cast<ssize_t>(request.size())) {
    char buf[65536];
    for (ssize_t n; (n = read(fd, buf, sizeof(buf))) > 0;)
      response.append(buf, static_cast<size_t>(n));
  }
  close(fd);
  return response;
}
