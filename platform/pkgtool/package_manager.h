// PackageManager: the package tool as the web API module and kivoctl use it.
// Cheap to construct; call init() first. Every call records a result code
// (result_codes.h) that getResult() answers until the next call, and the
// changing operations leave an operation log (getLogFilePath) and worker
// messages (getJsonParam("worker_msg")) for the caller to read and delete.
//
// Changing operations (install, upgrade, uninstall, start, stop, rollback,
// dropping kept versions) take the tool's exclusive lock; when another
// operation holds it past a short wait they fail with 275 instead of
// waiting. They first remove what an interrupted operation left behind (see
// registry.h).
#pragma once

#include <cstdint>
#include <map>
#include <set>
#include <string>
#include <vector>

#include <json/value.h>

#include "pkgtool/dependency.h"
#include "pkgtool/operation.h"
#include "pkgtool/package_info.h"
#include "pkgtool/package_origin.h"
#include "pkgtool/result_codes.h"
#include "pkgtool/signature.h"

class PackageManager {
 public:
  PackageManager() = default;
  ~PackageManager();
  PackageManager(const PackageManager&) = delete;
  PackageManager& operator=(const PackageManager&) = delete;

  // Makes sure the registry can be read (creating it on a fresh system).
  // False, with result 263, when it cannot.
  [[nodiscard]] bool init();

  int getResult() const { return result_; }
  // The result, and for 260 the services that are not running (array).
  int getResult(Json::Value& services) const;

  // --- Reading -----------------------------------------------------------

  // Ids of the installed packages, sorted. `language` and `mask` are kept
  // for the callers' sake; every package is listed.
  std::vector<std::string> enumPackages(const std::string& language = "", uint64_t mask = ~0ULL);
  // Every installed package's record, by id.
  [[nodiscard]] bool enumPackageInfoMap(std::map<std::string, PackageInfo>& out,
                                        const std::string& language, uint64_t mask);
  // The installed record of `id`. False with 255 when not installed. A
  // package whose installed files are gone is read all the same (its status
  // says broken).
  [[nodiscard]] bool getPackageInfo(const std::string& id, PackageInfo& info,
                                    const std::string& language = "", uint64_t mask = ~0ULL);
  [[nodiscard]] bool getInstallPackageInfo(const std::string& id, PackageInfo& info) {
    return getPackageInfo(id, info);
  }
  // Reads a package file's INFO (and with the wizard, its install or
  // upgrade wizard in `language`). False with 261 when it is not one; false
  // with 289 when a member does not match MANIFEST, `info` then filled all
  // the same when INFO could be read (getResult() says which).
  [[nodiscard]] bool queryPackageFileInfo(const std::string& path, PackageInfo& info,
                                          PKG_INSTALLATION_TYPE type, const char* language);
  [[nodiscard]] bool queryPackageFileInfoWithWizard(const std::string& path, PackageInfo& info,
                                                    PKG_INSTALLATION_TYPE type,
                                                    const char* language);
  // Loads the installed package's wizard of operation `op` (PKG_OP_UNINSTALL
  // ...) in `language` into out.getUIFile(). False when it has none.
  [[nodiscard]] bool readUIFile(int op, const PackageInfo& package, PackageInfo& out,
                                const std::string& language);
  // Whether the package runs. False when it cannot be told; then the result
  // says why (255 not installed, 258 broken, 264 not supported...).
  [[nodiscard]] bool getServiceStatus(const PackageInfo& info, bool& running, bool checkBroken);
  // Flags of an installed package (RoughStatus); 0 when it is not installed.
  enum RoughStatus : unsigned { kRoughInstalled = 1, kRoughRunning = 2, kRoughBroken = 4 };
  unsigned getPkgRoughStatus(const std::string& id);
  // The package's own log file (INFO "logfile", in its data folder). With
  // `evenIfMissing` false only when the file exists. "" when none.
  std::string getPackageLog(const std::string& id) { return getPackageLog(id, false); }
  std::string getPackageLog(const std::string& id, bool evenIfMissing);
  // The last operation's log file ("" before any).
  const std::string& getLogFilePath() const { return log_path_; }
  // "worker_msg": the last operation's worker messages (array).
  Json::Value getJsonParam(const std::string& key) const;
  // "curver", "oldver", "deppkg": texts the last operation left.
  std::string getMapParam(const std::string& key) const;
  // The service names of a service string, as a JSON array.
  void parseService(const std::string& services, Json::Value& out) const;

