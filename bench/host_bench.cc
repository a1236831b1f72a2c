// Latency, throughput and server CPU time of a trivial authenticated web API
// call ("KIVO.Core.Package.Log" "get" of a package without a log), directly
// through entry.cgi, through lighttpd running entry.cgi (CGI) and through
// lighttpd and kivo-webd (SCGI), at 1 and 8 concurrent clients, next to the
// same figures for two floors run as CGI programs: a C program that prints a
// fixed answer, and a C++ program with the JSON library that does the same.
//
// "cpu ms" is user + system time per request of the processes that serve it:
// for the direct path the CGI processes (this program's children), through
// lighttpd the web server, kivo-webd and every process they ran and reaped.
//
//   host_bench [requests per client]      (default 200)

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <functional>
#include <string>
#include <sys/resource.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include "klibc/atomic_file.h"
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
  double p50_ms, p99_ms, rps, cpu_ms;
};

double Seconds(const timeval& t) { return t.tv_sec + t.tv_usec / 1e6; }

// CPU seconds of this program's ended children (the direct path's CGI runs).
double ChildrenCpu() {
  rusage usage{};
  getrusage(RUSAGE_CHILDREN, &usage);
  return Seconds(usage.ru_utime) + Seconds(usage.ru_stime);
}

// CPU seconds of process `pid` and of the children it has reaped
// (utime, stime, cutime, cstime of /proc/<pid>/stat); 0 when it is gone.
double ProcessTreeCpu(pid_t pid) {
  std::string stat;
  if (pid <= 0 || !KIVOReadFile("/proc/" + std::to_string(pid) + "/stat", &stat)) return 0;
  size_t close = stat.rfind(')');
  if (close == std::string::npos) return 0;
  // After the command: state, then 11 fields, then the four times (fields 14-17).
  unsigned long long t[4] = {};
  if (sscanf(stat.c_str() + close + 2,
             "%*c %*d %*d %*d %*d %*d %*u %*u %*u %*u %*u %llu %llu %llu %llu", &t[0], &t[1], &t[2],
             &t[3]) != 4)
    return 0;
  return static_cast<double>(t[0] + t[1] + t[2] + t[3]) / sysconf(_SC_CLK_TCK);
}

// The serving processes of `server`: lighttpd with what it reaped, and
// kivo-webd with the request processes it reaped.
double ServerCpu(const WebServer* server) {
  return server ? ProcessTreeCpu(server->pid()) + ProcessTreeCpu(server->WebdPid()) : ChildrenCpu();
}

// `server` null: the calls run CGI programs directly.
Figures Measure(int clients, int per_client, const WebServer* server,
                const std::function<void()>& call) {
  for (int i = 0; i < 5; ++i) call();  // warm the caches
  std::vector<std::vector<double>> times(static_cast<size_t>(clients));
  double cpu_before = ServerCpu(server);
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
  double cpu = ServerCpu(server) - cpu_before;
  std::vector<double> all;
  for (auto& t : times) all.insert(all.end(), t.begin(), t.end());
  std::sort(all.begin(), all.end());
  auto at = [&all](double q) {
    return all[std::min(all.size() - 1, static_cast<size_t>(q * all.size()))];
  };
  return Figures{at(0.50), at(0.99), all.size() / seconds, cpu * 1000 / all.size()};
}

void Print(const char* path, const char* program, int clients, const Figures& f) {
  printf("%-9s %-10s %7d %9.2f %9.2f %9.0f %9.2f\n", path, program, clients, f.p50_ms, f.p99_ms,
         f.rps, f.cpu_ms);
  fflush(stdout);
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

  WebServerOptions scgi_options;
  scgi_options.mode = WebMode::kScgi;
  WebServer ours(root.dir());
  WebServer ours_scgi(root.dir(), scgi_options);
  WebServer base(root.dir(), floor);
  WebServer base_cpp(root.dir(), floor_cpp);
  if (!ours.running() || !ours_scgi.running() || !base.running() || !base_cpp.running()) {
    fprintf(stderr, "lighttpd did not start\n");
    return 1;
  }
  const std::string target = "/webapi/entry.cgi?" + query;
  auto through = [&](const WebServer& server) {
    return [&server, &target, &headers] { LoopbackGet(server.port(), target, headers); };
  };

  printf("%d requests per client; times in ms\n", per_client);
  printf("%-9s %-10s %7s %9s %9s %9s %9s\n", "path", "program", "clients", "p50", "p99", "req/s",
         "cpu ms");
  for (int clients : {1, 8}) {
    Print("direct", "entry.cgi", clients,
          Measure(clients, per_client, nullptr, [&] { ExecCgi(entry, env); }));
    Print("direct", "floor", clients,
          Measure(clients, per_client, nullptr, [&] { ExecCgi(floor, env); }));
    Print("direct", "floor C++", clients,
          Measure(clients, per_client, nullptr, [&] { ExecCgi(floor_cpp, env); }));
    Print("lighttpd", "entry.cgi", clients, Measure(clients, per_client, &ours, through(ours)));
    Print("lighttpd", "kivo-webd", clients,
          Measure(clients, per_client, &ours_scgi, through(ours_scgi)));
    Print("lighttpd", "floor", clients, Measure(clients, per_client, &base, through(base)));
    Print("lighttpd", "floor C++", clients,
          Measure(clients, per_client, &base_cpp, through(base_cpp)));
  }
  return 0;
}
