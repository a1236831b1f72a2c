// kivo-webd behind lighttpd when things go wrong: a request process killed
// mid-request, a client that never sends its body, many clients at once, the
// server itself ended, a handler that leaves a worker running.

#include <atomic>
#include <csignal>
#include <string>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "testing/cgi_client.h"
#include "testing/temp_root.h"
#include "testing/web_server.h"

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

TEST_F(ScgiTest, AClientThatNeverSendsItsBodyIsBoundedAndOthersAreServed) {
  WebServerOptions options = Options();
  options.read_timeout_seconds = 1;
  options.max_children = 2;
  WebServer server(root_.dir(), options);
  ASSERT_TRUE(server.running());
  std::string slow_answer;
  std::thread slow([&] {
    slow_answer = LoopbackExchange(
        server.port(),
        "POST /webapi/entry.cgi HTTP/1.0\r\nHost: 127.0.0.1\r\n"
        "Content-Type: application/x-www-form-urlencoded\r\nContent-Length: 100\r\n\r\napi=KIVO");
  });
  // The slow request holds one of the two request processes; the other
  // serves everyone else meanwhile.
  int served = 0;
  for (int i = 0; i < 5; ++i) served += Succeeded(ReadLog(server));
  EXPECT_EQ(5, served);
  slow.join();
  // Its own process gave up on the body and said so.
  EXPECT_NE(std::string::npos, slow_answer.find("\"code\":101")) << slow_answer;
  EXPECT_NE(std::string::npos, slow_answer.find("shorter than its length")) << slow_answer;
  EXPECT_TRUE(Succeeded(ReadLog(server)));
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
