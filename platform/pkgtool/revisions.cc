#include "pkgtool/revisions.h"

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <dirent.h>
#include <fcntl.h>
#include <set>
#include <sys/stat.h>
#include <unistd.h>
#include <utility>

#include "klibc/atomic_file.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "pkgtool/lifecycle.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "storage/volumes.h"

namespace {

// REPLACED is one line of digits; anything longer is no record of ours.
constexpr size_t kMaxReplacedBytes = 32;
// Deeper folders than this are not walked for their room: a copy never
// holds them (tree_copy.h).
constexpr int kMaxDepth = 128;

bool IsFolder(const std::string& path) {
  struct stat st;
  return lstat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

std::string Link(const std::string& path) {
  char buf[4096];
  ssize_t n = readlink(path.c_str(), buf, sizeof(buf) - 1);
  return n > 0 ? std::string(buf, static_cast<size_t>(n)) : "";
}

bool AllDigits(const std::string& text, size_t max) {
  return !text.empty() && text.size() <= max &&
         std::all_of(text.begin(), text.end(), [](char c) { return c >= '0' && c <= '9'; });
}

// The time in a REPLACED member ("<seconds>.<nanoseconds>" on one line);
// false when it holds anything else or a time not after 1970.
bool ReadReplaced(const std::string& record_dir, time_t* seconds, long* nanoseconds) {
  std::string text;
  if (!KIVOReadFile(record_dir + "/" + kPMSReplacedMember, &text, kMaxReplacedBytes + 1) ||
      text.size() > kMaxReplacedBytes || text.empty() || text.back() != '\n') {
    return false;
  }
  text.pop_back();
  const size_t dot = text.find('.');
  if (dot == std::string::npos || !AllDigits(text.substr(0, dot), 18) ||
      !AllDigits(text.substr(dot + 1), 9)) {
    return false;
  }
  *seconds = static_cast<time_t>(std::strtoll(text.c_str(), nullptr, 10));
  *nanoseconds = std::strtol(text.c_str() + dot + 1, nullptr, 10);
  return *seconds > 0;
}

// Adds the blocks of everything under the open folder `dir` to *bytes;
// files with several links are counted once (`seen`).
void AddFolderBytes(int dir, int depth, std::set<std::pair<dev_t, ino_t>>* seen, uint64_t* bytes) {
  DIR* d = fdopendir(dir);
  if (!d) {
    close(dir);
    return;
  }
  while (struct dirent* e = readdir(d)) {
    const std::string name = e->d_name;
    if (name == "." || name == "..") continue;
    struct stat st;
    if (fstatat(dirfd(d), name.c_str(), &st, AT_SYMLINK_NOFOLLOW) != 0) continue;
    if (st.st_nlink > 1 && !S_ISDIR(st.st_mode) && !seen->insert({st.st_dev, st.st_ino}).second) {
      continue;
    }
    *bytes += static_cast<uint64_t>(st.st_blocks) * 512;
    if (!S_ISDIR(st.st_mode) || depth >= kMaxDepth) continue;
    int child = openat(dirfd(d), name.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
    if (child >= 0) AddFolderBytes(child, depth + 1, seen, bytes);
  }
  closedir(d);
}

// The blocks of the folder `path` and everything under it, never
// following a symlink.
uint64_t FolderBytes(const std::string& path, std::set<std::pair<dev_t, ino_t>>* seen) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return 0;
  uint64_t bytes = static_cast<uint64_t>(st.st_blocks) * 512;
  int dir = open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC);
  if (dir >= 0) AddFolderBytes(dir, 1, seen, &bytes);
  return bytes;
}

}  // namespace

int PMSKeepRevisionsSetting() { return PMSToolSetting("keep_revisions", 1, 0); }

bool PMSReadRevision(const std::string& appdata, const std::string& id, const std::string& record,
                     PMSRevision* out) {
  const DataSnapshot s(appdata, id, record);
  if (!s.IsValid() || !IsFolder(s.Named(kPMSKeptSuffix))) return false;
  // The published version is the package itself, never a revision of it.
  if (PackageRegistry::PublishedRecord(id) == ".records/" + record) return false;
  const std::string dir = PackageRegistry::RecordsDir() + "/" + record;
  KeyValueMap info;
  if (!IsFolder(dir) || !KIVOKeyValueLoad(dir + "/INFO", &info) || info["package"] != id ||
      info["version"].empty()) {
    return false;
  }
  time_t replaced = 0;
  long replaced_ns = 0;
  const std::string payload = Link(dir + "/target");
  if (!ReadReplaced(dir, &replaced, &replaced_ns) ||
      PMSVolumeFolderHolding(payload, "@appstore").empty() || !IsFolder(payload) ||
      Link(dir + "/var") != s.data_dir()) {
    return false;
  }
  *out = PMSRevision{appdata, id, record, info["version"], payload, replaced, replaced_ns};
  return true;
}

