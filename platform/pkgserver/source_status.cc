#include "pkgserver/source_status.h"

#include <cerrno>
#include <cstdio>
#include <syslog.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/file_lock.h"
#include "klibc/json_text.h"
#include "klibc/sysroot.h"
#include "pkgserver/catalogue.h"

#define SOURCE_LOG(fmt, ...) \
  syslog(LOG_WARNING, "%s:%d " fmt, "source_status", __LINE__, ##__VA_ARGS__)

namespace KIVOPackageServer {

namespace {

// A reason longer than this is cut: it comes from a transfer library or a
// server's status line, and a record stays small.
constexpr size_t kMaxReason = 300;
// A record is a few hundred bytes; anything larger is not one of ours.
constexpr size_t kMaxRecordBytes = 4096;

std::string StatusDir() { return KIVORootPath("/var/cache/kivo/pkgserver/sources"); }

// One file per address, named by a digest of it: an address may hold any
// character a URL may.
std::string StatusPath(const std::string& url) {
  char name[40];
  snprintf(name, sizeof(name), "%016llx.json",
           static_cast<unsigned long long>(PMSCatalogueDigest(url)));
  return StatusDir() + "/" + name;
}

int64_t Int(const Json::Value& v, int64_t fallback) {
  return v.isIntegral() ? static_cast<int64_t>(v.asInt64()) : fallback;
}

// Reads the record at `path` for `url`; a missing file leaves `known` false.
// A file of another address (a digest collision) is no record of this one.
bool ReadRecord(const std::string& path, const std::string& url, SourceStatus* status) {
  *status = SourceStatus();
  if (access(path.c_str(), F_OK) != 0 && errno == ENOENT) return true;
  std::string text;
  Json::Value v;
  if (!KIVOReadFile(path, &text, kMaxRecordBytes) || !KIVOParseJson(text, &v) || !v.isObject()) {
    return false;
  }
  if (!v["url"].isString() || v["url"].asString() != url) return true;
  status->known = true;
  status->last_attempt = Int(v["last_attempt"], 0);
  status->last_success = Int(v["last_success"], 0);
  status->failing_since = Int(v["failing_since"], 0);
  status->error = v["error"].isString() ? v["error"].asString() : "";
  status->packages = Int(v["packages"], -1);
  return true;
}

void WriteRecord(const std::string& path, const std::string& url, const SourceStatus& s) {
  Json::Value v(Json::objectValue);
  v["url"] = url;
  v["last_attempt"] = static_cast<Json::Int64>(s.last_attempt);
  v["last_success"] = static_cast<Json::Int64>(s.last_success);
  v["failing_since"] = static_cast<Json::Int64>(s.failing_since);
  v["error"] = s.error;
  v["packages"] = static_cast<Json::Int64>(s.packages);
  if (!KIVOWriteFileAtomic(path, KIVOWriteJson(v) + "\n", SyncToDisk::No)) {
    SOURCE_LOG("cannot write %s", path.c_str());
  }
}

// Applies `change` to the record of `url` under the lock. A record that
// cannot be read is started afresh: it only tells how fresh a cache is.
template <typename Change>
void Update(const std::string& url, Change change) {
  if (KIVOFSMkdirP(StatusDir().c_str()) != 0) {
    SOURCE_LOG("cannot make %s", StatusDir().c_str());
    return;
  }
  FileLock lock(StatusDir() + "/.lock");
  if (!lock.held()) {
    SOURCE_LOG("cannot lock %s/.lock, %m", StatusDir().c_str());
    return;
  }
  const std::string path = StatusPath(url);
  SourceStatus status;
  if (!ReadRecord(path, url, &status)) {
    SOURCE_LOG("%s is damaged; it is written afresh", path.c_str());
    status = SourceStatus();
  }
  change(&status);
  WriteRecord(path, url, status);
}

Json::Value TimeOrNull(int64_t t) {
  return t > 0 ? Json::Value(static_cast<Json::Int64>(t)) : Json::Value();
}

}  // namespace

void PMSRecordFetchSuccess(const std::string& url, int64_t packages, int64_t now) {
  Update(url, [&](SourceStatus* s) {
    s->last_attempt = now;
    s->last_success = now;
    s->failing_since = 0;
    s->error.clear();
    if (packages >= 0) s->packages = packages;
  });
}

void PMSRecordFetchFailure(const std::string& url, const std::string& reason, int64_t now) {
  Update(url, [&](SourceStatus* s) {
    s->last_attempt = now;
    if (s->failing_since == 0) s->failing_since = now;
    s->error = reason.size() > kMaxReason ? reason.substr(0, kMaxReason) + "…" : reason;
  });
}

bool PMSReadSourceStatus(const std::string& url, SourceStatus* status) {
  return ReadRecord(StatusPath(url), url, status);
}

void PMSForgetSourceStatus(const std::string& url) {
  FileLock lock(StatusDir() + "/.lock");
  const std::string path = StatusPath(url);
  SourceStatus status;
  // Only this address's own record goes, never another's of the same digest.
  if (lock.held() && ReadRecord(path, url, &status) && status.known && unlink(path.c_str()) != 0) {
    SOURCE_LOG("cannot remove %s, %m", path.c_str());
  }
}

Json::Value PMSSourceStatusJson(const SourceStatus& s) {
  Json::Value v(Json::objectValue);
  v["last_attempt"] = TimeOrNull(s.last_attempt);
  v["last_success"] = TimeOrNull(s.last_success);
  v["failing_since"] = TimeOrNull(s.failing_since);
  v["error"] = s.error;
  v["packages"] =
      s.packages >= 0 ? Json::Value(static_cast<Json::Int64>(s.packages)) : Json::Value();
  return v;
}

}  // namespace KIVOPackageServer
