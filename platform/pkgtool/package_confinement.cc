#include "pkgtool/package_confinement.h"

#include <cerrno>
#include <cstdint>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <syslog.h>
#include <unistd.h>
#include <utility>
#include <vector>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"
#include "pkgtool/lifecycle.h"
#include "pkgtool/package_account.h"
#include "pkgtool/package_cgroup.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "pkgtool/root_request.h"
#include "storage/volumes.h"

#include <linux/landlock.h>

// Landlock rights and scopes newer than the oldest kernel headers we build
// with; the kernel's ABI version says which it knows.
#ifndef LANDLOCK_ACCESS_FS_TRUNCATE
#define LANDLOCK_ACCESS_FS_TRUNCATE (1ULL << 14)
#endif
#ifndef LANDLOCK_ACCESS_FS_IOCTL_DEV
#define LANDLOCK_ACCESS_FS_IOCTL_DEV (1ULL << 15)
#endif
#ifndef LANDLOCK_SCOPE_ABSTRACT_UNIX_SOCKET
#define LANDLOCK_SCOPE_ABSTRACT_UNIX_SOCKET (1ULL << 0)
#endif
#ifndef LANDLOCK_SCOPE_SIGNAL
#define LANDLOCK_SCOPE_SIGNAL (1ULL << 1)
#endif

namespace {

// The ruleset attribute as ABI 6 knows it; older kernels are given only its
// first member (ABI 1 to 3) or first two (ABI 4 and 5).
struct RulesetAttr {
  uint64_t handled_access_fs;
  uint64_t handled_access_net;
  uint64_t scoped;
};

constexpr uint64_t kRead = LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_READ_DIR;
constexpr uint64_t kReadExec = kRead | LANDLOCK_ACCESS_FS_EXECUTE;
constexpr uint64_t kReadWriteFile =
    LANDLOCK_ACCESS_FS_READ_FILE | LANDLOCK_ACCESS_FS_WRITE_FILE | LANDLOCK_ACCESS_FS_TRUNCATE;
constexpr uint64_t kDevice = kReadWriteFile | LANDLOCK_ACCESS_FS_IOCTL_DEV;
// The rights Landlock accepts on a rule for a file rather than a folder.
constexpr uint64_t kFileRights =
    LANDLOCK_ACCESS_FS_EXECUTE | kReadWriteFile | LANDLOCK_ACCESS_FS_IOCTL_DEV;
// Everything in its own folders but device nodes (which it could not make
// as its own user anyway).
constexpr uint64_t kOwnFolder = ~(LANDLOCK_ACCESS_FS_MAKE_CHAR | LANDLOCK_ACCESS_FS_MAKE_BLOCK);

// The machine's folders of programs and libraries, read and executed.
const char* const kSystemFolders[] = {"/usr",   "/bin",   "/sbin",  "/lib",
                                      "/lib32", "/lib64", "/libx32"};
// What programs read of /etc to start and resolve names; never the
// accounts files, whose names a package has no need of.
const char* const kSystemEtc[] = {
    "/etc/ld.so.cache", "/etc/ld.so.conf",      "/etc/ld.so.conf.d", "/etc/nsswitch.conf",
    "/etc/localtime",   "/etc/timezone",        "/etc/hosts",        "/etc/host.conf",
    "/etc/resolv.conf", "/etc/gai.conf",        "/etc/services",     "/etc/protocols",
    "/etc/ssl",         "/etc/ca-certificates", "/etc/alternatives", "/etc/mime.types",
    "/etc/os-release",  "/etc/locale.alias"};
const char* const kDevices[] = {"/dev/null", "/dev/zero", "/dev/full"};
const char* const kRandomDevices[] = {"/dev/random", "/dev/urandom"};
// The system root's own folders: never reached through a system folder
// (on an appliance the root is "/", and its /usr holds /usr/kivo).
const char* const kRootPrivate[] = {"/etc", "/var", "/run", "/tmp", "/usr/kivo"};

int LandlockAbi(std::string* why) {
  long abi = syscall(SYS_landlock_create_ruleset, nullptr, 0, LANDLOCK_CREATE_RULESET_VERSION);
  if (abi < 0) {
    *why = errno == ENOSYS       ? "the kernel has no Landlock"
           : errno == EOPNOTSUPP ? "Landlock is turned off in this kernel"
                                 : std::string("Landlock cannot be used: ") + strerror(errno);
    return 0;
  }
  return static_cast<int>(abi);
}

uint64_t HandledRights(int abi) {
  uint64_t rights = (LANDLOCK_ACCESS_FS_MAKE_SYM << 1) - 1;  // ABI 1: bits 0 to 12
  if (abi >= 2) rights |= LANDLOCK_ACCESS_FS_REFER;
  if (abi >= 3) rights |= LANDLOCK_ACCESS_FS_TRUNCATE;
  if (abi >= 5) rights |= LANDLOCK_ACCESS_FS_IOCTL_DEV;
  return rights;
}

// A Landlock ruleset in the making.
class Ruleset {
 public:
  Ruleset(int abi, bool scope_signals) : handled_(HandledRights(abi)) {
    RulesetAttr attr = {handled_, 0, 0};
    size_t size = sizeof(attr.handled_access_fs);
    if (abi >= 6) {
      attr.scoped =
          LANDLOCK_SCOPE_ABSTRACT_UNIX_SOCKET | (scope_signals ? LANDLOCK_SCOPE_SIGNAL : 0);
      size = sizeof(attr);
    }
    fd_ = static_cast<int>(syscall(SYS_landlock_create_ruleset, &attr, size, 0));
    if (fd_ < 0) problem_ = std::string("cannot make a Landlock ruleset: ") + strerror(errno);
  }
  ~Ruleset() {
    if (fd_ >= 0) close(fd_);
  }
  Ruleset(const Ruleset&) = delete;
  Ruleset& operator=(const Ruleset&) = delete;

