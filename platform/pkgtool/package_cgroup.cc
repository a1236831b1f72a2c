#include "pkgtool/package_cgroup.h"

#include <algorithm>
#include <cerrno>
#include <cinttypes>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <map>
#include <set>
#include <sstream>
#include <sys/stat.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"
#include "pkgtool/registry.h"

#include <time.h>

namespace {

constexpr char kDefaultParent[] = "kivo-packages";
constexpr int kInfoLimitMax = 1048576;  // what INFO may say at all, whatever the appliance

// One controller's group of a package: which controller, whether it lives
// in the unified hierarchy, its folder and the bound the tool last set on it.
struct Group {
  std::string what;  // "memory", "pids" or "cpu"
  bool v2 = false;
  std::string dir;
  // Bytes of memory or a number of processes, as written to the group; 0
  // when none was (cpu, or a controller that refused it).
  uint64_t limit = 0;
};

// A mounted cgroup hierarchy as /proc/self/mountinfo shows it.
struct Hierarchy {
  bool v2 = false;
  std::string root;   // the hierarchy path the mount shows ("/" mostly)
  std::string point;  // where it is mounted
  std::string options;
};

KeyValueMap ToolConf() {
  KeyValueMap conf;
  // A missing settings file means every built-in value.
  static_cast<void>(KIVOKeyValueLoad(KIVORootPath("/etc/kivo/pkgtool.conf"), &conf));
  return conf;
}

// A whole number from 1 to `max` written as plain digits, else -1.
// Plain decimal digits, at most `digits` of them, into *value.
bool Digits(const std::string& text, size_t digits, uint64_t* value) {
  if (text.empty() || text.size() > digits ||
      text.find_first_not_of("0123456789") != std::string::npos)
    return false;
  *value = std::strtoull(text.c_str(), nullptr, 10);
  return true;
}

long WholeNumber(const std::string& text, long max) {
  uint64_t value = 0;
  if (!Digits(text, 9, &value)) return -1;
  return value >= 1 && value <= static_cast<uint64_t>(max) ? static_cast<long>(value) : -1;
}

int Setting(const KeyValueMap& conf, const char* key, int def) {
  auto it = conf.find(key);
  long value = it == conf.end() ? -1 : WholeNumber(it->second, kInfoLimitMax);
  return value > 0 ? static_cast<int>(value) : def;
}

// A folder name: 1 to 64 of [A-Za-z0-9._-], not starting with a dot.
bool IsGroupName(const std::string& name) {
  if (name.empty() || name.size() > 64 || name[0] == '.') return false;
  return name.find_first_not_of(
             "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789._-") ==
         std::string::npos;
}

std::string ParentName(const KeyValueMap& conf) {
  auto it = conf.find("cgroup_parent");
  return it != conf.end() && IsGroupName(it->second) ? it->second : kDefaultParent;
}

// "system" for the appliance's own root, else a name derived from the root's
// path (64-bit FNV-1a), the same for every caller of the same root.
std::string RootName(const std::string& root) {
  if (root.empty()) return "system";
  uint64_t hash = 1469598103934665603ULL;
  for (unsigned char c : root) hash = (hash ^ c) * 1099511628211ULL;
  char text[32];
  snprintf(text, sizeof(text), "root-%016" PRIx64, hash);
  return text;
}

// The words of `line`, split at spaces and tabs.
std::vector<std::string> Fields(const std::string& line) {
  std::vector<std::string> fields;
  size_t at = 0;
  while ((at = line.find_first_not_of(" \t", at)) != std::string::npos) {
    const size_t end = std::min(line.find_first_of(" \t", at), line.size());
    fields.push_back(line.substr(at, end - at));
    at = end;
  }
  return fields;
}

std::vector<Hierarchy> Hierarchies() {
  std::vector<Hierarchy> out;
  std::string text;
  if (!KIVOReadFile("/proc/self/mountinfo", &text, 1 << 20)) return out;
  std::istringstream in(text);
  std::string line;
  while (std::getline(in, line)) {
    std::vector<std::string> f = Fields(line);
    size_t dash = 0;
    while (dash < f.size() && f[dash] != "-") ++dash;
    if (dash < 5 || dash + 3 >= f.size()) continue;
    const std::string& type = f[dash + 1];
    if (type != "cgroup" && type != "cgroup2") continue;
    out.push_back({type == "cgroup2", f[3], f[4], "," + f[dash + 3] + ","});
  }
  return out;
}

// The tool's own group in the v1 hierarchy of `controller` ("" for the
// unified one), from /proc/self/cgroup.
std::string OwnGroup(const std::string& text, const std::string& controller) {
  std::istringstream in(text);
  std::string line;
  while (std::getline(in, line)) {
    size_t a = line.find(':'), b = line.find(':', a + 1);
    if (a == std::string::npos || b == std::string::npos) continue;
    const std::string names = "," + line.substr(a + 1, b - a - 1) + ",";
    if (controller.empty() ? names == ",,"
                           : names.find("," + controller + ",") != std::string::npos)
      return line.substr(b + 1);
  }
  return "/";
}

// Where the group `path` of hierarchy `h` is in the file system.
std::string FolderOf(const Hierarchy& h, const std::string& path) {
  std::string rel = path;
  if (h.root != "/" && rel.compare(0, h.root.size(), h.root) == 0) rel = rel.substr(h.root.size());
  if (rel == "/") rel.clear();
  return h.point + rel;
}

// What every step of one call reads once: the settings, the mounted
// hierarchies and the tool's own groups.
struct Env {
  std::string root;       // the system root ("" for "/")
  std::string tail_base;  // "/<cgroup_parent>/<root name>"
  bool off = false;       // package_cgroups="no"
  std::vector<Hierarchy> all;
  std::string own;  // /proc/self/cgroup
  // The unified hierarchy when it offers the memory controller to the
  // tool's group (a system on cgroup v2), else -1: an index into `all`,
  // found once per call rather than once per package.
  int unified_with_memory = -1;
};

int FindUnifiedWithMemory(const Env& env);

Env LoadEnv(const std::string& root = KIVOSysRoot()) {
  Env env;
  const KeyValueMap conf = ToolConf();
  env.root = root;
  env.tail_base = "/" + ParentName(conf) + "/" + RootName(root);
  auto it = conf.find("package_cgroups");
  env.off = it != conf.end() && it->second == "no";
  env.all = Hierarchies();
  if (!KIVOReadFile("/proc/self/cgroup", &env.own, 1 << 16)) env.own.clear();
  env.unified_with_memory = FindUnifiedWithMemory(env);
  return env;
}

// "<cgroup_parent>/<root>/pkg-<id>": the part of a group's path that is ours.
std::string OwnTail(const Env& env, const std::string& id) { return env.tail_base + "/pkg-" + id; }

const Hierarchy* FindV1(const std::vector<Hierarchy>& all, const std::string& controller) {
  for (const Hierarchy& h : all) {
    if (!h.v2 && h.options.find("," + controller + ",") != std::string::npos) return &h;
  }
  return nullptr;
}

// The unified hierarchy when it offers the memory controller to the tool's
// group (a system on cgroup v2); else nullptr and the v1 hierarchies count.
int FindUnifiedWithMemory(const Env& env) {
  for (size_t i = 0; i < env.all.size(); ++i) {
    const Hierarchy& h = env.all[i];
    if (!h.v2) continue;
    std::string controllers;
    if (KIVOReadFile(FolderOf(h, OwnGroup(env.own, "")) + "/cgroup.controllers", &controllers,
                     4096) &&
        (" " + controllers).find(" memory") != std::string::npos) {
      return static_cast<int>(i);
    }
  }
  return -1;
}

const Hierarchy* UnifiedWithMemory(const Env& env) {
  return env.unified_with_memory < 0 ? nullptr : &env.all[env.unified_with_memory];
}

// Where the groups of `id` would be made by this caller, with what is
// missing ("<what>: <reason>" lines).
std::vector<Group> PlannedGroups(const Env& env, const std::string& id, std::string* missing) {
  const std::string tail = OwnTail(env, id);
  std::vector<Group> groups;
  if (const Hierarchy* v2 = UnifiedWithMemory(env)) {
    const std::string dir = FolderOf(*v2, OwnGroup(env.own, "")) + tail;
    for (const char* what : {"memory", "pids", "cpu"}) groups.push_back({what, true, dir});
    return groups;
  }
  const std::pair<const char*, const char*> wanted[] = {
      {"memory", "memory"}, {"pids", "pids"}, {"cpu", "cpuacct"}};
  for (const auto& w : wanted) {
    const Hierarchy* h = FindV1(env.all, w.second);
    if (h) {
      groups.push_back({w.first, false, FolderOf(*h, OwnGroup(env.own, w.second)) + tail});
    } else {
      *missing += std::string(w.first) + ": the kernel offers no " + w.second + " controller\n";
    }
  }
  return groups;
}

std::string RecordsDir(const std::string& root = KIVOSysRoot()) {
  return root + "/run/kivo/pkgtool/cgroups";
}

std::string RecordPath(const std::string& id, const std::string& root = KIVOSysRoot()) {
  return RecordsDir(root) + "/" + id;
}

// True when `dir` may be a group of `id`: under a mounted cgroup hierarchy
// of the right kind, ending in our own tail, without "." or ".." steps.
bool IsGroupDir(const Env& env, const Group& g, const std::string& id) {
  const std::string tail = OwnTail(env, id);
  if (g.dir.size() <= tail.size() || g.dir.compare(g.dir.size() - tail.size(), tail.size(), tail))
    return false;
  if (g.dir.find("/./") != std::string::npos || g.dir.find("/../") != std::string::npos)
    return false;
  const std::string controller = g.what == "cpu" ? "cpuacct" : g.what;
  for (const Hierarchy& h : env.all) {
    const bool fits =
        h.v2 ? g.v2 : !g.v2 && h.options.find("," + controller + ",") != std::string::npos;
    if (fits && PMSIsStrictlyInside(g.dir, h.point)) return true;
  }
  return false;
}

// The record of `groups`: a "<what> v1|v2 <dir> <limit>" line each.
std::string RecordText(const std::vector<Group>& groups) {
  std::string text;
  for (const Group& g : groups)
    text += g.what + (g.v2 ? " v2 " : " v1 ") + g.dir + " " + std::to_string(g.limit) + "\n";
  return text;
}

// The groups recorded for `id`, each line checked whole; none when the
// record is missing or any line is not valid.
std::vector<Group> RecordedGroups(const Env& env, const std::string& id) {
  std::vector<Group> groups;
  std::string text;
  if (!KIVOReadFile(RecordPath(id, env.root), &text, 1 << 14)) return groups;
  size_t at = 0;
  while (at < text.size()) {
    const size_t end = std::min(text.find('\n', at), text.size());
    const std::vector<std::string> f = Fields(text.substr(at, end - at));
    at = end + 1;
    Group g;
    if (f.size() != 4 || (f[1] != "v1" && f[1] != "v2") || !Digits(f[3], 18, &g.limit)) return {};
    g.what = f[0];
    g.v2 = f[1] == "v2";
    g.dir = f[2];
    if ((g.what != "memory" && g.what != "pids" && g.what != "cpu") || !IsGroupDir(env, g, id))
      return {};
    groups.push_back(g);
  }
  return groups;
}

[[nodiscard]] bool WriteRecord(const std::string& id, const std::vector<Group>& groups) {
  const std::string path = RecordPath(id);
  return KIVOFSMkdirP(path.substr(0, path.rfind('/')).c_str(), 0700) == 0 &&
         KIVOWriteFileAtomic(path, RecordText(groups), SyncToDisk::No, 0600);
}

[[nodiscard]] bool WriteValue(const std::string& file, const std::string& value) {
  int fd = open(file.c_str(), O_WRONLY | O_CLOEXEC);
  if (fd < 0) return false;
  bool ok = write(fd, value.data(), value.size()) == static_cast<ssize_t>(value.size());
  close(fd);
  return ok;
}

std::string ErrnoText() { return strerror(errno); }

// In the unified hierarchy a controller reaches a group only when every
// group above it hands it down: enables memory and pids from `top` (the
// tool's group) down to the package's group.
bool HandDown(const std::string& top, const std::string& dir, std::string* missing) {
  std::string at = top;
  size_t pos = top.size();
  while (pos < dir.size()) {
    for (const char* c : {"+memory", "+pids"}) {
      if (!WriteValue(at + "/cgroup.subtree_control", c)) {
        *missing += std::string(c + 1) + ": " + at + " does not hand the controller down (" +
                    ErrnoText() + ")\n";
        return false;
      }
    }
    pos = dir.find('/', pos + 1);
    if (pos == std::string::npos) pos = dir.size();
    at = dir.substr(0, pos);
  }
  return true;
}

// The file the child writes "0" into to join `g`. On v1 that is "tasks",
// which moves the writing thread alone: the child between fork and exec has
// one thread, so that is the whole process, and the kernel spares a thread's
// move the lock over every thread group that a move through "cgroup.procs"
// takes, whose first writer waits for an RCU grace period (8 to 25 ms per
// script on a busy two-core machine). The unified hierarchy moves only whole
// processes between its groups: "cgroup.procs".
const char* JoinFile(const Group& g) { return g.v2 ? "/cgroup.procs" : "/tasks"; }

// Makes the group folder, trying again once when a removal of an emptied
// parent raced with us.
bool MakeGroupDir(const std::string& dir) {
  for (int attempt = 0; attempt < 2; ++attempt) {
    if (KIVOFSMkdirP(dir.c_str(), 0755) == 0) return true;
  }
  return false;
}

// Sets `limits` on the package's group *g and keeps the bound in g->limit;
// false with `missing` when the controller refused (g->limit is then 0).
bool SetLimit(Group* group, const PackageLimits& limits, std::string* missing) {
  const Group& g = *group;
  const uint64_t memory = static_cast<uint64_t>(limits.memory_mb) << 20;
  const std::string bytes = std::to_string(memory);
  group->limit = 0;
  bool ok = true;
  if (g.what == "pids") {
    ok = WriteValue(g.dir + "/pids.max", std::to_string(limits.processes));
  } else if (g.what == "memory" && g.v2) {
    ok = WriteValue(g.dir + "/memory.max", bytes);
    // Swap would let a package past its bound; a whole group dies together.
    if (ok && access((g.dir + "/memory.swap.max").c_str(), F_OK) == 0)
      ok = WriteValue(g.dir + "/memory.swap.max", "0");
    if (ok) static_cast<void>(WriteValue(g.dir + "/memory.oom.group", "1"));
  } else if (g.what == "memory") {
    // memory+swap may never be below memory alone: when the bound grows,
    // the first write fails and succeeds after the second.
    const std::string memsw = g.dir + "/memory.memsw.limit_in_bytes";
    const bool has_memsw = access(memsw.c_str(), F_OK) == 0;
    ok = WriteValue(g.dir + "/memory.limit_in_bytes", bytes);
    if (has_memsw)
      ok = WriteValue(memsw, bytes) && (ok || WriteValue(g.dir + "/memory.limit_in_bytes", bytes));
  }
  if (!ok) {
    *missing += g.what + ": the limit could not be set (" + ErrnoText() + ")\n";
    return false;
  }
  if (g.what != "cpu") group->limit = g.what == "pids" ? limits.processes : memory;
  return true;
}

const Group* FindGroup(const std::vector<Group>& groups, const std::string& what) {
  for (const Group& g : groups) {
    if (g.what == what) return &g;
  }
  return nullptr;
}

// The groups to use for `id`: those recorded when they still exist
// (*recorded true), else new ones where this caller runs.
std::vector<Group> GroupsFor(const Env& env, const std::string& id, std::string* missing,
                             bool* recorded = nullptr) {
  // The administrator's switch (package-tool.md): no groups, and every
  // figure says so.
  if (env.off) {
    for (const char* what : {"memory", "pids", "cpu"})
      *missing += std::string(what) + ": turned off (package_cgroups in pkgtool.conf)\n";
    return {};
  }
  std::vector<Group> groups = RecordedGroups(env, id);
  bool all_there = !groups.empty();
  for (const Group& g : groups) all_there = all_there && access(g.dir.c_str(), F_OK) == 0;
  if (recorded) *recorded = all_there;
  if (!all_there) return PlannedGroups(env, id, missing);
  // A controller left out when the groups were made stays out until they
  // are made again (after a restart): say so at every run, not just the
  // first, with the kernel's reason where there is one.
  std::string planned;
  static_cast<void>(PlannedGroups(env, id, &planned));
  for (const char* what : {"memory", "pids", "cpu"}) {
    if (FindGroup(groups, what)) continue;
    const size_t at = planned.find(std::string(what) + ": ");
    *missing += at != std::string::npos
                    ? planned.substr(at, planned.find('\n', at) + 1 - at)
                    : std::string(what) +
                          ": left out when its groups were made, at its first run since the "
                          "appliance started\n";
  }
  return groups;
}

// Opens the control files of groups. The kernel walks a cgroup path one
// component at a time (each a lookup and a revalidation in its own file
// system), and the paths are long, while a usage list opens files of
// hundreds of groups that share their parent folder: each file is opened
// relative to its group's parent, which is opened once. A parent that
// cannot be opened leaves its groups to the whole path.
class ControlFiles {
 public:
  ControlFiles() = default;
  ~ControlFiles() {
    for (const auto& parent : parents_) {
      if (parent.second >= 0) close(parent.second);
    }
  }
  ControlFiles(const ControlFiles&) = delete;
  ControlFiles& operator=(const ControlFiles&) = delete;

