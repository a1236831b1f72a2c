// The transfers of server_net.h on libcurl; built into
// libkivo_pkgserver_net.so, which the light library loads on first use.

#include <cerrno>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <fcntl.h>
#include <memory>
#include <mutex>
#include <sys/socket.h>
#include <sys/stat.h>
#include <thread>
#include <unistd.h>

#include <curl/curl.h>

#include "klibc/hex.h"
#include "pkgserver/server_net.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <openssl/evp.h>
#include <strings.h>

namespace {

constexpr char kUserAgent[] = "KIVO-PackageCenter/1";
constexpr long kReceiveBuffer = 256 * 1024;

struct CurlDeleter {
  void operator()(CURL* c) const { curl_easy_cleanup(c); }
};
struct SlistDeleter {
  void operator()(curl_slist* l) const { curl_slist_free_all(l); }
};
struct DigestDeleter {
  void operator()(EVP_MD_CTX* c) const { EVP_MD_CTX_free(c); }
};
struct UrlDeleter {
  void operator()(CURLU* u) const { curl_url_cleanup(u); }
};
using CurlHandle = std::unique_ptr<CURL, CurlDeleter>;
using HeaderList = std::unique_ptr<curl_slist, SlistDeleter>;
using Digest = std::unique_ptr<EVP_MD_CTX, DigestDeleter>;
using UrlHandle = std::unique_ptr<CURLU, UrlDeleter>;

bool GlobalInit() {
  static const bool ok = curl_global_init(CURL_GLOBAL_DEFAULT) == CURLE_OK;
  return ok;
}

// The settings every transfer shares: protocols, redirects, time bounds.
CurlHandle NewHandle(const std::string& url, const HttpLimits& limits) {
  if (!GlobalInit()) return nullptr;
  CurlHandle c(curl_easy_init());
  if (!c) return nullptr;
  CURL* h = c.get();
  curl_easy_setopt(h, CURLOPT_URL, url.c_str());
  curl_easy_setopt(h, CURLOPT_PROTOCOLS_STR, "http,https");
  curl_easy_setopt(h, CURLOPT_REDIR_PROTOCOLS_STR, "http,https");
  curl_easy_setopt(h, CURLOPT_FOLLOWLOCATION, 1L);
  curl_easy_setopt(h, CURLOPT_MAXREDIRS, static_cast<long>(kMaxRedirects));
  curl_easy_setopt(h, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(h, CURLOPT_NOPROXY, "localhost,127.0.0.1,::1");
  curl_easy_setopt(h, CURLOPT_USERAGENT, kUserAgent);
  curl_easy_setopt(h, CURLOPT_CONNECTTIMEOUT, limits.connect_timeout_s);
  if (limits.total_timeout_s > 0) curl_easy_setopt(h, CURLOPT_TIMEOUT, limits.total_timeout_s);
  if (limits.stall_timeout_s > 0) {
    curl_easy_setopt(h, CURLOPT_LOW_SPEED_LIMIT, 1L);
    curl_easy_setopt(h, CURLOPT_LOW_SPEED_TIME, limits.stall_timeout_s);
  }
  curl_easy_setopt(h, CURLOPT_BUFFERSIZE, kReceiveBuffer);
  return c;
}

long Status(CURL* h) {
  long status = 0;
  curl_easy_getinfo(h, CURLINFO_RESPONSE_CODE, &status);
  return status;
}

// The value of header line `line` when it is `name`, trimmed; else "".
std::string HeaderValue(const char* line, size_t size, const char* name) {
  size_t n = strlen(name);
  if (size <= n || strncasecmp(line, name, n) != 0 || line[n] != ':') return "";
  std::string value(line + n + 1, size - n - 1);
  size_t b = value.find_first_not_of(" \t"), e = value.find_last_not_of(" \t\r\n");
  return b == std::string::npos ? "" : value.substr(b, e - b + 1);
}

// --- Fetch into memory -----------------------------------------------------

struct FetchState {
  HttpFetch* fetch;
  uint64_t max_bytes;
  bool too_large = false;
  std::string redirect{};  // where a redirect that was not followed points
};

size_t FetchBody(char* data, size_t size, size_t n, void* user) {
  auto* s = static_cast<FetchState*>(user);
  size_t bytes = size * n;
  if (s->max_bytes && s->fetch->body.size() + bytes > s->max_bytes) {
    s->too_large = true;
    return 0;  // aborts the transfer
  }
  s->fetch->body.append(data, bytes);
  return bytes;
}

size_t FetchHeader(char* line, size_t size, size_t n, void* user) {
  auto* s = static_cast<FetchState*>(user);
  size_t bytes = size * n;
  // A redirect's headers come first; only the last answer's count.
  if (bytes > 5 && strncmp(line, "HTTP/", 5) == 0) {
    s->fetch->etag.clear();
    s->fetch->last_modified.clear();
    s->fetch->body.clear();
  }
  std::string v = HeaderValue(line, bytes, "ETag");
  if (!v.empty()) s->fetch->etag = v;
  v = HeaderValue(line, bytes, "Last-Modified");
  if (!v.empty()) s->fetch->last_modified = v;
  return bytes;
}

// --- Guards for addresses that a server's answer names --------------------

// An IPv4 address (host byte order) in a block that is not the public
// internet: this network, private, carrier NAT, loopback, link-local,
// protocol assignments, documentation, benchmarking, multicast, reserved.
bool IsNonPublic4(uint32_t a) {
  static const struct {
    uint32_t net;
    int bits;
  } kBlocks[] = {{0x00000000, 8},  {0x0A000000, 8},  {0x64400000, 10}, {0x7F000000, 8},
                 {0xA9FE0000, 16}, {0xAC100000, 12}, {0xC0000000, 24}, {0xC0000200, 24},
                 {0xC0A80000, 16}, {0xC6120000, 15}, {0xC6336400, 24}, {0xCB007100, 24},
                 {0xE0000000, 3}};
  for (const auto& b : kBlocks) {
    if ((a >> (32 - b.bits)) == (b.net >> (32 - b.bits))) return true;
  }
  return false;
}

uint32_t Read4(const unsigned char* p) {
  return uint32_t{p[0]} << 24 | uint32_t{p[1]} << 16 | uint32_t{p[2]} << 8 | p[3];
}

// An IPv6 address that is not the public internet, an IPv4 address carried
// in one (mapped, compatible, NAT64, 6to4) judged as that address.
bool IsNonPublic6(const unsigned char* b) {
  static const unsigned char kZero[12] = {};
  static const unsigned char kMapped[12] = {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0xff, 0xff};
  static const unsigned char kNat64[12] = {0, 0x64, 0xff, 0x9b};
  if (memcmp(b, kZero, 12) == 0 || memcmp(b, kMapped, 12) == 0 || memcmp(b, kNat64, 12) == 0) {
    return IsNonPublic4(Read4(b + 12));  // ::, ::1 and ::a.b.c.d land in 0.0.0.0/8
  }
  if (b[0] == 0x20 && b[1] == 0x02) return IsNonPublic4(Read4(b + 2));            // 6to4
  if (b[0] == 0x20 && b[1] == 0x01 && b[2] == 0x0d && b[3] == 0xb8) return true;  // documentation
  return (b[0] & 0xfe) == 0xfc ||                                                 // unique local
         (b[0] == 0xfe && (b[1] & 0xc0) == 0x80) ||                               // link-local
         (b[0] == 0xfe && (b[1] & 0xc0) == 0xc0) ||                               // site-local
         b[0] == 0xff;                                                            // multicast
}

// The address as text, for the log.
std::string AddressText(const sockaddr* a) {
  char text[INET6_ADDRSTRLEN] = "?";
  if (a->sa_family == AF_INET) {
    inet_ntop(AF_INET, &reinterpret_cast<const sockaddr_in*>(a)->sin_addr, text, sizeof(text));
  } else if (a->sa_family == AF_INET6) {
    inet_ntop(AF_INET6, &reinterpret_cast<const sockaddr_in6*>(a)->sin6_addr, text, sizeof(text));
  }
  return text;
}

bool IsPublic(const sockaddr* a) {
  if (a->sa_family == AF_INET) {
    return !IsNonPublic4(ntohl(reinterpret_cast<const sockaddr_in*>(a)->sin_addr.s_addr));
  }
  if (a->sa_family == AF_INET6) {
    return !IsNonPublic6(reinterpret_cast<const sockaddr_in6*>(a)->sin6_addr.s6_addr);
  }
  return false;
}

// Opens the socket of each connection only to a public address: libcurl
// calls it with the resolved address, for the first request and for every
// redirect, so a name that resolves to loopback is caught as well.
curl_socket_t OpenPublicSocket(void* user, curlsocktype, curl_sockaddr* address) {
  auto* refused = static_cast<std::string*>(user);
  if (!IsPublic(&address->addr)) {
    *refused = AddressText(&address->addr);
    return CURL_SOCKET_BAD;
  }
  return socket(address->family, address->socktype | SOCK_CLOEXEC, address->protocol);
}

// An address parsed by libcurl's own URL parser, which the transfer then
// uses as it is: what is judged is what is fetched.
UrlHandle ParseUrl(const std::string& url) {
  UrlHandle u(curl_url());
  if (!u || curl_url_set(u.get(), CURLUPART_URL, url.c_str(), 0) != CURLUE_OK) return nullptr;
  return u;
}

// "host:port" of a parsed address (the scheme's port when none is given),
// the host in lower case; "" when it has none.
std::string ServerOf(CURLU* u) {
  char* host = nullptr;
  char* port = nullptr;
  std::string server;
  if (curl_url_get(u, CURLUPART_HOST, &host, 0) == CURLUE_OK &&
      curl_url_get(u, CURLUPART_PORT, &port, CURLU_DEFAULT_PORT) == CURLUE_OK && *host) {
    for (const char* c = host; *c; ++c) server += static_cast<char>(tolower(*c));
    server += std::string(":") + port;
  }
  curl_free(host);
  curl_free(port);
  return server;
}

bool OnListedServer(CURLU* u, const std::vector<std::string>& servers) {
  const std::string server = ServerOf(u);
  if (server.empty()) return false;
  for (const std::string& listed : servers) {
    UrlHandle l = ParseUrl(listed);
    if (l && ServerOf(l.get()) == server) return true;
  }
  return false;
}

// --- Fetch into memory (continued) -----------------------------------------

// One request of `fetch` for `url` (a parsed address when the caller judged
// it); libcurl follows redirects itself unless `follow` is false. The curl
// result code; the answer is in `fetch` and `state`.
CURLcode FetchOnce(const HttpLimits& limits, HttpFetch& fetch, CURLU* url, bool follow,
                   FetchState& state, std::string& refused_address) {
  CurlHandle c = NewHandle(fetch.url, limits);
  if (!c) return CURLE_FAILED_INIT;
  CURL* h = c.get();
  if (url) curl_easy_setopt(h, CURLOPT_CURLU, url);
  if (!follow) curl_easy_setopt(h, CURLOPT_FOLLOWLOCATION, 0L);
  if (fetch.public_only) {
    curl_easy_setopt(h, CURLOPT_PROXY, "");
    curl_easy_setopt(h, CURLOPT_OPENSOCKETFUNCTION, OpenPublicSocket);
    curl_easy_setopt(h, CURLOPT_OPENSOCKETDATA, &refused_address);
  }
  HeaderList headers;
  if (!fetch.if_none_match.empty())
    headers.reset(
        curl_slist_append(headers.release(), ("If-None-Match: " + fetch.if_none_match).c_str()));
  if (!fetch.if_modified_since.empty())
    headers.reset(curl_slist_append(headers.release(),
                                    ("If-Modified-Since: " + fetch.if_modified_since).c_str()));
  if (headers) curl_easy_setopt(h, CURLOPT_HTTPHEADER, headers.get());
  if (!fetch.form.empty()) curl_easy_setopt(h, CURLOPT_POSTFIELDS, fetch.form.c_str());
  curl_easy_setopt(h, CURLOPT_ACCEPT_ENCODING, "");
  curl_easy_setopt(h, CURLOPT_WRITEFUNCTION, FetchBody);
  curl_easy_setopt(h, CURLOPT_WRITEDATA, &state);
  curl_easy_setopt(h, CURLOPT_HEADERFUNCTION, FetchHeader);
  curl_easy_setopt(h, CURLOPT_HEADERDATA, &state);
  CURLcode rc = curl_easy_perform(h);
  fetch.status = Status(h);
  char* location = nullptr;
  state.redirect.clear();
  if (rc == CURLE_OK && curl_easy_getinfo(h, CURLINFO_REDIRECT_URL, &location) == CURLE_OK &&
      location) {
    state.redirect = location;
  }
  return rc;
}

bool Fetch(const HttpLimits& limits, HttpFetch& fetch) {
  FetchState state{&fetch, limits.max_bytes};
  std::string refused_address;
  const bool guarded = fetch.servers_only;
  std::string url = fetch.url;
  CURLcode rc = CURLE_OK;
  // Unguarded, libcurl follows redirects; guarded, each one is judged here
  // before it is asked for.
  for (int hop = 0;; ++hop) {
    UrlHandle parsed = guarded ? ParseUrl(url) : nullptr;
    if (guarded && !(parsed && OnListedServer(parsed.get(), fetch.servers))) {
      fetch.error = url + " is not on the server of a catalogue";
      return false;
    }
    rc = FetchOnce(limits, fetch, parsed.get(), !guarded, state, refused_address);
    if (!guarded || rc != CURLE_OK || state.redirect.empty() || fetch.status < 300 ||
        fetch.status > 399) {
      break;
    }
    if (hop == kMaxRedirects) {
      fetch.error = "more than " + std::to_string(kMaxRedirects) + " redirects";
      return false;
    }
    url = state.redirect;
  }
  if (state.too_large) {
    fetch.error = "answer larger than " + std::to_string(limits.max_bytes) + " bytes";
    return false;
  }
  if (rc != CURLE_OK) {
    // A refused address fails the transfer when no other address of the
    // name could be reached.
    fetch.error = refused_address.empty()
                      ? curl_easy_strerror(rc)
                      : "not connecting to " + refused_address + ": not a public address";
    return false;
  }
  return true;
}

// --- Download into a file --------------------------------------------------

// A digest of a download on a thread of its own, so that hashing
// one block overlaps receiving and writing the next: inline, the digests
// took most of the worker's time and the server waited on a full socket.
// Both digest threads read the same block, which nobody changes once it is
// queued. At most kMaxQueued blocks wait, so memory stays flat in the file
// size.
class DigestThread {
 public:
  DigestThread(EVP_MD_CTX* md5, EVP_MD_CTX* sha256) : md5_(md5), sha256_(sha256) {}
  ~DigestThread() {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      closing_ = true;
    }
    changed_.notify_all();
    if (thread_.joinable()) thread_.join();
  }
  DigestThread(const DigestThread&) = delete;
  DigestThread& operator=(const DigestThread&) = delete;

  void Feed(const std::shared_ptr<const std::string>& block) {
    if (!md5_ && !sha256_) return;
    if (!thread_.joinable()) thread_ = std::thread(&DigestThread::Run, this);
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait(lock, [this] { return queue_.size() < kMaxQueued; });
    queue_.push_back(block);
    changed_.notify_all();
  }
  // Returns once every block fed so far is in the digests.
  void Drain() {
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait(lock, [this] { return queue_.empty() && !busy_; });
  }

 private:
  static constexpr size_t kMaxQueued = 4;

  void Run() {
    std::unique_lock<std::mutex> lock(mutex_);
    for (;;) {
      changed_.wait(lock, [this] { return closing_ || !queue_.empty(); });
      if (queue_.empty()) return;
      std::shared_ptr<const std::string> block = std::move(queue_.front());
      queue_.pop_front();
      busy_ = true;
      changed_.notify_all();
      lock.unlock();
      if (md5_) EVP_DigestUpdate(md5_, block->data(), block->size());
      if (sha256_) EVP_DigestUpdate(sha256_, block->data(), block->size());
      lock.lock();
      busy_ = false;
      changed_.notify_all();
    }
  }

  EVP_MD_CTX* md5_;
  EVP_MD_CTX* sha256_;
  std::mutex mutex_;
  std::condition_variable changed_;
  std::deque<std::shared_ptr<const std::string>> queue_;
  bool busy_ = false;
  bool closing_ = false;
  std::thread thread_;
};

class FileSink {
 public:
  // Received pieces are gathered into blocks of this size before the digest
  // threads get them: libcurl hands over 16 KiB at a time, and
  // waking both threads for each piece cost about a second of CPU per GiB.
  static constexpr size_t kHashBlock = 1 << 20;
  FileSink(HttpDownload& d) : d_(d) {}
  ~FileSink() {
    if (fd_ >= 0) close(fd_);
  }
  FileSink(const FileSink&) = delete;
  FileSink& operator=(const FileSink&) = delete;