  // Allows `rights` beneath `path`; a path that does not exist is left out.
  void Allow(const std::string& path, uint64_t rights) {
    if (fd_ < 0) return;
    int target = open(path.c_str(), O_PATH | O_CLOEXEC);
    if (target < 0) {
      if (errno != ENOENT) Fail("cannot open " + path);
      return;
    }
    struct stat st;
    if (fstat(target, &st) == 0) {
      if (!S_ISDIR(st.st_mode)) rights &= kFileRights;
      struct landlock_path_beneath_attr beneath = {rights & handled_, target};
      if (syscall(SYS_landlock_add_rule, fd_, LANDLOCK_RULE_PATH_BENEATH, &beneath, 0) != 0)
        Fail("cannot allow " + path);
    }
    close(target);
  }

  // Allows `rights` beneath system folder `path`, but never into any of
  // `private_paths`: a folder that holds one is allowed entry by entry.
  void AllowAround(const std::string& path, uint64_t rights,
                   const std::vector<std::string>& private_paths) {
    bool holds_private = false;
    for (const std::string& p : private_paths) {
      if (p == path || PMSIsStrictlyInside(path, p)) return;
      holds_private |= PMSIsStrictlyInside(p, path);
    }
    if (!holds_private) return Allow(path, rights);
    char real[PATH_MAX];
    if (!realpath(path.c_str(), real) || path != real) return;  // a link: named by its target
    for (const std::string& name : PMSListDir(path))
      AllowAround(path + "/" + name, rights, private_paths);
  }

  // The ruleset, handed over; -1 with problem() when it could not be made.
  int Release() {
    if (!problem_.empty()) return -1;
    int fd = fd_;
    fd_ = -1;
    return fd;
  }
  const std::string& problem() const { return problem_; }

 private:
  void Fail(const std::string& what) {
    if (problem_.empty()) problem_ = what + ": " + strerror(errno);
  }

