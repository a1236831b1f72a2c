// Each package's processes run in a control group of their own, which
// bounds its memory and its number of processes and measures its CPU time
// and memory.
//
// Where the groups live. Per controller the tool uses the unified hierarchy
// (cgroup v2) when it offers the controller, else the controller's own v1
// hierarchy (memory, pids, cpuacct). A package's group is
//
//   <hierarchy>/<tool's group>/<cgroup_parent>/<root>/pkg-<id>
//
// <tool's group> is the group the tool runs in when it first makes the
// package's group: the groups stay inside whatever bounds the appliance puts
// on the tool itself. <cgroup_parent> comes from etc/kivo/pkgtool.conf
// ("kivo-packages" by default), <root> names the system root ("system" for
// "/", "root-<hash>" for any other, so that test roots never share groups).
// Where each group was made is recorded in run/kivo/pkgtool/cgroups/<id>
// under the root (gone at a restart, as the groups are), so a later caller
// in another group (the web server, kivoctl) finds the same groups.
//
// Limits come from INFO "memory_limit_mb" and "process_limit", else from the
// defaults of pkgtool.conf; pkgtool.conf also bounds them (package-tool.md).
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "klibc/key_value_file.h"

// The bounds and defaults of pkgtool.conf, each a whole number from 1.
struct PackageLimitSettings {
  int memory_mb_default = 512;
  int memory_mb_max = 4096;
  int processes_default = 256;
  int processes_max = 4096;
};

// Reads the settings: a missing or malformed one keeps the built-in value,
// a default above its bound is lowered to the bound.
PackageLimitSettings PackageLimitSettingsLoad();

// The limits a package gets.
struct PackageLimits {
  int memory_mb = 0;
  int processes = 0;
};

// "" when INFO's limit keys are absent or whole numbers from 1 to 1048576;
// else "<key>: ..." (PMSCheckInfo's form). The appliance's own bounds are
// checked at install (PackageLimitsCheck).
std::string PackageLimitsInfoProblem(const KeyValueMap& info);

// The limits for `info` within `settings`. Returns "" when INFO's values are
// within the bounds; else what is above them (an install refuses the package
// with 315). `limits` always gets usable values: a value above its bound is
// lowered to the bound, so a bound lowered after the install still holds.
std::string PackageLimitsCheck(const KeyValueMap& info, const PackageLimitSettings& settings,
                               PackageLimits* limits);

// What the child of a fork needs to join a package's groups: descriptors of
// the groups' "cgroup.procs" (v2) or "tasks" (v1), opened before the fork,
// so that joining takes nothing but write(2). Empty when nothing could be
// prepared.
class PackageCgroupJoin {
 public:
  PackageCgroupJoin() = default;
  ~PackageCgroupJoin();
  PackageCgroupJoin(PackageCgroupJoin&& other) noexcept;
  PackageCgroupJoin& operator=(PackageCgroupJoin&& other) noexcept;
  PackageCgroupJoin(const PackageCgroupJoin&) = delete;
  PackageCgroupJoin& operator=(const PackageCgroupJoin&) = delete;

  // Moves the calling process into every prepared group. Only for the child
  // between fork and exec, while it has a single thread (a v1 group is
  // joined thread by thread); async-signal-safe, allocates nothing. False when
  // a group refused it: the caller must not run the script then, since it
  // would run without the bounds this object promised.
  [[nodiscard]] bool JoinInChild() const noexcept;

  // What could not be prepared, one "<what>: <reason>" a line ("" for none).
  const std::string& missing() const { return missing_; }

 private:
  friend PackageCgroupJoin PackageCgroupPrepare(const std::string& id, const PackageLimits& limits);
  static constexpr int kMaxGroups = 4;
  int fds_[kMaxGroups] = {-1, -1, -1, -1};
  int count_ = 0;
  std::string missing_;
};

// Makes (or finds) the groups of package `id` (valid: registry.h), sets
// `limits` on them and opens them for joining. Controllers that are missing
// or refuse are left out and named in missing().
[[nodiscard]] PackageCgroupJoin PackageCgroupPrepare(const std::string& id,
                                                     const PackageLimits& limits);

// What PackageCgroupPrepare would leave out for `id`, in missing()'s form,
// found without making or changing any group: controllers the kernel lacks
// or the administrator turned off, and those left out when the groups were
// made.
std::string PackageCgroupPlannedMissing(const std::string& id);

// For a script of a package record ("<record>/scripts/<name>"): the record's
// INFO names the package and its limits. Writes to `note_fd` (the script's
// log, when >= 0) a limit of INFO lowered to its bound; what could not be
// prepared is missing() and PackageConfinementPrepareForScript records and
// logs it.
[[nodiscard]] PackageCgroupJoin PackageCgroupPrepareForScript(const std::string& script,
                                                              int note_fd);

// Removes the groups of `id` after killing what is left in them, and their
// record. False (with `problem`) when a group could not be removed.
[[nodiscard]] bool PackageCgroupRemove(const std::string& id, std::string* problem);

// Removes every group of the system root `root` ("" for "/"), killing what
// runs in them: for a root that goes away whole (a test's). False (with
// `problem`) when a group could not be removed.
[[nodiscard]] bool PackageCgroupRemoveRoot(const std::string& root, std::string* problem);

// One measurement: its value, or why there is none.
struct UsageFigure {
  bool measured = false;
  uint64_t value = 0;  // only when measured
  std::string reason;  // only when not measured
};

// What a package uses now, read from its groups.
struct PackageUsage {
  UsageFigure cpu_ns;        // CPU time used by its processes since the group was made
  UsageFigure memory_bytes;  // memory its processes hold now
  UsageFigure memory_limit_bytes;
  UsageFigure process_limit;
};

// Reads the usage of `id` (valid). A figure is measured only when its
// controller exists and the package's group was made (it ran since the
// appliance started); never a made-up 0.
PackageUsage PackageCgroupUsage(const std::string& id);
// The same for each of `ids`, in order, reading the system's state once.
std::vector<PackageUsage> PackageCgroupUsages(const std::vector<std::string>& ids);