  // --- Dependencies ------------------------------------------------------

  // Every installed package, each after the packages it depends on... in
  // reverse: dependents first, so stopping in this order is safe and
  // starting goes in the reverse order.
  [[nodiscard]] bool getDependencyOrder(std::vector<std::string>& order);
  // True when every entry is installed at an accepted version and running
  // (a package without a service only needs to be installed).
  // Otherwise `notInstalled` (array) gets the entries missing or at a refused
  // version and `notStarted` the ids (", "-joined) that do not run.
  bool arePackagesInstallAndStart(const DepPkgVector& deps, Json::Value& notInstalled,
                                  std::string& notStarted, const char* language);
  // True when no running package depends on `id`; else `running` names them.
  bool areDependentPackageStop(const std::string& id, const char* language, std::string& running);
  // True when an installed package conflicts with `package`: one named in
  // `conflicts` (at a matching version), or one whose own conflicts name
  // `package`. `message` names them.
  bool arePackagesConflict(const PackageBasicInfo& package, const DepPkgVector& conflicts,
                           std::string& message, const char* language);
  // The running packages that depend on `id` into `list` ([{"id","name"}]).
  // 0 on success.
  int getDepPkgListStop(std::string id, const char* language, Json::Value& list);
  std::set<std::string> getServiceSetFromString(const char* services) const;
  // The services of `services` that are not running.
  std::set<std::string> checkServiceStarted(const std::set<std::string>& services) const;
  unsigned checkServiceStarted(unsigned mask) const;
  static unsigned PMSExplodeServiceString(const char* services);

  // --- Changing ------------------------------------------------------------

  // Starts or stops `id` through its start-stop-status script.
  [[nodiscard]] bool serviceControl(int opType, const std::string& id, bool start,
                                    const std::string& language, const std::string& user,
                                    void* list, bool checkDeps, bool recordState);
  // Removes `id`, handing the uninstall wizard's answers to its scripts.
  [[nodiscard]] bool uninstall(const std::string& id, const Json::Value* wizardValues,
                               const std::string& language, int opType, bool force,
                               const std::string& user);

  // Rolls `id` back to its most recently replaced kept version, with that
  // version's data; the data the installed version wrote is kept in turn,
  // so a second rollback undoes the first (rollback.h). 309 when no
  // version is kept; the log says what happened in words.
  [[nodiscard]] bool rollback(const std::string& id, const std::string& user);
  // Removes the kept versions of `id` with their data (revisions.h); 309
  // when none is kept. The log names each with the room it took.
  [[nodiscard]] bool dropRevisions(const std::string& id);

  // The watchdog's start (tools/kivoctl/watchdog.h), in two steps so that it
  // looks at the record under the lock before it acts. lockAndLoadNow takes
  // the lock in one try (275 when another operation holds it: the watchdog
  // never waits), finishes an interrupted upgrade and reads the installed
  // record of `id` (255 when not installed); the lock stays held whatever the
  // answer, until UnLock. startLocked then starts `id` as serviceControl
  // does (its services and needed packages checked first), the caller
  // holding the lock; it leaves the record's markers as they are.
  int lockAndLoadNow(const std::string& id, PackageInfo* info);
  [[nodiscard]] bool startLocked(const std::string& id, const PackageInfo& info);

