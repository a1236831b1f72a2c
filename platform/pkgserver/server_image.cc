#include "pkgserver/server_image.h"

#include <cstring>
#include <fcntl.h>
#include <string>
#include <syslog.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/process.h"
#include "klibc/sysroot.h"
#include "pkgserver/server_config.h"
#include "pkgserver/server_net.h"
#include "pkgtool/registry.h"
#include "pkgtool/version.h"

namespace KIVOPackageTool {

namespace {

constexpr uint64_t kMaxImageBytes = 2 << 20;

bool IsPlainFileName(const std::string& name) {
  if (name.empty() || name.size() > 128 || name[0] == '.') return false;
  for (char c : name) {
    if (!isalnum(static_cast<unsigned char>(c)) && c != '.' && c != '_' && c != '-') return false;
  }
  return true;
}

// The cache path of an image, "" when any part is not acceptable.
std::string ImagePath(const char* source, const char* package, const char* version,
                      const char* file) {
  if (!source || !package || !version || !file) return "";
  std::string kind = strcmp(source, "AVAIL/KIVO") == 0    ? "kivo"
                     : strcmp(source, "AVAIL/OTHER") == 0 ? "other"
                                                          : "";
  if (kind.empty() || !PMSIsValidPackageId(package) || !PMSIsValidVersion(version) ||
      !IsPlainFileName(file)) {
    return "";
  }
  return KIVORootPath("/var/cache/kivo/pkgserver/images/") + kind + "/" + package + "/" + version +
         "/" + file;
}

bool Fetch(const std::string& link, const std::string& path) {
  std::string error;
  const PackageServerNetOps* net = PMSServerNetOps(&error);
  if (!net || !PMSIsServerUrl(link)) return false;
  HttpFetch fetch;
  fetch.url = link;
  if (!net->fetch(PMSLoadServerConfig().SmallLimits(kMaxImageBytes), fetch) ||
      fetch.status != 200 || fetch.body.empty()) {
    syslog(LOG_ERR, "%s:%d %s: %s", "server_image", __LINE__, link.c_str(),
           fetch.error.empty() ? ("HTTP " + std::to_string(fetch.status)).c_str()
                               : fetch.error.c_str());
    return false;
  }
  if (KIVOFSMkdirP(path.substr(0, path.rfind('/')).c_str()) != 0) return false;
  return KIVOWriteFileAtomic(path, fetch.body, SyncToDisk::No);
}

// Fetches queued images in one detached child per process, fed through a
// pipe: the caller never waits for a server, and the child ends when the
// caller's end of the pipe closes and the queue is done.
class BackgroundFetcher {
 public:
  void Queue(const std::string& link, const std::string& path) {
    if (fd_ < 0 && !Start()) return;
    std::string line = link + "\t" + path + "\n";
    // Best effort: a full pipe drops the image; a later listing queues it again.
    if (line.size() < 4096) (void)!write(fd_, line.data(), line.size());
  }

 private:
  bool Start() {
    int fds[2];
    if (pipe2(fds, O_CLOEXEC) != 0) return false;
    pid_t pid = KLIBCProcFork();
    if (pid < 0) {
      close(fds[0]);
      close(fds[1]);
      return false;
    }
    if (pid == 0) Run(fds[0], fds[1]);
    close(fds[0]);
    fcntl(fds[1], F_SETFL, O_NONBLOCK);
    fd_ = fds[1];
    return true;
  }

  [[noreturn]] static void Run(int in, int out) {
    close(out);
    setsid();
    int null = open("/dev/null", O_RDWR);
    for (int std_fd = 0; std_fd < 3; ++std_fd) dup2(null, std_fd);
    FILE* lines = fdopen(in, "r");
    char buffer[4096];
    while (lines && fgets(buffer, sizeof(buffer), lines)) {
      std::string line(buffer);
      size_t tab = line.find('\t');
      if (tab == std::string::npos || line.back() != '\n') continue;
      std::string path = line.substr(tab + 1, line.size() - tab - 2);
      if (access(path.c_str(), F_OK) != 0) Fetch(line.substr(0, tab), path);
    }
    _exit(0);
  }

  int fd_ = -1;
};

}  // namespace

int PMSGetServerImage(const char* source, const char* package, const char* version,
                      const char* file, const char* link, char* buffer, size_t size) {
  std::string path = ImagePath(source, package, version, file);
  if (path.empty()) return 0;
  bool cached = access(path.c_str(), R_OK) == 0;
  bool have_link = link && *link && PMSIsServerUrl(link);
  if (!buffer || size == 0) {
    static BackgroundFetcher fetcher;
    if (!cached && have_link) fetcher.Queue(link, path);
    return cached ? 1 : 0;
  }
  if (!cached && !(have_link && Fetch(link, path))) return 0;
  if (path.size() + 1 > size) return 0;
  memcpy(buffer, path.c_str(), path.size() + 1);
  return 1;
}

}  // namespace KIVOPackageTool