  uint64_t handled_;
  int fd_ = -1;
  std::string problem_;
};

void Missing(Json::Value* report, const std::string& what, const std::string& reason) {
  Json::Value item;
  item["what"] = what;
  item["reason"] = reason;
  (*report)["missing"].append(item);
}

// "<record>" of "<record>/scripts/<name>"; "" for any other path.
std::string RecordOfScript(const std::string& script) {
  const size_t at = script.rfind("/scripts/");
  if (at == std::string::npos || script.find('/', at + 9) != std::string::npos) return "";
  return script.substr(0, at);
}

std::string RealPath(const std::string& path) {
  char real[PATH_MAX];
  return realpath(path.c_str(), real) ? real : "";
}

// The package's own folders, resolved, each checked against the folder
// that must hold it; "" for one that is missing or anywhere else.
struct OwnFolders {
  std::string record, payload, data;
};
OwnFolders FoldersOf(const std::string& record) {
  OwnFolders f;
  f.record = RealPath(record);
  if (!PMSIsStrictlyInside(f.record, RealPath(PackageRegistry::RecordsDir()))) f.record.clear();
  f.payload = RealPath(record + "/target");
  if (PMSVolumeFolderHolding(f.payload, "@appstore").empty()) f.payload.clear();
  f.data = RealPath(record + "/var");
  if (PMSVolumeFolderHolding(f.data, "@appdata").empty()) f.data.clear();
  return f;
}

std::string TmpBase() { return KIVORootPath("/tmp/kivo-package"); }

// Makes the package's temporary folder, owned by its account when it has
// one: "" when it cannot.
std::string PrepareTmp(const std::string& id, const PackageAccount* account) {
  const std::string base = TmpBase(), dir = base + "/" + id;
  if (KIVOFSMkdirP(base.c_str(), 0711) != 0 || chmod(base.c_str(), 0711) != 0) return "";
  if (mkdir(dir.c_str(), 0700) != 0 && errno != EEXIST) return "";
  struct stat st;
  if (lstat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) return "";
  if (account && (st.st_uid != account->uid || st.st_gid != account->gid) &&
      lchown(dir.c_str(), account->uid, account->gid) != 0) {
    return "";
  }
  PMSMakeReachable(dir + "/x");
  return dir;
}

// This operation's file `var` of `env` (its worker messages, its wizard
// answers), when it is one of the operation files of var/log/packages:
// given to the account and allowed with `rights`.
void AllowOperationFile(const std::map<std::string, std::string>& env, const char* var,
                        uint64_t rights, const PackageAccount* account, Ruleset* rules) {
  auto it = env.find(var);
  if (it == env.end() || !PMSIsStrictlyInside(it->second, KIVORootPath("/var/log/packages")))
    return;
  const bool writes = rights & LANDLOCK_ACCESS_FS_WRITE_FILE;
  int fd = open(it->second.c_str(),
                (writes ? O_WRONLY | O_CREAT : O_RDONLY) | O_NOFOLLOW | O_CLOEXEC, 0600);
  if (fd < 0) return;
  if (account) static_cast<void>(fchown(fd, account->uid, account->gid));
  close(fd);
  rules->Allow(it->second, rights);
}

std::vector<std::string> RootPrivatePaths() {
  std::vector<std::string> paths;
  for (const char* p : kRootPrivate) paths.push_back(KIVORootPath(p));
  for (const VolumeConfig& v : KIVOVolumesLoad()) paths.push_back(KIVORootPath(v.path));
  return paths;
}

// Builds the Landlock ruleset into `c`; the report says what it covers.
void PrepareLandlock(const OwnFolders& own, bool scope_signals,
                     const std::map<std::string, std::string>& env, const PackageAccount* account,
                     PackageConfinement* c, Json::Value* report) {
  std::string why;
  const int abi = LandlockAbi(&why);
  (*report)["landlock_abi"] = abi;
  if (abi < 1) {
    Missing(report, "landlock_filesystem", why);
    Missing(report, "landlock_scope_signal", why);
    Missing(report, "landlock_scope_abstract_unix_socket", why);
    return;
  }
  Ruleset rules(abi, scope_signals);
  const std::vector<std::string> private_paths = RootPrivatePaths();
  for (const char* folder : kSystemFolders) rules.AllowAround(folder, kReadExec, private_paths);
  for (const char* file : kSystemEtc) rules.Allow(file, kRead);
  for (const char* device : kDevices) rules.Allow(device, kDevice);
  for (const char* device : kRandomDevices) rules.Allow(device, LANDLOCK_ACCESS_FS_READ_FILE);
  rules.Allow(own.record, kReadExec);
  rules.Allow(own.payload, kReadExec);
  rules.Allow(own.data, kOwnFolder);
  if (!c->tmpdir.empty()) rules.Allow(c->tmpdir, kOwnFolder);
  AllowOperationFile(env, "KIVO_WORKER_MSG", kReadWriteFile, account, &rules);
  AllowOperationFile(env, "KIVO_WIZARD_VALUES", LANDLOCK_ACCESS_FS_READ_FILE, account, &rules);
  c->landlock_ruleset = rules.Release();
  if (c->landlock_ruleset < 0) {
    Missing(report, "landlock_filesystem", rules.problem());
    return;
  }
  (*report)["applied"].append("landlock_filesystem");
  if (abi >= 6) {
    (*report)["applied"].append("landlock_scope_signal");
    (*report)["applied"].append("landlock_scope_abstract_unix_socket");
  } else {
    const std::string reason =
        "the kernel's Landlock (ABI " + std::to_string(abi) + ") has no scoping (ABI 6)";
    Missing(report, "landlock_scope_signal", reason);
    Missing(report, "landlock_scope_abstract_unix_socket", reason);
  }
}

// The report of a package that runs as root, unconfined, for `reason`.
void Unconfined(const std::string& reason, const char* state, Json::Value* report) {
  (*report)["state"] = state;
  (*report)["user"] = "root";
  (*report)["uid"] = 0;
  (*report)["gid"] = 0;
  (*report)["root"] = true;
  for (const char* what : {"user", "no_new_privs", "landlock_filesystem", "landlock_scope_signal",
                           "landlock_scope_abstract_unix_socket"}) {
    Missing(report, what, reason);
  }
}

// Names in the report each control group that is missing: `text` has
// lines "<controller>: <reason>" (package_cgroup.h), or "control group:
// <reason>" for what concerns them all.
void AddGroupsMissing(const std::string& text, Json::Value* report) {
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find('\n', start);
    if (end == std::string::npos) end = text.size();
    const std::string line = text.substr(start, end - start);
    start = end + 1;
    const size_t colon = line.find(": ");
    if (colon == std::string::npos) continue;
    const std::string controller = line.substr(0, colon);
    const bool one = controller == "memory" || controller == "pids" || controller == "cpu";
    Missing(report, one ? "cgroup_" + controller : "cgroup", line.substr(colon + 2));
  }
}

