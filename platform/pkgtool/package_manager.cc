#include "pkgtool/package_manager.h"

#include <algorithm>
#include <climits>
#include <cstdlib>
#include <fcntl.h>
#include <functional>
#include <sys/stat.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/sysroot.h"
#include "pkgtool/lifecycle.h"
#include "pkgtool/package_state.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "storage/service_state.h"

namespace {

constexpr off_t kLogReadLimit = 1 << 20;

std::string RealPath(const std::string& path) {
  char buf[PATH_MAX];
  return realpath(path.c_str(), buf) ? buf : "";
}

// True when the existing file `path` resolves to a place inside `base`, so a
// symlink in a package's data folder cannot expose files outside it.
bool ResolvesInside(const std::string& path, const std::string& base) {
  std::string real_path = RealPath(path);
  std::string real_base = RealPath(base);
  return !real_path.empty() && !real_base.empty() &&
         real_path.compare(0, real_base.size() + 1, real_base + "/") == 0;
}

std::string Join(const std::vector<std::string>& items, const char* sep) {
  std::string out;
  for (const std::string& item : items) out += (out.empty() ? "" : sep) + item;
  return out;
}

}  // namespace

PackageManager::~PackageManager() { UnLock(); }

bool PackageManager::init() {
  std::string dir = PackageRegistry::Dir();
  struct stat st;
  bool ok = (stat(dir.c_str(), &st) == 0 || KIVOFSMkdirP(dir.c_str()) == 0) &&
            stat(dir.c_str(), &st) == 0 && S_ISDIR(st.st_mode) &&
            access(dir.c_str(), R_OK | X_OK) == 0;
  result_ = ok ? PKG_OK : PKG_ERR_REGISTRY;
  return ok;
}

int PackageManager::getResult(Json::Value& services) const {
  services = services_;
  return result_;
}

std::vector<std::string> PackageManager::enumPackages(const std::string&, uint64_t) {
  result_ = PKG_OK;
  return PackageRegistry::List();
}

bool PackageManager::enumPackageInfoMap(std::map<std::string, PackageInfo>& out,
                                        const std::string& language, uint64_t mask) {
  out.clear();
  for (const std::string& id : PackageRegistry::List()) {
    PackageInfo info;
    if (PMSLoadInstalled(id, &info)) {
      info.setLanguage(language);
      out[id] = info;
    }
  }
  result_ = PKG_OK;
  return true;
}

bool PackageManager::getPackageInfo(const std::string& id, PackageInfo& info,
                                    const std::string& language, uint64_t mask) {
  if (!PMSIsValidPackageId(id)) {
    result_ = PKG_ERR_NOT_INSTALLED;
    return false;
  }
  if (!PMSLoadInstalled(id, &info)) {
    result_ = PKG_ERR_NOT_INSTALLED;
    return false;
  }
  info.setLanguage(language);
  // A package whose installed files are gone still has its record: readers
  // show it, and getServiceStatus reports it broken.
  result_ = PKG_OK;
  return true;
}

bool PackageManager::readUIFile(int op, const PackageInfo& package, PackageInfo& out,
                                const std::string& language) {
  std::string id = package.getId();
  if (!PMSIsValidPackageId(id)) return false;
  std::string base = PackageRegistry::RecordDir(id) + "/" + PMSWizardMember(op);
  std::string text;
  if (!KIVOReadFile(base + "_" + language, &text, 1 << 20) && !KIVOReadFile(base, &text, 1 << 20)) {
    return false;
  }
  Json::Value ui;
  if (!KIVOParseJson(text, &ui)) return false;
  out = package;
  out.setUIFile(ui);
  return true;
}

bool PackageManager::getServiceStatus(const PackageInfo& info, bool& running, bool checkBroken) {
  running = false;
  std::string id = info.getId();
  if (!PackageRegistry::IsInstalled(id)) {
    result_ = PKG_ERR_NOT_INSTALLED;
    return false;
  }
  struct stat st;
  if (checkBroken && stat((PackageRegistry::RecordDir(id) + "/target").c_str(), &st) != 0) {
    result_ = PKG_ERR_BROKEN;
    return false;
  }
  running = PMSIsRunning(id, info);
  result_ = PKG_OK;
  return true;
}