  // `file` ("/memory.current") of the group folder `dir`, opened to read;
  // -1 with errno when it cannot be.
  int Open(const std::string& dir, const char* file) {
    const size_t slash = dir.rfind('/');
    const int parent = slash == std::string::npos || slash == 0 ? -1 : Parent(dir.substr(0, slash));
    if (parent < 0) return open((dir + file).c_str(), O_RDONLY | O_CLOEXEC);
    return openat(parent, (dir.substr(slash + 1) + file).c_str(), O_RDONLY | O_CLOEXEC);
  }

 private:
  int Parent(const std::string& folder) {
    auto it = parents_.find(folder);
    if (it == parents_.end()) {
      const int fd = open(folder.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
      it = parents_.emplace(folder, fd).first;
    }
    return it->second;
  }

  std::map<std::string, int> parents_;  // folder -> descriptor, -1 when it would not open
};

// The text of an open control file, which the kernel writes in one piece
// ending in a newline; closes `fd`. False when it cannot be read or does
// not fit `size`.
bool ReadControl(int fd, char* text, size_t size) {
  if (fd < 0) return false;
  size_t used = 0;
  while (used < size - 1) {
    ssize_t n = read(fd, text + used, size - 1 - used);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) {
      if (n < 0) used = 0;
      break;
    }
    used += static_cast<size_t>(n);
    if (text[used - 1] == '\n') break;
  }
  close(fd);
  text[used] = '\0';
  return used > 0 && used < size - 1;
}

// A control file's number. A usage list reads hundreds of these: plain
// open and read, without the size check of a general file read (a control
// file says 4096 whatever it holds).
bool ReadNumber(ControlFiles* files, const std::string& dir, const char* file, uint64_t* value) {
  char text[64];
  if (!ReadControl(files->Open(dir, file), text, sizeof(text))) return false;
  char* end = nullptr;
  errno = 0;
  unsigned long long v = std::strtoull(text, &end, 10);
  if (errno != 0 || end == text) return false;
  *value = v;
  return true;
}

// "usage_usec <n>" of a unified group's cpu.stat, in nanoseconds.
bool ReadCpuStat(ControlFiles* files, const std::string& dir, uint64_t* ns) {
  char text[4096];
  if (!ReadControl(files->Open(dir, "/cpu.stat"), text, sizeof(text))) return false;
  std::istringstream in(text);
  std::string key;
  unsigned long long value = 0;
  while (in >> key >> value) {
    if (key == "usage_usec") {
      *ns = value * 1000ULL;
      return true;
    }
  }
  return false;
}

using FigureRead = bool (*)(ControlFiles*, const Group&, uint64_t*);

UsageFigure Figure(ControlFiles* files, const std::vector<Group>& groups, const std::string& what,
                   const std::string& missing, FigureRead read) {
  UsageFigure f;
  const Group* g = FindGroup(groups, what);
  if (!g) {
    size_t at = missing.find(what + ": ");
    f.reason =
        at == std::string::npos
            ? "no " + what + " controller"
            : missing.substr(at + what.size() + 2, missing.find('\n', at) - at - what.size() - 2);
  } else if (read(files, *g, &f.value)) {
    f.measured = true;
  } else {
    // Why there is no figure is asked only when there is none: the list
    // reads four figures of every package.
    f.reason = access(g->dir.c_str(), F_OK) != 0
                   ? "the package has not run since the appliance started"
                   : "its control group cannot be read";
  }
  return f;
}

bool ReadCpu(ControlFiles* files, const Group& g, uint64_t* v) {
  return g.v2 ? ReadCpuStat(files, g.dir, v) : ReadNumber(files, g.dir, "/cpuacct.usage", v);
}
bool ReadMemory(ControlFiles* files, const Group& g, uint64_t* v) {
  return ReadNumber(files, g.dir, g.v2 ? "/memory.current" : "/memory.usage_in_bytes", v);
}
bool ReadMemoryLimit(ControlFiles* files, const Group& g, uint64_t* v) {
  return ReadNumber(files, g.dir, g.v2 ? "/memory.max" : "/memory.limit_in_bytes", v);
}
bool ReadProcessLimit(ControlFiles* files, const Group& g, uint64_t* v) {
  return ReadNumber(files, g.dir, "/pids.max", v);
}

// Kills every process of the group at `dir` until none is left or about
// two seconds have passed, then removes the folder.
bool EmptyAndRemove(const std::string& dir) {
  if (access(dir.c_str(), F_OK) != 0) return true;
  // cgroup.kill (unified hierarchy, Linux 5.14) kills the group at once.
  static_cast<void>(WriteValue(dir + "/cgroup.kill", "1"));
  for (int round = 0; round < 200; ++round) {
    if (rmdir(dir.c_str()) == 0 || errno == ENOENT) return true;
    std::string procs;
    if (KIVOReadFile(dir + "/cgroup.procs", &procs, 1 << 20)) {
      std::istringstream in(procs);
      long pid = 0;
      while (in >> pid) {
        if (pid > 0) kill(static_cast<pid_t>(pid), SIGKILL);
      }
    }
    struct timespec pause = {0, 10 * 1000 * 1000};
    nanosleep(&pause, nullptr);
  }
  return false;
}

}  // namespace