  bool Open() {
    fd_ = open(d_.path.c_str(), O_WRONLY | O_CREAT | O_CLOEXEC, 0600);
    if (fd_ < 0) return false;
    struct stat st;
    if (fstat(fd_, &st) != 0) return false;
    if (d_.want_md5) md5_.reset(EVP_MD_CTX_new());
    if (d_.want_sha256) sha256_.reset(EVP_MD_CTX_new());
    // One thread per digest: md5, the slower, then bounds the rate alone.
    md5_hasher_ = std::make_unique<DigestThread>(md5_.get(), nullptr);
    sha256_hasher_ = std::make_unique<DigestThread>(nullptr, sha256_.get());
    return ResetDigests() && HashExisting(static_cast<uint64_t>(st.st_size));
  }
  // Drops everything received so far (the server ignored the range).
  bool StartOver() {
    have_ = 0;
    return ftruncate(fd_, 0) == 0 && lseek(fd_, 0, SEEK_SET) == 0 && ResetDigests();
  }
  bool Write(const char* data, size_t size) {
    for (size_t done = 0; done < size;) {
      ssize_t n = ::write(fd_, data + done, size - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) return false;
      done += static_cast<size_t>(n);
    }
    Hash(data, size);
    have_ += size;
    return true;
  }
  uint64_t have() const { return have_; }
  void Finish() {
    FlushPending();
    Drain();
    unsigned char digest[EVP_MAX_MD_SIZE];
    unsigned size = 0;
    if (md5_ && EVP_DigestFinal_ex(md5_.get(), digest, &size)) d_.md5_hex = KIVOHex(digest, size);
    if (sha256_ && EVP_DigestFinal_ex(sha256_.get(), digest, &size))
      d_.sha256_hex = KIVOHex(digest, size);
  }