  // The tool's exclusive lock, waiting at most `seconds`. False when another
  // process holds it.
  [[nodiscard]] bool ExLock(int seconds);
  void UnLock();

  // For the install functions of install.cc.
  void setOutcome(int result, const std::string& log_path, const Json::Value& workers,
                  const std::map<std::string, std::string>& params, const Json::Value& services);

 private:
  // Takes the exclusive lock, waiting `wait_seconds` (-1: lock_wait), then
  // reads the installed record of `id`: PKG_OK, 255 (invalid id or not
  // installed) or 275 (busy). The lock stays held whatever the answer.
  int LockAndLoad(const std::string& id, PackageInfo* info, int wait_seconds = -1);
  // Runs the start-stop-status script of `id` with "start" or "stop" (a
  // package without a service has nothing to run), showing readers a task
  // meanwhile; the caller holds the lock. PKG_OK or 274.
  int RunStartStop(const std::string& id, const PackageInfo& info, bool start, const Operation& op);
  // What a start needs: its services running (else 260, named in
  // `services`), the packages it needs installed and running (else 268, or
  // 259 for a refused version).
  int CheckCanRun(const PackageInfo& info, const Operation& op, Json::Value* services);
  // 269 when running packages depend on `id` (named in "deppkg").
  int CheckCanStop(const std::string& id, const Operation& op);
  // Writes or removes the record's "enabled" marker; logs a failure.
  [[nodiscard]] bool RecordEnabled(const std::string& record, bool enabled, const Operation& op);
  // The uninstall proper, under the lock: stop, preuninst, unpublish (the
  // commit), postuninst, removal of the folders.
  int RemovePackage(const std::string& id, const PackageInfo& info, const Json::Value& wizard,
                    const Operation& op);

  int result_ = 0;
  int lock_fd_ = -1;
  std::string log_path_;
  Json::Value worker_messages_{Json::arrayValue};
  Json::Value services_{Json::arrayValue};
  std::map<std::string, std::string> map_params_;
};

// The package file's check against this appliance, before an install:
// format, signature by the trust level, architecture, OS version limits,
// conflicts, required services and packages, port, volume. Returns true when
// it may be installed; else `code` is the result code, `message` says why,
// and `details` holds "serviceNoStarted", "unStartPkgList", "packages",
// "instPackageList" where they apply.
[[nodiscard]] bool CheckPackageFileInfoImpl(const char* language, const std::string& path,
                                            std::string& message, PKG_ERRCODE& code,
                                            Json::Value& details, PackageInfo& info);

// Installs or upgrades the package file `path` onto `volume` ("" for the
// default volume). `extraValues` is the wizard's JSON text; `typeFlag` true
// starts the package when installed. `details` receives "workerMessage",
// "installReboot", "curVersion"/"insVersion" and "deppkg" where they apply,
// and "signature" (which key signed the file, who vouched for it) once it
// was checked. `source` says where the file comes from (null: a file, an
// upload or a path), with the keys of the feed it was downloaded from, and
// whether the administrator switches the package to that origin. The origin
// and the signer are recorded with the package; an upgrade from another
// origin or signer is refused with 306 (package_origin.h).
[[nodiscard]] bool InstallPackageFileImpl(const std::string& user, const std::string& path,
                                          const std::string& volume, int reserved,
                                          const std::string& extraValues, bool typeFlag,
                                          const std::string& language, std::string& message,
                                          PKG_ERRCODE& code, Json::Value& details, bool force,
                                          bool checkCodesign,
                                          const PMSInstallSource* source = nullptr);

// The log text of a package log file; when it is larger than 1 MiB, its last
// 1 MiB. "" when it cannot be read.
std::string PMSReadPackageLog(const std::string& path);

// The last `lines` lines of the installed package's own log (INFO
// "logfile"), at most 4 KiB, without the final newline; "" when it has none.
std::string PMSPackageLogTail(const std::string& id, int lines);
