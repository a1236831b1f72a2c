#include "testing/http_test_server.h"

#include <chrono>
#include <sys/socket.h>
#include <unistd.h>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <strings.h>

namespace {

void Pause(int ms) { std::this_thread::sleep_for(std::chrono::milliseconds(ms)); }

bool SendAll(int fd, const char* data, size_t size) {
  while (size > 0) {
    ssize_t n = send(fd, data, size, MSG_NOSIGNAL);
    if (n <= 0) return false;
    data += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

// The value of header `name` in a header block, "" when absent.
std::string Header(const std::string& head, const std::string& name) {
  size_t pos = 0;
  while ((pos = head.find("\r\n", pos)) != std::string::npos) {
    pos += 2;
    if (strncasecmp(head.c_str() + pos, (name + ":").c_str(), name.size() + 1) == 0) {
      size_t end = head.find("\r\n", pos);
      std::string v = head.substr(pos + name.size() + 1, end - pos - name.size() - 1);
      size_t b = v.find_first_not_of(' ');
      return b == std::string::npos ? "" : v.substr(b);
    }
  }
  return "";
}

const char* Reason(int status) {
  switch (status) {
    case 200:
      return "OK";
    case 206:
      return "Partial Content";
    case 301:
      return "Moved Permanently";
    case 302:
      return "Found";
    case 304:
      return "Not Modified";
    case 404:
      return "Not Found";
    default:
      return "Status";
  }
}

}  // namespace

HttpTestServer::HttpTestServer() {
  listen_fd_ = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t len = sizeof(addr);
  if (bind(listen_fd_, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0 ||
      listen(listen_fd_, 64) != 0 ||
      getsockname(listen_fd_, reinterpret_cast<sockaddr*>(&addr), &len) != 0) {
    return;
  }
  port_ = ntohs(addr.sin_port);
  acceptor_ = std::thread([this] { Accept(); });
}

HttpTestServer::~HttpTestServer() {
  stopping_ = true;
  if (listen_fd_ >= 0) shutdown(listen_fd_, SHUT_RDWR);
  if (acceptor_.joinable()) acceptor_.join();
  if (listen_fd_ >= 0) close(listen_fd_);
  std::vector<std::thread> workers;
  {
    std::lock_guard<std::mutex> lock(mu_);
    workers.swap(workers_);
  }
  for (std::thread& t : workers) t.join();
}

std::string HttpTestServer::Url(const std::string& path) const {
  return "http://127.0.0.1:" + std::to_string(port_) + path;
}

void HttpTestServer::Set(const std::string& path, const HttpRoute& route) {
  std::lock_guard<std::mutex> lock(mu_);
  routes_[path] = route;
}

int HttpTestServer::Requests(const std::string& path) {
  std::lock_guard<std::mutex> lock(mu_);
  return counts_[path];
}

std::string HttpTestServer::LastHeaders(const std::string& path) {
  std::lock_guard<std::mutex> lock(mu_);
  return headers_[path];
}

std::string HttpTestServer::LastQuery(const std::string& path) {
  std::lock_guard<std::mutex> lock(mu_);
  return queries_[path];
}

void HttpTestServer::Accept() {
  while (!stopping_) {
    pollfd p{listen_fd_, POLLIN, 0};
    if (poll(&p, 1, 100) <= 0) continue;
    int fd = accept4(listen_fd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) continue;
    std::lock_guard<std::mutex> lock(mu_);
    workers_.emplace_back([this, fd] {
      Serve(fd);
      close(fd);
    });
  }
}

void HttpTestServer::Serve(int fd) {
  std::string head;
  char buf[4096];
  while (head.find("\r\n\r\n") == std::string::npos && head.size() < 65536) {
    pollfd p{fd, POLLIN, 0};
    if (stopping_ || poll(&p, 1, 100) < 0) return;
    if (!(p.revents & POLLIN)) continue;
    ssize_t n = recv(fd, buf, sizeof(buf), 0);
    if (n <= 0) return;
    head.append(buf, static_cast<size_t>(n));
  }
  size_t sp1 = head.find(' '), sp2 = head.find(' ', sp1 + 1);
  std::string target = head.substr(sp1 + 1, sp2 - sp1 - 1);
  std::string path = target.substr(0, target.find('?'));
  HttpRoute route;
  bool known;
  {
    std::lock_guard<std::mutex> lock(mu_);
    counts_[path]++;
    headers_[path] = head;
    queries_[path] = target.size() > path.size() ? target.substr(path.size() + 1) : "";
    known = routes_.count(path) != 0;
    if (known) {
      route = routes_[path];
      if (route.drop_times > 0) routes_[path].drop_times--;
    }
  }
  if (!known) route.status = 404, route.body = "no such file";
  if (route.delay_ms) Pause(route.delay_ms);
  int status = route.status;
  std::string body = route.body;
  std::string extra;
  if (!route.etag.empty()) {
    extra += "ETag: " + route.etag + "\r\n";
    if (Header(head, "If-None-Match") == route.etag) status = 304, body.clear();
  }
  if (!route.location.empty()) extra += "Location: " + route.location + "\r\n";
  std::string range = Header(head, "Range");
  if (status == 200 && route.ranges && range.rfind("bytes=", 0) == 0) {
    size_t from = std::stoul(range.substr(6));
    if (from < body.size()) {
      extra += "Content-Range: bytes " + std::to_string(from) + "-" +
               std::to_string(body.size() - 1) + "/" + std::to_string(body.size()) + "\r\n";
      body = body.substr(from);
      status = 206;
    }
  }
  std::string answer = "HTTP/1.1 " + std::to_string(status) + " " + Reason(status) + "\r\n" +
                       extra + "Connection: close\r\n";
  if (!route.endless) answer += "Content-Length: " + std::to_string(body.size()) + "\r\n";
  answer += "\r\n";
  if (!SendAll(fd, answer.data(), answer.size())) return;
  if (route.endless) {
    std::string block(64 * 1024, 'x');
    for (int i = 0; i < 1024 && !stopping_; ++i) {
      if (!SendAll(fd, block.data(), block.size())) return;
    }
    return;
  }
  size_t limit = body.size();
  bool drop = route.drop_times > 0 && route.drop_after > 0 && route.drop_after < limit;
  if (drop) limit = route.drop_after;
  size_t chunk = route.slow_chunk ? route.slow_chunk : limit;
  for (size_t sent = 0; sent < limit && !stopping_;) {
    size_t n = std::min(chunk, limit - sent);
    if (sent < route.hold_after) n = std::min(n, route.hold_after - sent);
    if (!SendAll(fd, body.data() + sent, n)) return;
    sent += n;
    if (sent == route.hold_after) {
      while (!released_ && !stopping_) Pause(10);
    }
    if (route.chunk_delay_ms && sent < limit) Pause(route.chunk_delay_ms);
  }
  if (drop) Pause(50);  // the client has the bytes before the connection goes
}