// The state of a confined package's report (package_confinement.h).
const char* ConfinedState(const Json::Value& report, bool has_account) {
  if (!has_account) return "no_account";
  return report["missing"].empty() ? "confined" : "partly";
}

// Writes the report into the record when it changed; logs it to `note_fd`
// (and the system log) when it changed or something is missing.
void Publish(const std::string& record, const std::string& id, const Json::Value& report,
             int note_fd) {
  const std::string path = record + "/" + kPMSConfinementFile;
  const std::string text = KIVOWriteJson(report, "\t") + "\n";
  std::string old;
  const bool changed = !KIVOReadFile(path, &old, 1 << 16) || old != text;
  // The record is what others read; a run whose record cannot be written
  // still runs as prepared, and the log below says how.
  if (changed) static_cast<void>(KIVOWriteFileAtomic(path, text, SyncToDisk::No, 0644));
  if (!changed && report["missing"].empty()) return;
  std::string line = "confinement of " + id + ": runs as " + report["user"].asString() + " (uid " +
                     std::to_string(report["uid"].asInt()) + ")";
  std::string applied, missing;
  for (const Json::Value& a : report["applied"])
    applied += (applied.empty() ? "" : ", ") + a.asString();
  for (const Json::Value& m : report["missing"]) {
    missing +=
        (missing.empty() ? "" : "; ") + m["what"].asString() + " (" + m["reason"].asString() + ")";
  }
  line += "; applied: " + (applied.empty() ? std::string("nothing") : applied);
  if (!missing.empty()) line += "; not applied: " + missing;
  if (changed) syslog(LOG_NOTICE, "pkgtool: %s", line.c_str());
  if (note_fd >= 0) {
    line += "\n";
    static_cast<void>(write(note_fd, line.data(), line.size()));
  }
}

bool ConfinementTurnedOff() {
  KeyValueMap conf;
  return KIVOKeyValueLoad(KIVORootPath("/etc/kivo/pkgtool.conf"), &conf) &&
         conf["package_confinement"] == "off";
}

// A script about to run as root may leave files of root's in the data
// folder: the next start must walk it again (DataOwnership::kUnlessSettled).
void ForgetDataOwner(const std::string& record) {
  const std::string marker = record + "/" + kPMSDataOwnerFile;
  if (unlink(marker.c_str()) != 0 && errno != ENOENT)
    syslog(LOG_WARNING, "pkgtool: cannot remove %s: %m", marker.c_str());
}

}  // namespace

