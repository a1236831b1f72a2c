// Latency and throughput of a trivial authenticated web API call
// ("KIVO.Core.Package.Log" "get" of a package without a log), directly
// through entry.cgi and through lighttpd, at 1 and 8 concurrent clients,
// next to the same figures for two floors: a C program that prints a fixed
// answer, and a C++ program with the JSON library that does the same.
//
//   host_bench [requests per client]      (default 200)

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <functional>
#include <string>
#include <sys/socket.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "testing/cgi_client.h"
#include "testing/temp_root.h"
#include "testing/web_server.h"

#include <arpa/inet.h>
#include <netinet/in.h>

namespace {

using Clock = std::chrono::steady_clock;

// One request through a CGI program run directly, as the web server would.
void ExecCgi(const std::string& program, const std::vector<std::string>& env) {
  std::vector<char*> envp;
  for (const std::string& e : env) envp.push_back(const_cast<char*>(e.c_str()));
  envp.push_back(nullptr);
  int out[2];
  if (pipe(out) != 0) abort();
  pid_t pid = fork();
  if (pid == 0) {
    dup2(out[1], STDOUT_FILENO);
    close(out[0]);
    int devnull = open("/dev/null", O_RDWR);
    dup2(devnull, STDIN_FILENO);
    char* argv[] = {const_cast<char*>(program.c_str()), nullptr};
    execve(program.c_str(), argv, envp.data());
    _exit(127);
  }
  close(out[1]);
  char buf[4096];
  while (read(out[0], buf, sizeof(buf)) > 0) {
  }
  close(out[0]);
  waitpid(pid, nullptr, 0);
}

struct Figures {
  double p50_ms, p99_ms, rps;
};

Figures Measure(int clients, int per_client, const std::function<void()>& call) {
  for (int i = 0; i < 5; ++i) call();  // warm the caches
  std::vector<std::vector<double>> times(static_cast<size_t>(clients));
  Clock::time_point start = Clock::now();
  std::vector<std::thread> threads;
  for (int c = 0; c < clients; ++c) {
    threads.emplace_back([&, c] {
      for (int i = 0; i < per_client; ++i) {
        Clock::time_point t0 = Clock::now();
        call();
        times[static_cast<size_t>(c)].push_back(
            std::chrono::duration<double, std::milli>(Clock::now() - t0).count());
      }
    });
  }
  for (std::thread& t : threads) t.join();
  double seconds = std::chrono::duration<double>(Clock::now() - start).count();
  std::vector<double> all;
  for (auto& t : times) all.insert(all.end(), t.begin(), t.end());
  std::sort(all.begin(), all.end());
  auto at = [&all](double q) {
    return all[std::min(all.size() - 1, static_cast<size_t>(q * all.size()))];
  };
  return Figures{at(0.50), at(0.99), all.size() / seconds};
}

void Print(const char* path, const char* program, int clients, const Figures& f) {
  printf("%-9s %-10s %7d %9.2f %9.2f %9.0f\n", path, program, clients, f.p50_ms, f.p99_ms, f.rps);
}

}  // namespace

int main(int argc, char** argv) {
  int per_client = argc > 1 ? std::max(1, atoi(argv[1])) : 200;
  UseBuildDirOfThisProgram();
  TempRoot root;
  root.AddAccount("admin", "secret", {"administrators"});
  ApiClient admin("admin", "secret");
  if (!admin.signed_in()) {
    fprintf(stderr, "cannot sign in\n");
    return 1;
  }
  const std::string query = "api=KIVO.Core.Package.Log&version=1&method=get&name=demo";
  const std::string entry = BuildDir() + "/bin/entry.cgi";
  const std::string floor = BuildDir() + "/bin/floor_cgi";
  const std::string floor_cpp = BuildDir() + "/bin/floor_cpp_cgi";
  const std::vector<std::string> env = {"KIVO_ROOT=" + root.dir(), "REQUEST_METHOD=GET",
                                        "QUERY_STRING=" + query, "HTTP_COOKIE=id=" + admin.sid(),
                                        "HTTP_X_KIVO_TOKEN=" + admin.token()};
  const std::string headers =
      "Cookie: id=" + admin.sid() + "\r\nX-KIVO-Token: " + admin.token() + "\r\n";

  WebServer ours(root.dir());
  WebServer base(root.dir(), floor);
  WebServer base_cpp(root.dir(), floor_cpp);
  if (!ours.running() || !base.running() || !base_cpp.running()) {
    fprintf(stderr, "lighttpd did not start\n");
    return 1;
  }
  const std::string target = "/webapi/entry.cgi?" + query;

  printf("%d requests per client; times in ms\n", per_client);
  printf("%-9s %-10s %7s %9s %9s %9s\n", "path", "program", "clients", "p50", "p99", "req/s");
  for (int clients : {1, 8}) {
    Print("direct", "entry.cgi", clients,
          Measure(clients, per_client, [&] { ExecCgi(entry, env); }));
    Print("direct", "floor", clients, Measure(clients, per_client, [&] { ExecCgi(floor, env); }));
    Print("direct", "floor C++", clients,
          Measure(clients, per_client, [&] { ExecCgi(floor_cpp, env); }));
    Print("lighttpd", "entry.cgi", clients,
          Measure(clients, per_client, [&] { LoopbackGet(ours.port(), target, headers); }));
    Print("lighttpd", "floor", clients,
          Measure(clients, per_client, [&] { LoopbackGet(base.port(), target, headers); }));
    Print("lighttpd", "floor C++", clients,
          Measure(clients, per_client, [&] { LoopbackGet(base_cpp.port(), target, headers); }));
  }
  return 0;
}