PackageLimitSettings PackageLimitSettingsLoad() {
  const KeyValueMap conf = ToolConf();
  PackageLimitSettings s;
  s.memory_mb_max = Setting(conf, "memory_limit_mb_max", s.memory_mb_max);
  s.memory_mb_default =
      std::min(Setting(conf, "memory_limit_mb_default", s.memory_mb_default), s.memory_mb_max);
  s.processes_max = Setting(conf, "process_limit_max", s.processes_max);
  s.processes_default =
      std::min(Setting(conf, "process_limit_default", s.processes_default), s.processes_max);
  return s;
}

std::string PackageLimitsInfoProblem(const KeyValueMap& info) {
  for (const char* key : {"memory_limit_mb", "process_limit"}) {
    auto it = info.find(key);
    if (it != info.end() && WholeNumber(it->second, kInfoLimitMax) < 0)
      return std::string(key) + ": must be a whole number from 1 to " +
             std::to_string(kInfoLimitMax);
  }
  return "";
}

std::string PackageLimitsCheck(const KeyValueMap& info, const PackageLimitSettings& settings,
                               PackageLimits* limits) {
  struct Key {
    const char* name;
    int def, max;
    int* out;
  };
  const Key keys[] = {
      {"memory_limit_mb", settings.memory_mb_default, settings.memory_mb_max, &limits->memory_mb},
      {"process_limit", settings.processes_default, settings.processes_max, &limits->processes}};
  std::string problem;
  for (const Key& k : keys) {
    auto it = info.find(k.name);
    long own = it == info.end() ? -1 : WholeNumber(it->second, kInfoLimitMax);
    *k.out = own > 0 ? static_cast<int>(std::min<long>(own, k.max)) : k.def;
    if (own > k.max && problem.empty()) {
      problem = std::string(k.name) + ": " + it->second + " is above this appliance's bound of " +
                std::to_string(k.max);
    }
  }
  return problem;
}

