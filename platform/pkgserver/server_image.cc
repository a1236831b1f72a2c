#include "pkgserver/server_image.h"

#include <ctime>
#include <fcntl.h>
#include <string_view>
#include <sys/file.h>
#include <sys/stat.h>
#include <syslog.h>
#include <unistd.h>
#include <vector>

#include "klibc/atomic_file.h"
#include "klibc/process.h"
#include "klibc/sysroot.h"
#include "pkgserver/catalogue.h"
#include "pkgserver/server_config.h"
#include "pkgserver/server_net.h"
#include "pkgserver/text_sha256.h"
#include "pkgtool/registry.h"
#include "pkgtool/version.h"

#define IMAGE_LOG(fmt, ...) syslog(LOG_ERR, "%s:%d " fmt, "server_image", __LINE__, ##__VA_ARGS__)

namespace KIVOPackageTool {

namespace {

constexpr uint64_t kMaxImageBytes = 2 << 20;

// The cache path of the image `link` names for `package` at `version`; ""
// when a name is not valid. Each is judged whole before it becomes a path.
std::string ImagePath(const std::string& package, const std::string& version,
                      const std::string& link) {
  if (!PMSIsValidPackageId(package) || !PMSIsValidVersion(version) || !PMSIsServerUrl(link)) {
    return "";
  }
  return KIVORootPath("/var/cache/kivo/pkgserver/images/") + package + "/" + version + "/" +
         PMSTextSha256Hex(link);
}

// A PNG, JPEG, GIF or WebP image by its first bytes: what a browser shows
// as a picture, never a page or a script.
bool IsImage(std::string_view body) {
  auto at = [body](size_t offset, std::string_view magic) {
    return body.size() >= offset + magic.size() && body.substr(offset, magic.size()) == magic;
  };
  return at(0, "\x89PNG\r\n\x1a\n") || at(0, "\xff\xd8\xff") || at(0, "GIF87a") ||
         at(0, "GIF89a") || (at(0, "RIFF") && at(8, "WEBP"));
}

// Where images may come from (server_image.h): the catalogues' addresses
// and whether private addresses are allowed. Read once per caller.
struct ImageRules {
  PkgServerConfig config;
  std::vector<std::string> servers;
};

ImageRules LoadRules() {
  ImageRules rules;
  rules.config = PMSLoadServerConfig();
  if (!rules.config.vendor_url.empty()) rules.servers.push_back(rules.config.vendor_url);
  for (std::string& feed : KIVOPackageServer::PMSFeedUrls()) rules.servers.push_back(feed);
  return rules;
}

bool Fetch(const ImageRules& rules, const std::string& link, const std::string& path) {
  HttpFetch fetch;
  fetch.url = link;
  fetch.servers_only = true;
  fetch.servers = rules.servers;
  fetch.public_only = !rules.config.allow_private_image_addresses;
  if (!PMSServerFetch(rules.config.SmallLimits(kMaxImageBytes), fetch) || fetch.status != 200) {
    IMAGE_LOG("%s: %s", link.c_str(),
              fetch.error.empty()
                  ? ("the server answered HTTP " + std::to_string(fetch.status)).c_str()
                  : fetch.error.c_str());
    return false;
  }
  if (!IsImage(fetch.body)) {
    IMAGE_LOG("%s: the answer is not a PNG, JPEG, GIF or WebP image", link.c_str());
    return false;
  }
  if (KIVOFSMkdirP(path.substr(0, path.rfind('/')).c_str()) != 0 ||
      !KIVOWriteFileAtomic(path, fetch.body, SyncToDisk::No)) {
    IMAGE_LOG("cannot write %s", path.c_str());
    return false;
  }
  return true;
}

// One fetch of an image at a time, whoever asks for it: the fetcher holds an
// exclusive lock on the marker "<image>.fetch" beside the image while the
// transfer is in flight. The listing's background child fetches the icons
// it lists, and the page asks for the same icons right after the listing
// answers; a request that finds the fetch of its image in flight waits a
// bounded moment for it instead of asking the server a second time. The
// lock goes with the process that holds it, so a fetcher that dies leaves
// no fetch in flight behind.
class ImageFetchLock {
 public:
  explicit ImageFetchLock(const std::string& path) : marker_(path + ".fetch") {}
  ~ImageFetchLock() {
    if (fd_ < 0) return;
    // The marker goes before the lock is released: a later request finds
    // the image, or no fetch in flight. A waiter that took the lock of a
    // marker already removed leaves alone the marker a later fetcher made.
    struct stat mine, named;
    if (held_ && fstat(fd_, &mine) == 0 && lstat(marker_.c_str(), &named) == 0 &&
        mine.st_dev == named.st_dev && mine.st_ino == named.st_ino) {
      unlink(marker_.c_str());
    }
    close(fd_);
  }
  ImageFetchLock(const ImageFetchLock&) = delete;
  ImageFetchLock& operator=(const ImageFetchLock&) = delete;