 private:
  void Drain() {
    md5_hasher_->Drain();
    sha256_hasher_->Drain();
  }
  bool ResetDigests() {
    pending_.reset();
    Drain();
    return (!md5_ || EVP_DigestInit_ex(md5_.get(), EVP_md5(), nullptr)) &&
           (!sha256_ || EVP_DigestInit_ex(sha256_.get(), EVP_sha256(), nullptr));
  }
  void Hash(const char* data, size_t size) {
    if (!md5_ && !sha256_) return;
    if (!pending_) {
      pending_ = std::make_shared<std::string>();
      pending_->reserve(kHashBlock);
    }
    pending_->append(data, size);
    if (pending_->size() >= kHashBlock) FlushPending();
  }
  void FlushPending() {
    if (!pending_) return;
    std::shared_ptr<const std::string> block = std::move(pending_);
    md5_hasher_->Feed(block);
    sha256_hasher_->Feed(block);
  }
  // Bytes left by an earlier attempt count once the server resumes after them.
  bool HashExisting(uint64_t size) {
    char buffer[64 * 1024];
    while (have_ < size) {
      ssize_t n = pread(fd_, buffer, sizeof(buffer), static_cast<off_t>(have_));
      if (n <= 0) return false;
      Hash(buffer, static_cast<size_t>(n));
      have_ += static_cast<uint64_t>(n);
    }
    return lseek(fd_, 0, SEEK_END) >= 0;
  }