unsigned PackageManager::getPkgRoughStatus(const std::string& id) {
  PackageInfo info;
  if (!PMSLoadInstalled(id, &info)) return 0;
  unsigned flags = kRoughInstalled;
  if (PMSIsRunning(id, info)) flags |= kRoughRunning;
  if (info.getTarget().empty()) flags |= kRoughBroken;
  return flags;
}

std::string PackageManager::getPackageLog(const std::string& id, bool evenIfMissing) {
  KeyValueMap info;
  if (!PackageRegistry::IsInstalled(id) || !PackageRegistry::ReadInfo(id, &info)) {
    result_ = PKG_ERR_NOT_INSTALLED;
    return "";
  }
  result_ = PKG_OK;
  const std::string& rel = info["logfile"];
  if (!PMSIsContainedRelativePath(rel)) return "";
  std::string base = PackageRegistry::RecordDir(id) + "/var";
  std::string path = base + "/" + rel;
  if (access(path.c_str(), F_OK) != 0) return evenIfMissing ? path : "";
  return ResolvesInside(path, base) ? path : "";
}

Json::Value PackageManager::getJsonParam(const std::string& key) const {
  return key == "worker_msg" ? worker_messages_ : Json::Value();
}

std::string PackageManager::getMapParam(const std::string& key) const {
  auto it = map_params_.find(key);
  return it == map_params_.end() ? "" : it->second;
}

void PackageManager::parseService(const std::string& services, Json::Value& out) const {
  out = Json::Value(Json::arrayValue);
  for (const std::string& name : PMSServiceSet(services)) out.append(name);
}

bool PackageManager::getDependencyOrder(std::vector<std::string>& order) {
  // Depth-first over dependencies gives an order where each package comes
  // after what it needs; reversed, dependents come first.
  std::vector<std::string> ids = PackageRegistry::List();
  std::set<std::string> done, visiting;
  std::vector<std::string> topo;
  std::function<void(const std::string&)> visit = [&](const std::string& id) {
    if (done.count(id) || visiting.count(id)) return;  // a cycle is cut, not followed
    visiting.insert(id);
    KeyValueMap kv;
    if (PackageRegistry::ReadInfo(id, &kv)) {
      for (const PackageBasicInfo& dep : PackageInfo(kv).getDependencies()) {
        if (PackageRegistry::IsInstalled(dep.getName())) visit(dep.getName());
      }
    }
    visiting.erase(id);
    done.insert(id);
    topo.push_back(id);
  };
  for (const std::string& id : ids) visit(id);
  order.assign(topo.rbegin(), topo.rend());
  result_ = PKG_OK;
  return true;
}

bool PackageManager::arePackagesInstallAndStart(const DepPkgVector& deps, Json::Value& notInstalled,
                                                std::string& notStarted, const char*) {
  notInstalled = Json::Value(Json::arrayValue);
  std::vector<std::string> stopped;
  for (const PackageBasicInfo& dep : deps) {
    PackageInfo info;
    if (!PMSLoadInstalled(dep.getName(), &info) || !dep.accepts(info.getVersion())) {
      notInstalled.append(dep.toString());
      if (PackageRegistry::IsInstalled(dep.getName())) {
        map_params_["curver"] = info.getVersion();
        map_params_["oldver"] = dep.toString();
        result_ = PKG_ERR_VERSION_LIMIT;
      }
      continue;
    }
    // A package without a service (a library) is ready once installed.
    if (info.isStartable() && !PMSIsRunning(dep.getName(), info)) stopped.push_back(dep.getName());
  }
  notStarted = Join(stopped, ", ");
  return notInstalled.empty() && stopped.empty();
}

bool PackageManager::areDependentPackageStop(const std::string& id, const char*,
                                             std::string& running) {
  std::vector<std::string> names;
  for (const std::string& other : PMSInstalledDependents(id)) {
    PackageInfo info;
    if (PMSLoadInstalled(other, &info) && PMSIsRunning(other, info)) names.push_back(other);
  }
  running = Join(names, ", ");
  return names.empty();
}