PackageConfinement::~PackageConfinement() {
  if (landlock_ruleset >= 0) close(landlock_ruleset);
}

PackageConfinement::PackageConfinement(PackageConfinement&& other) noexcept {
  *this = std::move(other);
}

PackageConfinement& PackageConfinement::operator=(PackageConfinement&& other) noexcept {
  if (this == &other) return *this;
  if (landlock_ruleset >= 0) close(landlock_ruleset);
  drop_user = other.drop_user;
  uid = other.uid;
  gid = other.gid;
  no_new_privs = other.no_new_privs;
  landlock_ruleset = std::exchange(other.landlock_ruleset, -1);
  tmpdir = std::move(other.tmpdir);
  report_ = std::move(other.report_);
  return *this;
}

PackageConfinement PackageConfinementPrepareForScript(const std::string& script,
                                                      const std::string& arg,
                                                      const std::map<std::string, std::string>& env,
                                                      const std::string& groups_missing,
                                                      int note_fd) {
  PackageConfinement c;
  Json::Value& report = c.report_;
  report["applied"] = Json::Value(Json::arrayValue);
  report["missing"] = Json::Value(Json::arrayValue);
  const std::string record = RecordOfScript(script);
  KeyValueMap info;
  if (record.empty() || !KIVOKeyValueLoad(record + "/INFO", &info) ||
      !PMSIsValidPackageId(info["package"])) {
    Unconfined("not a script of an installed package", "partly", &report);
    return c;
  }
  const std::string id = info["package"];
  const bool asks_for_root = PMSAsksForRoot(PackageInfo(info));
  if (asks_for_root || ConfinementTurnedOff()) {
    ForgetDataOwner(record);
    Unconfined(asks_for_root ? "the package declares run_as_root"
                             : "package_confinement is off in etc/kivo/pkgtool.conf",
               asks_for_root ? "root" : "turned_off", &report);
    AddGroupsMissing(groups_missing, &report);
    Publish(record, id, report, note_fd);
    return c;
  }
  PackageAccount account;
  const bool has_account = PMSFindPackageAccount(id, &account);
  const bool as_root = geteuid() == 0;
  c.drop_user = has_account && as_root;
  if (c.drop_user) {
    c.uid = account.uid;
    c.gid = account.gid;
    report["applied"].append("user");
  } else {
    Missing(&report, "user",
            !has_account ? "the package has no account yet: it gets one at its next start or "
                           "upgrade, or with kivoctl confine " +
                               id
                         : "the package tool does not run as root");
  }
  const struct passwd* self = c.drop_user ? nullptr : getpwuid(geteuid());
  report["user"] = c.drop_user ? account.name : self ? self->pw_name : "root";
  report["uid"] = static_cast<Json::UInt>(c.drop_user ? c.uid : geteuid());
  report["gid"] = static_cast<Json::UInt>(c.drop_user ? c.gid : getegid());
  report["root"] = !c.drop_user && as_root;
  if (!c.drop_user && as_root) ForgetDataOwner(record);
  c.no_new_privs = true;
  report["applied"].append("no_new_privs");
  const PackageAccount* owner = c.drop_user ? &account : nullptr;
  c.tmpdir = PrepareTmp(id, owner);
  if (c.tmpdir.empty()) Missing(&report, "temp_folder", "cannot make " + TmpBase() + "/" + id);
  const bool controls_service = script.size() >= 18 &&
                                script.compare(script.size() - 18, 18, "/start-stop-status") == 0 &&
                                (arg == "stop" || arg == "status");
  PrepareLandlock(FoldersOf(record), !controls_service, env, owner, &c, &report);
  AddGroupsMissing(groups_missing, &report);
  report["state"] = ConfinedState(report, has_account);
  Publish(record, id, report, note_fd);
  return c;
}

