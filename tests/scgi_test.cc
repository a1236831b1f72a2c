// kivo-webd behind lighttpd when things go wrong: a request process killed
// mid-request, a client that never sends its body, slow and silent clients
// in numbers, many clients at once, the server itself ended, a handler that
// leaves a worker running.

#include <atomic>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <dirent.h>
#include <memory>
#include <string>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include <gtest/gtest.h>
#include <json/reader.h>

#include "klibc/atomic_file.h"
#include "testing/cgi_client.h"
#include "testing/temp_root.h"
#include "testing/web_server.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>

namespace {

// Polls `done` every 10 ms for at most 10 s; its last answer.
template <typename Done>
bool Eventually(Done done) {
  for (int i = 0; i < 1000; ++i) {
    if (done()) return true;
    usleep(10000);
  }
  return done();
}

// The pid a test-module row left in "<root>/tmp/<name>"; 0 while there is none.
pid_t PidFile(const TempRoot& root, const std::string& name) {
  std::string text;
  return KIVOReadFile(root.Path("/tmp/" + name), &text) ? atoi(text.c_str()) : 0;
}

std::string Get(const WebServer& server, const std::string& query) {
  return LoopbackExchange(
      server.port(), "GET /webapi/entry.cgi?" + query + " HTTP/1.0\r\nHost: 127.0.0.1\r\n\r\n");
}

// The hexadecimal signal mask on line `field` ("SigBlk", "SigIgn", "SigCgt")
// of /proc/<pid>/status; empty when the process is gone.
std::string SignalMask(pid_t pid, const std::string& field) {
  std::string status;
  if (!KIVOReadFile("/proc/" + std::to_string(pid) + "/status", &status)) return "";
  size_t at = status.find("\n" + field + ":\t");
  if (at == std::string::npos) return "";
  at += field.size() + 3;
  return status.substr(at, status.find('\n', at) - at);
}

bool Succeeded(const std::string& response) {
  return response.compare(0, 15, "HTTP/1.0 200 OK") == 0 &&
         response.find("\"success\":true") != std::string::npos;
}

// A TCP connection from the loopback address `source` (any of 127.0.0.0/8:
// lighttpd reports it as the client's address) to 127.0.0.1:`port`; -1 when
// it cannot be made.
int ConnectFrom(const char* source, int port) {
  int fd = socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_in from{};
  from.sin_family = AF_INET;
  inet_pton(AF_INET, source, &from.sin_addr);
  sockaddr_in to{};
  to.sin_family = AF_INET;
  to.sin_port = htons(static_cast<uint16_t>(port));
  to.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (bind(fd, reinterpret_cast<sockaddr*>(&from), sizeof(from)) != 0 ||
      connect(fd, reinterpret_cast<sockaddr*>(&to), sizeof(to)) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

// Reads `fd` to its end, waiting at most 30 s for each piece; closes it.
std::string ReadToEnd(int fd) {
  std::string response;
  timeval limit{30, 0};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof(limit));
  char buf[65536];
  for (ssize_t n; (n = read(fd, buf, sizeof(buf))) > 0;)
    response.append(buf, static_cast<size_t>(n));
  close(fd);
  return response;
}

// Sends `request` on `fd` and reads the answer to its end (ReadToEnd).
std::string Exchange(int fd, const std::string& request) {
  if (fd < 0) return "";
  if (send(fd, request.data(), request.size(), MSG_NOSIGNAL) !=
      static_cast<ssize_t>(request.size())) {
    close(fd);
    return "";
  }
  return ReadToEnd(fd);
}

Json::Value AnswerJson(const std::string& response) {
  size_t split = response.find("\r\n\r\n");
  std::string body = split == std::string::npos ? "" : response.substr(split + 4);
  Json::Value json;
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  reader->parse(body.data(), body.data() + body.size(), &json, nullptr);
  return json;
}

// Live processes named `name` whose parent is `parent`.
int ChildrenNamed(pid_t parent, const std::string& name) {
  DIR* proc = opendir("/proc");
  int found = 0;
  while (struct dirent* e = proc ? readdir(proc) : nullptr) {
    std::string stat;
    if (!KIVOReadFile(std::string("/proc/") + e->d_name + "/stat", &stat)) continue;
    size_t close_paren = stat.rfind(')');
    if (close_paren == std::string::npos || stat.find("(" + name + ")") == std::string::npos)
      continue;
    char state = 0;
    int ppid = 0;
    if (sscanf(stat.c_str() + close_paren + 1, " %c %d", &state, &ppid) == 2 && ppid == parent &&
        state != 'Z')
      ++found;
  }
  if (proc) closedir(proc);
  return found;
}

// A hostile client from 127.0.0.1: it sends `head`, then one byte of body
// every 200 ms (none when `dribble` is false; nothing at all when `head` is
// empty), until the server answers or closes, the test stops it, or 20 s
// have passed: the bound of its life, which it counts in `ran_out`.
class SlowClient {
 public:
  SlowClient(int port, std::string head, bool dribble, std::atomic<int>* ran_out)
      : thread_([=] { Run(port, head, dribble, ran_out); }) {}
  ~SlowClient() {
    stop_ = true;
    thread_.join();
  }
  // The server answered it or closed its connection.
  bool ended_by_server() const { return ended_by_server_; }
  // Bytes of body it has sent so far.
  int sent() const { return sent_; }

 private:
  void Run(int port, const std::string& head, bool dribble, std::atomic<int>* ran_out) {
    int fd = ConnectFrom("127.0.0.1", port);
    if (fd < 0) return;
    if (!head.empty()) send(fd, head.data(), head.size(), MSG_NOSIGNAL);
    auto bound = std::chrono::steady_clock::now() + std::chrono::seconds(20);
    while (!stop_) {
      if (std::chrono::steady_clock::now() >= bound) {
        ++*ran_out;
        break;
      }
      pollfd p{fd, POLLIN, 0};
      if (poll(&p, 1, 200) > 0) {
        ended_by_server_ = true;
        break;
      }
      if (dribble && send(fd, "a", 1, MSG_NOSIGNAL) == 1) ++sent_;
    }
    close(fd);
  }

  std::atomic<bool> stop_{false};
  std::atomic<bool> ended_by_server_{false};
  std::atomic<int> sent_{0};
  std::thread thread_;
};

std::string SlowHead(const std::string& content_type, size_t length) {
  return "POST /webapi/entry.cgi HTTP/1.0\r\nHost: 127.0.0.1\r\nContent-Type: " + content_type +
         "\r\nContent-Length: " + std::to_string(length) + "\r\n\r\n";
}

class ScgiTest : public testing::Test {
 protected:
  void SetUp() override {
    root_.AddAccount("admin", "secret", {"administrators"});
    root_.Write("/var/packages/demo/INFO", "package=\"demo\"\nlogfile=\"demo.log\"\n");
    root_.Write("/var/packages/demo/var/demo.log", "hello\n");
    admin_.reset(new ApiClient("admin", "secret"));
    ASSERT_TRUE(admin_->signed_in());
  }

  WebServerOptions Options(WebMode mode = WebMode::kScgi) const {
    WebServerOptions options;
    options.mode = mode;
    options.module_dir = BuildDir() + "/lib/kivo/test-modules";
    return options;
  }

  // An authenticated call of a test-module row.
  std::string Frame(const WebServer& server, const std::string& method) const {
    return Get(server, "api=Test.Frame&version=1&method=" + method + "&_sid=" + admin_->sid());
  }
  std::string ReadLog(const WebServer& server) const {
    return Get(server,
               "api=KIVO.Core.Package.Log&version=1&method=get&name=demo&_sid=" + admin_->sid());
  }

  TempRoot root_;
  std::unique_ptr<ApiClient> admin_;
};

TEST_F(ScgiTest, AChildKilledMidRequestAnswers500AndTheServerGoesOn) {
  WebServer server(root_.dir(), Options());
  ASSERT_TRUE(server.running());
  pid_t webd = server.WebdPid();
  ASSERT_GT(webd, 0);
  std::string killed;
  std::thread stuck([&] { killed = Frame(server, "block"); });
  ASSERT_TRUE(Eventually([&] { return PidFile(root_, "block.pid") > 0; }));
  pid_t child = PidFile(root_, "block.pid");
  EXPECT_NE(webd, child);  // the request ran in a process of its own
  ASSERT_EQ(0, kill(child, SIGKILL));
  stuck.join();
  EXPECT_EQ(0u, killed.find("HTTP/1.0 500")) << killed;

  EXPECT_TRUE(Succeeded(ReadLog(server)));
  EXPECT_EQ(webd, server.WebdPid());  // the same server, not a restarted one
}

// A connection to kivo-webd's own socket, not through lighttpd (which would
// hold a body itself); -1 when it cannot be made.
int ConnectToWebd(const TempRoot& root, const WebServer& server) {
  WebConfigOptions config;
  config.root = root.dir();
  config.port = server.port();
  std::string path = WebdSocketPath(config) + "-0";  // lighttpd's name for it
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  if (path.size() >= sizeof(addr.sun_path)) return -1;
  memcpy(addr.sun_path, path.c_str(), path.size() + 1);
  int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  if (connect(fd, reinterpret_cast<sockaddr*>(&addr), sizeof(addr)) != 0) {
    close(fd);
    return -1;
  }
  return fd;
}

// The SCGI head of an urlencoded POST of `length` bytes, as lighttpd would
// send it for `root`.
std::string ScgiPostHead(const TempRoot& root, const std::string& module_dir, size_t length) {
  std::string pairs;
  for (const auto& h : std::vector<std::pair<std::string, std::string>>{
           {"CONTENT_LENGTH", std::to_string(length)},
           {"SCGI", "1"},
           {"REQUEST_METHOD", "POST"},
           {"CONTENT_TYPE", "application/x-www-form-urlencoded"},
           {"REMOTE_ADDR", "192.0.2.7"},
           {"KIVO_ROOT", root.dir()},
           {"KIVO_MODULE_DIR", module_dir}})
    pairs += h.first + '\0' + h.second + '\0';
  return std::to_string(pairs.size()) + ":" + pairs + ",";
}

// Connects to kivo-webd's socket as lighttpd does and sends the head of an
// urlencoded POST of `length` bytes; the connection, or -1 (a failure
// recorded) when it cannot be made.
int SendPostHead(const TempRoot& root, const WebServer& server, const std::string& module_dir,
                 size_t length) {
  int fd = ConnectToWebd(root, server);
  EXPECT_GE(fd, 0);
  if (fd < 0) return -1;
  std::string head = ScgiPostHead(root, module_dir, length);
  EXPECT_EQ(static_cast<ssize_t>(head.size()), send(fd, head.data(), head.size(), MSG_NOSIGNAL));
  return fd;
}

// A client that sends its head and part of a small body: the parent reads
// that body and spends no request process on it until it is whole or its
// deadline passes; then a process answers that the body was cut short.
// Meanwhile the only request process serves everyone else.
TEST_F(ScgiTest, AClientThatNeverSendsItsBodyHoldsNoProcessAndIsAnsweredAtItsDeadline) {
  WebServerOptions options = Options();
  options.read_timeout_seconds = 2;
  options.max_children = 1;
  WebServer server(root_.dir(), options);
  ASSERT_TRUE(server.running());
  int fd = SendPostHead(root_, server, options.module_dir, 100);
  ASSERT_GE(fd, 0);
  // The rest of the request, 8 bytes of the 100, and the wait for the answer.
  std::atomic<bool> slow_answered{false};
  std::string slow_answer;
  std::thread slow([&] {
    slow_answer = Exchange(fd, "api=KIVO");
    slow_answered = true;
  });
  int served = 0;
  for (int i = 0; i < 5; ++i) served += Succeeded(ReadLog(server));
  EXPECT_EQ(5, served);
  EXPECT_FALSE(slow_answered.load());  // the others did not wait for it
  slow.join();
  EXPECT_NE(std::string::npos, slow_answer.find("\"code\":101")) << slow_answer;
  EXPECT_NE(std::string::npos, slow_answer.find("shorter than its length")) << slow_answer;
  EXPECT_TRUE(Succeeded(ReadLog(server)));
}

// A body too large for the parent to read, sent a byte every 200 ms: its
// request process reads it against one deadline for the whole body (here
// 1 s plus a second per 64 KiB), not a limit per byte, and gives up while
// the client is still sending.
TEST_F(ScgiTest, ALargeBodyThatTricklesInEndsAtItsDeadline) {
  WebServerOptions options = Options();
  options.read_timeout_seconds = 1;
  WebServer server(root_.dir(), options);
  ASSERT_TRUE(server.running());
  int fd = SendPostHead(root_, server, options.module_dir, 70000);
  ASSERT_GE(fd, 0);
  bool answered = false;
  for (int i = 0; i < 100 && !answered; ++i) {  // 20 s at most
    pollfd p{fd, POLLIN, 0};
    answered = poll(&p, 1, 200) > 0;
    if (!answered) send(fd, "a", 1, MSG_NOSIGNAL);
  }
  EXPECT_TRUE(answered);
  std::string answer = ReadToEnd(fd);
  EXPECT_NE(std::string::npos, answer.find("\"code\":101")) << answer;
  EXPECT_NE(std::string::npos, answer.find("not whole in time")) << answer;
}

// More slow and silent connections than kivo-webd has request processes,
// all from one address: bodies dribbling in a byte at a time, heads without
// a body, connections that send nothing. Another client signs in and lists
// meanwhile and is answered at once, in both modes: lighttpd holds the
// bodies it buffers, kivo-webd reads small bodies itself and gives one
// address, and bodies still on their way, only a share of its processes,
// and each request a deadline for its body.
TEST_F(ScgiTest, SlowAndSilentClientsDoNotKeepAnotherFromSigningIn) {
  for (WebMode mode : {WebMode::kScgi, WebMode::kCgi}) {
    SCOPED_TRACE(WebModeName(mode));
    WebServerOptions options = Options(mode);
    options.max_children = 4;
    options.read_timeout_seconds = 2;
    WebServer server(root_.dir(), options);
    ASSERT_TRUE(server.running());
    const int port = server.port();
    const std::string form = "application/x-www-form-urlencoded";
    const std::string multipart = "multipart/form-data; boundary=b";
    std::atomic<int> ran_out{0};
    std::vector<std::unique_ptr<SlowClient>> buffered, streamed, quiet;
    for (int i = 0; i < 3; ++i)
      buffered.emplace_back(new SlowClient(port, SlowHead(form, 1000), true, &ran_out));
    for (size_t length : {1000, 1000, 70000, 70000})
      streamed.emplace_back(new SlowClient(port, SlowHead(multipart, length), true, &ran_out));
    for (const std::string& head :
         {SlowHead(form, 1000), SlowHead(form, 1000), std::string(), std::string()})
      quiet.emplace_back(new SlowClient(port, head, false, &ran_out));
    // Every dribbling client is under way, its body partly sent.
    ASSERT_TRUE(Eventually([&] {
      for (const auto* group : {&buffered, &streamed})
        for (const auto& client : *group)
          if (client->sent() < 3 && !client->ended_by_server()) return false;
      return true;
    }));
    if (mode == WebMode::kScgi) {
      EXPECT_LE(ChildrenNamed(server.WebdPid(), "kivo-webd"), options.max_children / 2);
    } else {
      // lighttpd starts entry.cgi only for the uploads it streams.
      EXPECT_LE(ChildrenNamed(server.pid(), "entry.cgi"), static_cast<int>(streamed.size()));
    }

    const std::string sign_in =
        "api=KIVO.API.Auth&version=1&method=login&account=admin&passwd=secret";
    Json::Value login = AnswerJson(
        Exchange(ConnectFrom("127.0.0.2", port), SlowHead(form, sign_in.size()) + sign_in));
    ASSERT_TRUE(login["success"].asBool()) << login.toStyledString();
    std::string sid = login["data"]["sid"].asString();
    std::string token = login["data"]["token"].asString();
    std::string list =
        Exchange(ConnectFrom("127.0.0.2", port),
                 "GET /webapi/entry.cgi?api=KIVO.Core.Package&version=1&method=list HTTP/1.0\r\n"
                 "Host: 127.0.0.1\r\nCookie: id=" +
                     sid + "\r\nX-KIVO-Token: " + token + "\r\n\r\n");
    EXPECT_TRUE(Succeeded(list)) << list;
    // Both answers came while every slow client was still within its time.
    EXPECT_EQ(0, ran_out.load());
    if (mode == WebMode::kScgi) {
      // The uploads that reached kivo-webd were ended at their deadline.
      EXPECT_TRUE(Eventually([&] {
        for (const auto& client : streamed)
          if (!client->ended_by_server()) return false;
        return true;
      }));
    }
  }
}

TEST_F(ScgiTest, TwoHundredRequestsFromSixteenClientsAreAllAnswered) {
  WebServerOptions options = Options();
  options.max_children = 4;  // most connections wait their turn
  WebServer server(root_.dir(), options);
  ASSERT_TRUE(server.running());
  std::atomic<int> answered{0};
  std::vector<std::thread> clients;
  for (int c = 0; c < 16; ++c) {
    clients.emplace_back([&, c] {
      for (int i = c; i < 200; i += 16) {
        std::string response = ReadLog(server);
        if (Succeeded(response) && response.find("hello\\n") != std::string::npos) ++answered;
      }
    });
  }
  for (std::thread& t : clients) t.join();
  EXPECT_EQ(200, answered.load());
}

TEST_F(ScgiTest, TheServerEndedWhileIdleIsStartedAgain) {
  WebServer server(root_.dir(), Options());
  ASSERT_TRUE(server.running());
  ASSERT_TRUE(Succeeded(ReadLog(server)));
  for (int sig : {SIGTERM, SIGKILL}) {
    pid_t before = server.WebdPid();
    ASSERT_GT(before, 0);
    ASSERT_EQ(0, kill(before, sig));
    ASSERT_TRUE(Eventually([&] {
      pid_t now = server.WebdPid();
      return now > 0 && now != before;
    })) << "signal "
        << sig;
    EXPECT_TRUE(Succeeded(ReadLog(server))) << "signal " << sig;
  }
}

// The module's rules hold alike in both modes: raw output with a status of
// its own, and a worker that outlives its request without holding it open.
TEST_F(ScgiTest, RawAnswersAndLongLivedWorkersBehaveAlikeInBothModes) {
  for (WebMode mode : {WebMode::kScgi, WebMode::kCgi}) {
    SCOPED_TRACE(WebModeName(mode));
    for (const char* name : {"worker.pid", "worker.done"})
      unlink(root_.Path(std::string("/tmp/") + name).c_str());
    unlink(root_.Path("/tmp/release").c_str());
    // An ignored signal that the server inherits: a request process must
    // still start with every signal handled by default and none blocked.
    signal(SIGUSR2, SIG_IGN);
    WebServer server(root_.dir(), Options(mode));
    signal(SIGUSR2, SIG_DFL);
    ASSERT_TRUE(server.running());
    std::string raw = Frame(server, "raw_status");
    EXPECT_EQ(0u, raw.find("HTTP/1.0 404 Not Found")) << raw;
    EXPECT_EQ(raw.size() - 12, raw.find("no such page")) << raw;

    std::string answer = Frame(server, "worker");
    EXPECT_TRUE(Succeeded(answer)) << answer;
    // The answer came while the worker still runs: it waits for the release.
    ASSERT_TRUE(Eventually([&] { return PidFile(root_, "worker.pid") > 0; }));
    pid_t worker = PidFile(root_, "worker.pid");
    EXPECT_EQ(0, kill(worker, 0));
    EXPECT_FALSE(PidFile(root_, "worker.done"));
    if (mode == WebMode::kScgi) {
      EXPECT_NE(0u, std::stoull(SignalMask(server.WebdPid(), "SigIgn"), nullptr, 16));
      for (const char* field : {"SigBlk", "SigIgn", "SigCgt"})
        EXPECT_EQ(0u, std::stoull(SignalMask(worker, field), nullptr, 16)) << field;
    }
    root_.Write("/tmp/release", "");
    EXPECT_TRUE(Eventually([&] { return PidFile(root_, "worker.done") == worker; }));
  }
}

}  // namespace