  // Takes the lock at once; false when another process holds it (or the
  // marker cannot be made).
  bool TryTake() { return Open() && (held_ = flock(fd_, LOCK_EX | LOCK_NB) == 0); }

  // Takes the lock, waiting at most `wait_ms` for the fetch in flight to
  // end. The wait polls: flock has no timeout of its own.
  bool Take(int wait_ms) {
    constexpr int kPollMs = 20;
    for (int waited = 0;; waited += kPollMs) {
      if (TryTake()) return true;
      if (fd_ < 0 || waited >= wait_ms) return false;
      struct timespec pause = {0, kPollMs * 1000000L};
      nanosleep(&pause, nullptr);
    }
  }

 private:
  bool Open() {
    if (fd_ >= 0) return true;
    if (KIVOFSMkdirP(marker_.substr(0, marker_.rfind('/')).c_str()) != 0) return false;
    fd_ = open(marker_.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644);
    if (fd_ < 0) IMAGE_LOG("cannot open %s", marker_.c_str());
    return fd_ >= 0;
  }

  std::string marker_;
  int fd_ = -1;
  bool held_ = false;
};

// How long a request waits for the fetch in flight of the image it asks
// for: about what an image server that answers at all takes. Past it the
// icon method answers its fallback (cached for seconds only) rather than
// keep the page waiting.
constexpr int kInFlightWaitMs = 5000;

// The image at `path`, fetched under its lock unless the fetch in flight
// brought it: `wait_ms` bounds the wait for that fetch (0: none; another
// fetcher's image is then left to it).
bool FetchOnce(const ImageRules& rules, const std::string& link, const std::string& path,
               int wait_ms) {
  ImageFetchLock lock(path);
  if (wait_ms == 0 && !lock.TryTake()) return false;
  if (wait_ms > 0 && !lock.Take(wait_ms)) {
    IMAGE_LOG("%s: its fetch in flight did not end within %d ms", link.c_str(), wait_ms);
    return false;
  }
  return access(path.c_str(), F_OK) == 0 || Fetch(rules, link, path);
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
    const ImageRules rules = LoadRules();
    FILE* lines = fdopen(in, "r");
    char buffer[4096];
    while (lines && fgets(buffer, sizeof(buffer), lines)) {
      std::string line(buffer);
      size_t tab = line.find('\t');
      if (tab == std::string::npos || line.back() != '\n') continue;
      std::string path = line.substr(tab + 1, line.size() - tab - 2);
      if (access(path.c_str(), F_OK) != 0) (void)FetchOnce(rules, line.substr(0, tab), path, 0);
    }
    _exit(0);
  }

  int fd_ = -1;
};

}  // namespace

bool PMSServerImagePath(const std::string& package, const std::string& version,
                        const std::string& link, std::string* path) {
  std::string cached = ImagePath(package, version, link);
  if (cached.empty()) return false;
  if (access(cached.c_str(), R_OK) != 0 && !FetchOnce(LoadRules(), link, cached, kInFlightWaitMs)) {
    return false;
  }
  *path = std::move(cached);
  return true;
}

void PMSQueueServerImage(const std::string& package, const std::string& version,
                         const std::string& link) {
  std::string path = ImagePath(package, version, link);
  if (path.empty() || access(path.c_str(), F_OK) == 0) return;
  static BackgroundFetcher fetcher;
  fetcher.Queue(link, path);
}

}  // namespace KIVOPackageTool