PackageCgroupJoin::~PackageCgroupJoin() {
  for (int i = 0; i < count_; ++i) close(fds_[i]);
}

PackageCgroupJoin::PackageCgroupJoin(PackageCgroupJoin&& other) noexcept {
  *this = std::move(other);
}

PackageCgroupJoin& PackageCgroupJoin::operator=(PackageCgroupJoin&& other) noexcept {
  if (this == &other) return *this;
  for (int i = 0; i < count_; ++i) close(fds_[i]);
  count_ = other.count_;
  for (int i = 0; i < kMaxGroups; ++i) fds_[i] = other.fds_[i];
  missing_ = std::move(other.missing_);
  other.count_ = 0;
  return *this;
}

bool PackageCgroupJoin::JoinInChild() const noexcept {
  for (int i = 0; i < count_; ++i) {
    // "0" is the writing process itself, in both hierarchies.
    if (write(fds_[i], "0", 1) != 1) return false;
  }
  return true;
}

PackageCgroupJoin PackageCgroupPrepare(const std::string& id, const PackageLimits& limits) {
  PackageCgroupJoin join;
  if (!PMSIsValidPackageId(id)) {
    join.missing_ = "control group: not a package id\n";
    return join;
  }
  const Env env = LoadEnv();
  bool recorded = false;
  std::vector<Group> groups = GroupsFor(env, id, &join.missing_, &recorded);
  const std::string before = recorded ? RecordText(groups) : "";
  std::vector<Group> used;
  for (Group& g : groups) {
    g.limit = 0;
    const bool first_in_dir =
        !FindGroup(used, g.what) && (used.empty() || used.back().dir != g.dir);
    if (!recorded && !MakeGroupDir(g.dir)) {
      join.missing_ += g.what + ": cannot make " + g.dir + " (" + ErrnoText() + ")\n";
      continue;
    }
    if (g.v2 && g.what == "memory" &&
        !HandDown(g.dir.substr(0, g.dir.size() - OwnTail(env, id).size()), g.dir, &join.missing_)) {
      continue;
    }
    if (!SetLimit(&g, limits, &join.missing_)) continue;
    used.push_back(g);
    if (!first_in_dir || join.count_ == PackageCgroupJoin::kMaxGroups) continue;
    int fd = open((g.dir + JoinFile(g)).c_str(), O_WRONLY | O_CLOEXEC);
    if (fd < 0) {
      join.missing_ += g.what + ": cannot open the group (" + ErrnoText() + ")\n";
      used.pop_back();
      continue;
    }
    join.fds_[join.count_++] = fd;
  }
  // The record says where the groups are and the bounds they have now,
  // which the usage list shows without asking the kernel for them again.
  const std::vector<Group>& record = recorded ? groups : used;
  if (!record.empty() && RecordText(record) != before && !WriteRecord(id, record))
    join.missing_ += "control group: cannot record where the groups are\n";
  return join;
}