std::vector<PMSRevision> PMSListRevisions(const std::string& id) {
  std::vector<PMSRevision> revisions;
  if (!PMSIsValidPackageId(id)) return revisions;
  const std::string kept = kPMSKeptSuffix;
  for (const VolumeConfig& volume : KIVOVolumesLoad()) {
    const std::string appdata = KIVORootPath(volume.path + "/@appdata");
    for (const std::string& name : PMSListDir(PMSSnapshotsDir(appdata) + "/" + id)) {
      if (name.size() <= kept.size() || name.compare(name.size() - kept.size(), kept.size(), kept))
        continue;
      PMSRevision r;
      if (PMSReadRevision(appdata, id, name.substr(0, name.size() - kept.size()), &r)) {
        revisions.push_back(r);
      }
    }
  }
  std::sort(revisions.begin(), revisions.end(), [](const PMSRevision& a, const PMSRevision& b) {
    if (a.replaced != b.replaced) return a.replaced > b.replaced;
    return a.replaced_ns != b.replaced_ns ? a.replaced_ns > b.replaced_ns : a.record > b.record;
  });
  return revisions;
}

bool PMSKeepAsRevision(const DataSnapshot& s, const std::string& from) {
  return PMSMarkReplaced(s) && PMSRenameDurably(from, s.Named(kPMSKeptSuffix));
}

bool PMSMarkReplaced(const DataSnapshot& s) {
  if (!s.IsValid()) {
    errno = EINVAL;
    return false;
  }
  const std::string member =
      PackageRegistry::RecordsDir() + "/" + s.record() + "/" + kPMSReplacedMember;
  // Nanoseconds tell apart two versions replaced within one second: the
  // most recent is the one a rollback goes back to.
  struct timespec now;
  clock_gettime(CLOCK_REALTIME, &now);
  char text[48];
  snprintf(text, sizeof(text), "%lld.%09ld\n", static_cast<long long>(now.tv_sec), now.tv_nsec);
  if (!KIVOWriteFileAtomic(member, text)) {
    if (errno == 0) errno = EIO;
    return false;
  }
  return true;
}

bool PMSDropRevision(const PMSRevision& r) {
  const DataSnapshot s = r.snapshot();
  const std::string gone = s.Named(".discard");
  // Not synced: a crash that loses the rename loses the removals that
  // follow it on the same volume too, and the clean-up removes whatever of
  // the revision is left without the rest (upgrade_recovery.h).
  if (!s.IsValid() ||
      (!PMSRenameCopy(r.copy(), gone, PMSRenameSync::kWithTheVolume) && errno != ENOENT))
    return false;
  bool ok = PMSRemoveTree(s.folder(), gone);
  ok &= PMSRemoveTree(PMSVolumeFolderHolding(r.payload, "@appstore"), r.payload);
  ok &=
      PMSRemoveTree(PackageRegistry::RecordsDir(), PackageRegistry::RecordsDir() + "/" + r.record);
  rmdir(s.folder().c_str());  // only when nothing stays in it
  rmdir(PMSSnapshotsDir(r.appdata).c_str());
  return ok;
}

bool PMSTrimRevisions(const std::string& id, int keep) {
  const std::vector<PMSRevision> revisions = PMSListRevisions(id);
  bool ok = true;
  for (size_t i = static_cast<size_t>(std::max(keep, 0)); i < revisions.size(); ++i) {
    ok &= PMSDropRevision(revisions[i]);
  }
  return ok;
}

uint64_t PMSRevisionBytes(const PMSRevision& r) {
  std::set<std::pair<dev_t, ino_t>> seen;
  return FolderBytes(r.copy(), &seen) + FolderBytes(r.payload, &seen);
}

std::string PMSReplacedText(time_t when) {
  char text[32];
  struct tm tm;
  gmtime_r(&when, &tm);
  strftime(text, sizeof(text), "%Y-%m-%d %H:%M:%S UTC", &tm);
  return text;
}