  HttpDownload& d_;
  int fd_ = -1;
  uint64_t have_ = 0;
  std::shared_ptr<std::string> pending_;
  Digest md5_, sha256_;
  // Declared after the digests it updates: it ends before they are freed.
  std::unique_ptr<DigestThread> md5_hasher_, sha256_hasher_;
};

struct Attempt {
  HttpDownload* d;
  FileSink* sink;
  const HttpLimits* limits;
  CURL* handle;
  uint64_t offset;  // what the range asked to start at
  uint64_t total = 0;
  bool checked_status = false;
  bool too_large = false;
  bool disk_failed = false;
  bool bad_status = false;
};

// The first body bytes of an answer: is it the file, and from where?
bool AcceptAnswer(Attempt* a) {
  a->checked_status = true;
  long status = Status(a->handle);
  a->d->status = status;
  if (status == 200 && a->offset > 0) return a->sink->StartOver();
  if (status == 200 || (status == 206 && a->offset > 0)) return true;
  a->bad_status = true;
  return false;
}

size_t DownloadBody(char* data, size_t size, size_t n, void* user) {
  auto* a = static_cast<Attempt*>(user);
  size_t bytes = size * n;
  if (!a->checked_status && !AcceptAnswer(a)) return 0;
  if (a->limits->max_bytes && a->sink->have() + bytes > a->limits->max_bytes) {
    a->too_large = true;
    return 0;
  }
  if (!a->sink->Write(data, bytes)) {
    a->disk_failed = true;
    return 0;
  }
  return bytes;
}

int DownloadProgress(void* user, curl_off_t total, curl_off_t now, curl_off_t, curl_off_t) {
  auto* a = static_cast<Attempt*>(user);
  HttpDownload* d = a->d;
  if (d->canceled && d->canceled(d->context)) return 1;
  if (total > 0) a->total = a->offset + static_cast<uint64_t>(total);
  if (d->progress && a->checked_status) {
    uint64_t expected = a->limits->max_bytes ? a->limits->max_bytes : a->total;
    d->progress(d->context, a->sink->have(), expected);
  }
  (void)now;
  return 0;
}

// Errors after which the same request may succeed if made again.
bool Retryable(CURLcode rc) {
  switch (rc) {
    case CURLE_COULDNT_CONNECT:
    case CURLE_PARTIAL_FILE:
    case CURLE_RECV_ERROR:
    case CURLE_SEND_ERROR:
    case CURLE_GOT_NOTHING:
    case CURLE_OPERATION_TIMEDOUT:
      return true;
    default:
      return false;
  }
}

// One request for the rest of the file. The curl result code.
CURLcode RunAttempt(const HttpLimits& limits, HttpDownload& d, FileSink& sink, Attempt& a) {
  CurlHandle c = NewHandle(d.url, limits);
  if (!c) return CURLE_FAILED_INIT;
  CURL* h = c.get();
  a.handle = h;
  std::string range = std::to_string(a.offset) + "-";
  if (a.offset > 0) curl_easy_setopt(h, CURLOPT_RANGE, range.c_str());
  curl_easy_setopt(h, CURLOPT_WRITEFUNCTION, DownloadBody);
  curl_easy_setopt(h, CURLOPT_WRITEDATA, &a);
  curl_easy_setopt(h, CURLOPT_NOPROGRESS, 0L);
  curl_easy_setopt(h, CURLOPT_XFERINFOFUNCTION, DownloadProgress);
  curl_easy_setopt(h, CURLOPT_XFERINFODATA, &a);
  CURLcode rc = curl_easy_perform(h);
  if (rc == CURLE_OK && !a.checked_status && !AcceptAnswer(&a)) rc = CURLE_WRITE_ERROR;
  return rc;
}

using Outcome = HttpDownload::Outcome;

// Sets the outcome of a failed attempt; true when another attempt may help.
bool Judge(CURLcode rc, const Attempt& a, HttpDownload& d) {
  if (a.too_large) {
    d.outcome = Outcome::kTooLarge;
    d.error =
        "the server sent more than the announced " + std::to_string(a.limits->max_bytes) + " bytes";
  } else if (a.disk_failed) {
    d.outcome = Outcome::kDisk;
    d.error = std::string("cannot write the file: ") + strerror(errno);
  } else if (a.bad_status) {
    d.outcome = Outcome::kHttpStatus;
    d.error = "the server answered HTTP " + std::to_string(d.status);
  } else if (rc == CURLE_ABORTED_BY_CALLBACK) {
    d.outcome = Outcome::kCanceled;
    d.error = "canceled";
  } else {
    d.outcome = Outcome::kNetwork;
    d.error = curl_easy_strerror(rc);
    return Retryable(rc);
  }
  return false;
}

bool Download(const HttpLimits& limits, HttpDownload& d) {
  FileSink sink(d);
  if (!sink.Open()) {
    d.outcome = Outcome::kDisk;
    d.error = std::string("cannot open the file: ") + strerror(errno);
    return false;
  }
  for (int attempt = 0;; ++attempt) {
    Attempt a{&d, &sink, &limits, nullptr, sink.have()};
    CURLcode rc = RunAttempt(limits, d, sink, a);
    d.bytes = sink.have();
    if (rc == CURLE_OK) {
      sink.Finish();
      d.outcome = Outcome::kOk;
      return true;
    }
    if (!Judge(rc, a, d) || attempt >= d.retries) return false;
    if (d.canceled && d.canceled(d.context)) {
      d.outcome = Outcome::kCanceled;
      return false;
    }
    usleep(200000 * static_cast<useconds_t>(attempt + 1));
  }
}

const PackageServerNetOps kOps = {Fetch, Download};

}  // namespace

extern "C" __attribute__((visibility("default"))) const PackageServerNetOps*
KivoPackageServerNet() {
  return &kOps;
}