std::string PackageCgroupPlannedMissing(const std::string& id) {
  if (!PMSIsValidPackageId(id)) return "control group: not a package id\n";
  std::string missing;
  static_cast<void>(GroupsFor(LoadEnv(), id, &missing));
  return missing;
}

PackageCgroupJoin PackageCgroupPrepareForScript(const std::string& script, int note_fd) {
  const size_t at = script.rfind("/scripts/");
  KeyValueMap info;
  PackageCgroupJoin join;
  if (at == std::string::npos || !KIVOKeyValueLoad(script.substr(0, at) + "/INFO", &info)) {
    if (note_fd >= 0) dprintf(note_fd, "control group: not a package's script, none joined\n");
    return join;
  }
  PackageLimits limits;
  const std::string above = PackageLimitsCheck(info, PackageLimitSettingsLoad(), &limits);
  join = PackageCgroupPrepare(info["package"], limits);
  if (note_fd < 0) return join;
  // What is missing is logged with the rest of the confinement, by
  // PackageConfinementPrepareForScript, which also records it.
  if (!above.empty()) dprintf(note_fd, "%s: lowered to the bound\n", above.c_str());
  return join;
}

bool PackageCgroupRemove(const std::string& id, std::string* problem) {
  if (!PMSIsValidPackageId(id)) return true;
  // Whatever the switch says now: groups made earlier go with the package.
  const Env env = LoadEnv();
  std::string missing;
  std::vector<Group> groups = RecordedGroups(env, id);
  if (groups.empty()) groups = PlannedGroups(env, id, &missing);
  bool ok = true;
  for (const Group& g : groups) {
    if (!EmptyAndRemove(g.dir)) {
      *problem += "cannot remove " + g.dir + " (" + ErrnoText() + ")\n";
      ok = false;
      continue;
    }
    // The root's folder goes with its last package; one still in use stays.
    rmdir(g.dir.substr(0, g.dir.rfind('/')).c_str());
  }
  if (ok) unlink(RecordPath(id).c_str());
  return ok;
}

