// What the module says about a package in more than one place (the list and
// get, an upload's description, a downloaded file's description, the
// catalogue): its status, from the tasks of its running operations and the
// package tool, and the host its own web page is reached at.
#pragma once

#include <optional>
#include <set>
#include <string>
#include <utility>

#include <json/value.h>

#include "pkgtool/package_manager.h"
#include "taskmgr/task.h"

namespace KIVO_PACKAGE {

// The package tasks that one request reads. The catalogue lists them once
// and then asks the store only for the ids the listing holds: it has
// thousands of entries and few of them have a task. Other readers ask the
// store for each id. Borrows `mgr` for its whole life.
class PackageTasks {
 public:
  explicit PackageTasks(NVX::TaskMgr& mgr) : mgr_(mgr) {}
  PackageTasks(NVX::TaskMgr& mgr, std::set<std::string> listed)
      : mgr_(mgr), listed_(std::move(listed)) {}

  // Whether task `id` may exist: with a listing, whether it holds the id.
  bool MayHave(const std::string& id) const { return !listed_ || listed_->count(id) != 0; }
  // Task `id` (the caller owns it), or null when there is none.
  NVX::Task* Get(const std::string& id) const;

 private:
  NVX::TaskMgr& mgr_;
  std::optional<std::set<std::string>> listed_;
};

// Whether a package whose installed files are gone reads as broken.
enum class BrokenCheck { kYes, kNo };

// What a package is doing, as every reader shows it.
struct PackageState {
  // The status words: those of a running operation's task ("starting",
  // "installing", "upgrading", "uninstalling", ...), else "running", else
  // StoppedStatus of the package tool's result.
  Json::Value status;
  // The package tool finds the package running (status "running").
  bool running = false;
  // The progress of an install under way (PMSGetProgress); -1.0 when no
  // install runs or its progress is unknown.
  double progress = -1.0;
};

// The state of package `id`. A running operation decides it first, in this
// order: a start or stop (its task's "status"), an install (its task's
// "status", "installing" when it has none), an uninstall. A task counts
// while it is not finished and its "pid" names a living process; one whose
// worker is known to be gone is ended as EndStaleTask says
// (task_record.h). Without a running operation the package tool answers
// whether `installed` (the package's installed record; null when it has
// none, which reads as "non_installed") runs.
PackageState ReadPackageState(const PackageTasks& tasks, PackageManager& manager,
                              const std::string& id, const PackageInfo* installed,
                              BrokenCheck broken);

// The status the package tool's last result gives a package that does not
// run: "non_installed", "NA", "broken", "version_limit", "builtin",
// "non_support", or "stop".
const char* StoppedStatus(int result);

// The host the browser reached this appliance at (HTTP_HOST) without its
// port, which is the web API's and not the package's: "nas.local:5000" ->
// "nas.local", "[::1]:5000" -> "[::1]". At most 255 bytes.
std::string RequestHost();

}  // namespace KIVO_PACKAGE
