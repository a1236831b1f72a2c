// "list" with every additional key through lighttpd, for 30, 300 and 3000
// installed packages, with the web API run as a CGI program per request and
// by kivo-webd (SCGI): p50 and p99 per size and mode, and the cost per
// package.
//
//   list_bench [requests per size] [largest size]      (default 20, 3000)

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <string>
#include <sys/socket.h>
#include <unistd.h>
#include <vector>

#include "bench_setup.h"
#include "klibc/atomic_file.h"
#include "pkgtool/package_manager.h"
#include "testing/cgi_client.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"
#include "testing/web_server.h"

#include <arpa/inet.h>
#include <netinet/in.h>

namespace {

using Clock = std::chrono::steady_clock;

const char kAllKeys[] =
    "%5B%22autoupdate%22%2C%22beta%22%2C%22description%22%2C%22description_enu%22%2C%22distributor%"
    "22%2C"
    "%22distributor_url%22%2C%22nvx_apps%22%2C%22help_url%22%2C%22install_reboot%22%2C%22install_"
    "type%22%2C"
    "%22installed_info%22%2C%22is_uninstall_pages%22%2C%22maintainer%22%2C%22maintainer_url%22%2C%"
    "22url%22%2C"
    "%22report_beta_url%22%2C%22silent_install%22%2C%22silent_upgrade%22%2C%22silent_uninstall%22%"
    "2C"
    "%22startable%22%2C%22status%22%2C%22support_center%22%2C%22support_url%22%2C%22uninstall_"
    "pages%22%2C"
    "%22dependent_packages%22%2C%22start_dependent_services%22%2C%22installing_progress%22%2C"
    "%22ctl_uninstall%22%2C%22log_path%22%5D";

void InstallMany(const std::string& dir, int count) {
  for (int i = 0; i < count; ++i) {
    TestPackage p;
    p.id = "bench-" + std::to_string(i);
    p.info = {{"description", "Benchmark package"},
              {"maintainer", "Bench"},
              {"adminport", "18000"},
              {"checkport", "no"},
              {"logfile", "app.log"},
              {"install_dep_services", "pgsql"}};
    if (i == 0) p.info["startable"] = "no";  // a library the others need
    if (i > 0 && i % 3 == 0) p.info["install_dep_packages"] = "bench-0";
    InstallOrExit(p.Build(dir));
  }
}

}  // namespace

int main(int argc, char** argv) {
  int requests = argc > 1 ? std::max(1, atoi(argv[1])) : 20;
  int largest = argc > 2 ? atoi(argv[2]) : 3000;
  UseBuildDirOfThisProgram();
  printf("%8s %5s %9s %9s %14s %12s\n", "packages", "mode", "p50 ms", "p99 ms", "ms/package",
         "answer KiB");
  for (int count : {30, 300, 3000}) {
    if (count > largest) break;
    TempRoot root;
    root.AddAccount("admin", "secret", {"administrators"});
    WriteOrExit(root.Path("/etc/kivoinfo.conf"), "pkg_source_trust_level=\"1\"\n");
    std::string dir = root.Path("/tmp/src");
    MakeDirOrExit(dir);
    InstallMany(dir, count);
    ApiClient admin("admin", "secret");
    std::string target =
        "/webapi/entry.cgi?api=KIVO.Core.Package&version=1&method=list&additional=" +
        std::string(kAllKeys);
    std::string headers =
        "Cookie: id=" + admin.sid() + "\r\nX-KIVO-Token: " + admin.token() + "\r\n";
    for (WebMode mode : {WebMode::kCgi, WebMode::kScgi}) {
      WebServerOptions options;
      options.mode = mode;
      WebServer server(root.dir(), options);
      size_t size = LoopbackGet(server.port(), target, headers);  // warm-up
      std::vector<double> ms;
      for (int r = 0; r < requests; ++r) {
        Clock::time_point t = Clock::now();
        LoopbackGet(server.port(), target, headers);
        ms.push_back(std::chrono::duration<double, std::milli>(Clock::now() - t).count());
      }
      std::sort(ms.begin(), ms.end());
      double p50 = ms[ms.size() / 2], p99 = ms[std::min(ms.size() - 1, ms.size() * 99 / 100)];
      printf("%8d %5s %9.1f %9.1f %14.3f %12.0f\n", count, WebModeName(mode), p50, p99, p50 / count,
             size / 1024.0);
      fflush(stdout);
    }
  }
  return 0;
}