namespace {

// The usage of `id` when its record names a group for every controller,
// with the bounds set on them, and each of them answers: what a package
// that ran has, read without checking the groups first (a figure read is
// proof enough that its group is there). The bounds are those the tool set
// at the package's last start, as recorded; the kernel is asked only for
// what changes. False when anything is missing: GroupsFor then says why.
bool MeasuredInRecordedGroups(const Env& env, ControlFiles* files, const std::string& id,
                              PackageUsage* usage) {
  if (env.off) return false;
  const std::vector<Group> groups = RecordedGroups(env, id);
  const Group* cpu = FindGroup(groups, "cpu");
  const Group* memory = FindGroup(groups, "memory");
  const Group* pids = FindGroup(groups, "pids");
  if (!cpu || !memory || !pids || memory->limit == 0 || pids->limit == 0) return false;
  if (!ReadCpu(files, *cpu, &usage->cpu_ns.value) ||
      !ReadMemory(files, *memory, &usage->memory_bytes.value)) {
    return false;
  }
  usage->memory_limit_bytes.value = memory->limit;
  usage->process_limit.value = pids->limit;
  for (UsageFigure* f :
       {&usage->cpu_ns, &usage->memory_bytes, &usage->memory_limit_bytes, &usage->process_limit}) {
    f->measured = true;
  }
  return true;
}

PackageUsage UsageIn(const Env& env, ControlFiles* files, const std::string& id) {
  PackageUsage usage;
  if (PMSIsValidPackageId(id) && MeasuredInRecordedGroups(env, files, id, &usage)) return usage;
  usage = PackageUsage();  // a figure or two may have been read
  std::string missing;
  std::vector<Group> groups =
      PMSIsValidPackageId(id) ? GroupsFor(env, id, &missing) : std::vector<Group>();
  usage.cpu_ns = Figure(files, groups, "cpu", missing, ReadCpu);
  usage.memory_bytes = Figure(files, groups, "memory", missing, ReadMemory);
  usage.memory_limit_bytes = Figure(files, groups, "memory", missing, ReadMemoryLimit);
  usage.process_limit = Figure(files, groups, "pids", missing, ReadProcessLimit);
  return usage;
}

}  // namespace