namespace {

std::string DataOwnerText(const PackageAccount& account) {
  return std::to_string(account.uid) + ":" + std::to_string(account.gid) + "\n";
}

// Gives `data` to `account`: every entry, or, when `ownership` allows and a
// full pass for the same account was recorded in `record`, the folder
// alone; and lets everyone search the folder (PMSMakeReachable). A full
// pass that succeeds is recorded. Changes nothing unless `may_change`
// allows it.
bool GiveData(const std::string& record, const std::string& data, const PackageAccount& account,
              bool account_is_new, DataOwnership ownership, const DataChangeGate& may_change,
              std::string* error) {
  const std::string marker = record + "/" + kPMSDataOwnerFile;
  std::string recorded;
  // A new account may have the uid an earlier one had: what that one owned
  // then proves nothing now.
  const bool settled = ownership == DataOwnership::kUnlessSettled && !account_is_new &&
                       KIVOReadFile(marker, &recorded, 64) && recorded == DataOwnerText(account);
  struct stat st;
  if (lstat(data.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    *error = "cannot read the data folder " + data;
    return false;
  }
  // Asked only before a change: the gate may wait.
  const auto allowed = [&may_change] { return !may_change || may_change(); };
  if (!settled) {
    if (!PMSChownTree(data, account.uid, account.gid, error, may_change)) return false;
    // Without the marker the next start only does the full pass again.
    static_cast<void>(KIVOWriteFileAtomic(marker, DataOwnerText(account), SyncToDisk::No));
  } else if (st.st_uid != account.uid || st.st_gid != account.gid) {
    if (!allowed()) return (*error = "the owner of " + data + " may not be changed now"), false;
    if (lchown(data.c_str(), account.uid, account.gid) != 0) {
      *error = "cannot change the owner of " + data + ": " + strerror(errno);
      return false;
    }
  }
  if (!(st.st_mode & S_IXOTH) && allowed())
    static_cast<void>(chmod(data.c_str(), (st.st_mode & 07777) | S_IXOTH));
  return true;
}

}  // namespace

int PMSSettlePackageAccount(const std::string& id, const std::string& record,
                            const std::string& log_path, DataOwnership ownership,
                            std::string* error, const DataChangeGate& may_change) {
  PackageAccount account;
  bool account_is_new = false;
  int code = PMSEnsurePackageAccount(id, &account, error, &account_is_new);
  if (code != PKG_OK) return code;
  const OwnFolders own = FoldersOf(record);
  // Each path below names something inside the folder, so that the
  // folder itself is made reachable too.
  // The data folder itself is made searchable by GiveData, which may
  // change it.
  for (const std::string& inside : {own.record + "/scripts/x", own.payload + "/x", own.data}) {
    if (inside[0] == '/') PMSMakeReachable(inside);
  }
  if (!own.data.empty() &&
      !GiveData(record, own.data, account, account_is_new, ownership, may_change, error)) {
    return PKG_ERR_INTERNAL;
  }
  // Written now, so the record says who the package is from its install on.
  // What its control groups lack is known without making them (they are
  // made when a script first runs).
  const int log = log_path.empty() ? -1 : open(log_path.c_str(), O_WRONLY | O_APPEND | O_CLOEXEC);
  PackageConfinement prepared = PackageConfinementPrepareForScript(
      record + "/scripts/start-stop-status", "", {}, PackageCgroupPlannedMissing(id), log);
  if (log >= 0) close(log);
  return PKG_OK;
}

bool PMSRetirePackageAccount(const std::string& id, const std::string& data, std::string* error) {
  bool ok = true;
  struct stat st;
  if (!data.empty() && lstat(data.c_str(), &st) == 0 && S_ISDIR(st.st_mode)) {
    ok &= PMSChownTree(data, 0, 0, error);
  }
  if (PMSIsValidPackageId(id) && !PMSRemoveTree(TmpBase(), TmpBase() + "/" + id)) {
    *error = "cannot remove " + TmpBase() + "/" + id;
    ok = false;
  }
  std::string why;
  if (!PMSRemovePackageAccount(id, &why)) {
    *error = why;
    ok = false;
  }
  return ok;
}

bool PMSLoadConfinement(const std::string& id, Json::Value* record) {
  KIVOJsonParser parser;
  return PMSLoadConfinement(id, record, &parser);
}

bool PMSLoadConfinement(const std::string& id, Json::Value* record, KIVOJsonParser* parser) {
  if (!PMSIsValidPackageId(id)) return false;
  std::string text;
  return KIVOReadFile(PackageRegistry::RecordDir(id) + "/" + kPMSConfinementFile, &text, 1 << 16) &&
         parser->Parse(text, record) && record->isObject();
}