bool PackageManager::arePackagesConflict(const PackageBasicInfo& package,
                                         const DepPkgVector& conflicts, std::string& message,
                                         const char*) {
  std::vector<std::string> found;
  for (const PackageBasicInfo& c : conflicts) {
    KeyValueMap kv;
    if (c.getName() != package.getName() && PackageRegistry::ReadInfo(c.getName(), &kv) &&
        c.accepts(kv["version"])) {
      found.push_back(c.getName());
    }
  }
  // A conflict declared by an installed package counts the same way.
  for (const std::string& other : PackageRegistry::List()) {
    KeyValueMap kv;
    if (other == package.getName() || !PackageRegistry::ReadInfo(other, &kv)) continue;
    for (const PackageBasicInfo& c : PackageInfo(kv).getConflicts()) {
      if (c.getName() == package.getName() && c.accepts(package.getVersion()) &&
          std::find(found.begin(), found.end(), other) == found.end()) {
        found.push_back(other);
      }
    }
  }
  message = Join(found, ", ");
  return !found.empty();
}

int PackageManager::getDepPkgListStop(std::string id, const char* language, Json::Value& list) {
  list = Json::Value(Json::arrayValue);
  for (const std::string& other : PMSInstalledDependents(id)) {
    PackageInfo info;
    if (!PMSLoadInstalled(other, &info) || !PMSIsRunning(other, info)) continue;
    Json::Value entry(Json::objectValue);
    entry["id"] = other;
    entry["name"] = info.getDisplayName(language ? language : "");
    list.append(entry);
  }
  return 0;
}

std::set<std::string> PackageManager::getServiceSetFromString(const char* services) const {
  return PMSServiceSet(services ? services : "");
}

std::set<std::string> PackageManager::checkServiceStarted(
    const std::set<std::string>& services) const {
  std::set<std::string> stopped;
  for (const std::string& s : services) {
    if (!KIVOServiceRunning(s)) stopped.insert(s);
  }
  return stopped;
}

unsigned PackageManager::checkServiceStarted(unsigned mask) const {
  unsigned stopped = 0;
  const std::vector<std::string>& known = PMSKnownServices();
  for (size_t bit = 0; bit < known.size(); ++bit) {
    if ((mask & (1u << bit)) && !KIVOServiceRunning(known[bit])) stopped |= 1u << bit;
  }
  return stopped;
}

unsigned PackageManager::PMSExplodeServiceString(const char* services) {
  return PMSServiceMask(services ? services : "");
}

bool PackageManager::ExLock(int seconds) {
  if (lock_fd_ >= 0) return true;
  lock_fd_ = PMSLockFile(KIVORootPath("/run/kivo/pkgtool/lock"), seconds);
  return lock_fd_ >= 0;
}

void PackageManager::UnLock() {
  PMSUnlockFile(lock_fd_);
  lock_fd_ = -1;
}

void PackageManager::setOutcome(int result, const std::string& log_path, const Json::Value& workers,
                                const std::map<std::string, std::string>& params,
                                const Json::Value& services) {
  result_ = result;
  log_path_ = log_path;
  worker_messages_ = workers.isArray() ? workers : Json::Value(Json::arrayValue);
  map_params_ = params;
  services_ = services;
}

std::string PMSReadPackageLog(const std::string& path) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return "";
  struct stat st;
  std::string text;
  if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode)) {
    off_t start = st.st_size > kLogReadLimit ? st.st_size - kLogReadLimit : 0;
    text.resize(static_cast<size_t>(st.st_size - start));
    ssize_t n = pread(fd, &text[0], text.size(), start);
    text.resize(n > 0 ? static_cast<size_t>(n) : 0);
  }
  close(fd);
  return text;
}

namespace {

// The last `count` lines of `text`, without its final newline.
std::string LastLines(std::string text, int count) {
  while (!text.empty() && text.back() == '\n') text.pop_back();
  size_t start = text.size();
  for (int i = 0; i < count; ++i) {
    size_t newline = start == 0 ? std::string::npos : text.rfind('\n', start - 1);
    if (newline == std::string::npos) return text;
    start = newline;
  }
  return text.substr(start + 1);
}

}  // namespace

std::string PMSPackageLogTail(const std::string& id, int lines) {
  PackageManager pm;
  const std::string path = pm.getPackageLog(id);
  std::string tail = LastLines(path.empty() ? "" : PMSReadPackageLog(path), lines);
  if (tail.size() > 4096) tail.erase(0, tail.size() - 4096);
  return tail;
}