PackageUsage PackageCgroupUsage(const std::string& id) {
  ControlFiles files;
  return UsageIn(LoadEnv(), &files, id);
}

std::vector<PackageUsage> PackageCgroupUsages(const std::vector<std::string>& ids) {
  const Env env = LoadEnv();
  std::vector<PackageUsage> all;
  all.reserve(ids.size());
  ControlFiles files;
  for (const std::string& id : ids) all.push_back(UsageIn(env, &files, id));
  return all;
}

bool PackageCgroupRemoveRoot(const std::string& root, std::string* problem) {
  // The folders that hold the root's groups: where its records say, and
  // where a caller in this group would make them.
  std::set<std::string> folders;
  const Env env = LoadEnv(root);
  DIR* records = opendir(RecordsDir(root).c_str());
  while (records) {
    struct dirent* e = readdir(records);
    if (!e) break;
    if (!PMSIsValidPackageId(e->d_name)) continue;
    for (const Group& g : RecordedGroups(env, e->d_name))
      folders.insert(g.dir.substr(0, g.dir.rfind('/')));
  }
  if (records) closedir(records);
  std::string missing;
  for (const Group& g : PlannedGroups(env, "x", &missing))
    folders.insert(g.dir.substr(0, g.dir.rfind('/')));
  bool ok = true;
  for (const std::string& folder : folders) {
    DIR* d = opendir(folder.c_str());
    while (d) {
      struct dirent* e = readdir(d);
      if (!e) break;
      const std::string name = e->d_name;
      if (name.compare(0, 4, "pkg-") != 0 || !PMSIsValidPackageId(name.substr(4))) continue;
      if (!EmptyAndRemove(folder + "/" + name)) {
        *problem += "cannot remove " + folder + "/" + name + " (" + ErrnoText() + ")\n";
        ok = false;
      }
    }
    if (d) closedir(d);
    rmdir(folder.c_str());
  }
  return ok;
}
