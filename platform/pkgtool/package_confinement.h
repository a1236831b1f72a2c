// Who a package's scripts (and the service they start) run as, and what they
// may reach. Prepared here before the fork; entered in the child between
// fork and exec by script_runner.cc, the one place that applies it.
//
// A package runs as its own account (package_account.h) with no
// supplementary groups and PR_SET_NO_NEW_PRIVS, in a Landlock domain that
// allows reading and executing the machine's system folders (/usr, /bin,
// /sbin, /lib*, a fixed list of /etc files; never the system root's own
// etc, var/packages, keyring or sessions), reading its record (scripts,
// INFO) and payload, reading and writing its data folder, its temporary
// folder (<root>/tmp/kivo-package/<id>, $TMPDIR) and this operation's
// message and wizard files, and nothing else. Where the kernel's Landlock
// offers scoping (ABI 6), the script may neither signal nor reach an
// abstract unix socket outside its own domain; `start-stop-status stop`
// and `status` are left out of the signal scope, since they must signal the
// service that `start` left in a domain of its own (they still run as the
// package's account, which signals only its own processes).
//
// A package whose INFO says run_as_root="yes", and every package while
// "package_confinement" of etc/kivo/pkgtool.conf is "off", runs as root,
// unconfined.
//
// What was applied and what not is written to the record's "confinement"
// (var/packages/<id>/confinement), JSON:
//   {"user": "pkg-demo", "uid": 30000, "gid": 30000, "root": false,
//    "landlock_abi": 7,
//    "applied": ["user", "no_new_privs", "landlock_filesystem",
//                "landlock_scope_signal", "landlock_scope_abstract_unix_socket"],
//    "missing": [{"what": "...", "reason": "..."}],
//    "state": "confined"}
// and, when it changed or something is missing, to the script's log (the
// one place that logs what was not applied). "missing" also names each
// control group (package_cgroup.h) that could not be made or joined:
// "cgroup_memory", "cgroup_pids", "cgroup_cpu", or "cgroup" for all of them.
// "state" sums it up for the page:
//   "confined"     its own user, and nothing is missing
//   "partly"       something is missing (each named in "missing")
//   "no_account"   no account yet: it gets one at its next start or upgrade
//   "root"         it runs as root, unconfined, because INFO asks to
//   "turned_off"   it runs as root, unconfined: package_confinement is off
#pragma once

#include <map>
#include <string>
#include <sys/types.h>

#include <json/value.h>

#include "klibc/json_text.h"
#include "pkgtool/package_account.h"

// The name of the record's confinement file.
inline constexpr char kPMSConfinementFile[] = "confinement";

class PackageConfinement {
 public:
  PackageConfinement() = default;
  ~PackageConfinement();
  PackageConfinement(PackageConfinement&& other) noexcept;
  PackageConfinement& operator=(PackageConfinement&& other) noexcept;
  PackageConfinement(const PackageConfinement&) = delete;
  PackageConfinement& operator=(const PackageConfinement&) = delete;

  // What the child takes on, read by script_runner.cc (and nothing else):
  bool drop_user = false;  // become uid:gid with no supplementary groups
  uid_t uid = 0;
  gid_t gid = 0;
  bool no_new_privs = false;
  int landlock_ruleset = -1;  // a Landlock ruleset to restrict the child with, or -1
  std::string tmpdir;         // $TMPDIR for the script, "" for none

  // The record described above.
  const Json::Value& report() const { return report_; }

 private:
  friend PackageConfinement PackageConfinementPrepareForScript(
      const std::string& script, const std::string& arg,
      const std::map<std::string, std::string>& env, const std::string& groups_missing,
      int note_fd);
  Json::Value report_;
};

// For a package script "<record>/scripts/<name>" run with `arg` and `env`:
// the record's INFO names the package. Writes the record's confinement file
// when it changed, and a line to `note_fd` (the script's log, when >= 0)
// when it changed or something is missing. `groups_missing` is what the
// package's control groups lack (PackageCgroupJoin::missing() of the same
// script's, package_cgroup.h): it goes into the record. A script outside a
// record gets no confinement, and the report says so.
[[nodiscard]] PackageConfinement PackageConfinementPrepareForScript(
    const std::string& script, const std::string& arg,
    const std::map<std::string, std::string>& env, const std::string& groups_missing, int note_fd);

// The confinement record of installed package `id` (valid: registry.h), as
// its scripts last wrote it. False when there is none (a package installed
// before packages had accounts, not started since) or it cannot be read.
[[nodiscard]] bool PMSLoadConfinement(const std::string& id, Json::Value* record);
// The same with `parser` (strict), for a list of records.
[[nodiscard]] bool PMSLoadConfinement(const std::string& id, Json::Value* record,
                                      KIVOJsonParser* parser);

// The member of a package record that says the whole data folder was
// given to the account "<uid>:<gid>" (one line), by the last full pass, and
// that no script ran as root since (preparing one removes it).
inline constexpr char kPMSDataOwnerFile[] = "data_owner";

// How much of the data folder PMSSettlePackageAccount gives to the account.
enum class DataOwnership {
  // Every entry, whatever was done before: install, upgrade and
  // `kivoctl confine`, after which scripts that ran as root or an older
  // version may have left files of others.
  kWhole,
  // The folder itself only, when the record's data_owner says a full pass
  // gave everything to this same account; else every entry. For a start:
  // a data folder may hold millions of files, and walking them at every
  // start (at every boot, with cold caches) would cost far more than the
  // start itself.
  kUnlessSettled,
};

// For the changing operations (install, upgrade, start, `kivoctl confine`):
// finds or creates the account of `id` (package_account.h), gives the
// package's data folder to it as `ownership` says, makes the record, payload
// and data folder of `record` reachable (PMSMakeReachable), and writes the
// record's confinement file, saying so in the operation log `log_path` (""
// for none) when it changed. Nothing in the data folder changes unless
// `may_change` allows it. PKG_OK or the account's result code, with
// `*error`.
[[nodiscard]] int PMSSettlePackageAccount(const std::string& id, const std::string& record,
                                          const std::string& log_path, DataOwnership ownership,
                                          std::string* error,
                                          const DataChangeGate& may_change = {});

// At uninstall, after the package's folders were removed: what stays of its
// data folder `data` (a removal that failed) is given to root, the
// package's temporary folder is removed, and then its account. False (with
// `*error`) when something could not be done.
[[nodiscard]] bool PMSRetirePackageAccount(const std::string& id, const std::string& data,
                                           std::string* error);
