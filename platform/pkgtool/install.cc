// The package tool's install (the web API's requests for it are
// package/install.cc). Checking and installing package files. The install is one transaction:
// the new version is staged under fresh names (record and payload folder),
// its scripts run, and it becomes the installed version by one atomic
// rename (registry.h). Until then the old version's code is untouched. An
// upgrade copies the package's data before its scripts change it
// (data_snapshot.h) and counts as done only once the new version passes its
// health gate (health_gate.h); any failure before that puts the old version
// back with its data.

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <ctime>
#include <future>
#include <memory>
#include <sys/stat.h>
#include <syslog.h>
#include <system_error>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/last_error.h"
#include "klibc/sysroot.h"
#include "pkgtool/btrfs_subvolume.h"
#include "pkgtool/data_snapshot.h"
#include "pkgtool/health_gate.h"
#include "pkgtool/install_checks.h"
#include "pkgtool/lifecycle.h"
#include "pkgtool/package_confinement.h"
#include "pkgtool/package_file.h"
#include "pkgtool/package_file_ops.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/package_origin.h"
#include "pkgtool/package_state.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "pkgtool/release_notes.h"
#include "pkgtool/revisions.h"
#include "pkgtool/root_request.h"
#include "pkgtool/signature.h"
#include "storage/volume_space.h"

namespace {

// Fills `info` from a package file's header members.
void InfoFromHeader(const std::string& path, const PackageFileHeader& header,
                    PKG_INSTALLATION_TYPE wizard, const char* language, PackageInfo* info) {
  *info = PackageInfo(header.info);
  info->setFilePath(path);
  info->setLanguage(language ? language : "");
  auto license = header.members.find("LICENSE");
  if (license != header.members.end()) info->setLicense(license->second);
  auto notes = header.members.find(kPMSReleaseNotesMember);
  if (notes != header.members.end()) info->setReleaseNotes(notes->second);
  unsigned mask = 0;
  for (const PMSWizardFile& w : kPMSWizardFiles) {
    auto it = header.members.find(w.member);
    if (it == header.members.end()) continue;
    mask |= w.op;
    if (w.op != wizard) continue;
    auto localized = header.members.find(std::string(w.member) + "_" + (language ? language : ""));
    // A member that is not JSON leaves the wizard without pages (null); the
    // builder refuses such a member, so only a hand-made file has one.
    Json::Value ui;
    (void)KIVOParseJson(localized != header.members.end() ? localized->second : it->second, &ui);
    info->setUIFile(ui);
  }
  info->setWizardMask(mask);
}

// What one check of a file's signature found, before any trust level.
struct SignatureSeen {
  int outcome = PKG_ERR_SIGNATURE_UNCHECKABLE;
  std::string signer;   // the fingerprint the signature names
  std::string voucher;  // who vouched for a good signature
  std::string error;
};

SignatureSeen CheckFileSignature(const PackageFileHeader& header,
                                 const PMSSourceKeys* source_keys) {
  SignatureSeen seen;
  seen.outcome = PMSCheckSignature(header.manifest, header.signature, &seen.signer, &seen.error,
                                   source_keys, &seen.voucher);
  return seen;
}

// The signature outcome under the appliance's trust level, with or without
// the administrator's confirmation. `source_keys` (may be null) are the keys
// of the feed the file came from; `*who` gets a line saying which key signed
// the file and who vouched for it, `*check` (when given) what the check
// found.
int SignatureVerdict(const PackageFileHeader& header, const PMSSourceKeys* source_keys,
                     SignatureConfirmed confirmed, std::string* message, std::string* who = nullptr,
                     SignatureSeen* check = nullptr) {
  SignatureSeen seen = CheckFileSignature(header, source_keys);
  const int outcome = seen.outcome;
  const std::string &signer = seen.signer, &error = seen.error, &voucher = seen.voucher;
  if (check) *check = seen;
  int verdict = PMSApplyTrustLevel(outcome, PMSTrustLevel(), confirmed);
  if (verdict != PKG_OK) *message = PMSResultText(verdict) + (error.empty() ? "" : ": " + error);
  if (who) {
    if (outcome == PKG_OK) {
      *who = "signed by key " + signer + ", vouched for by " + voucher;
    } else if (signer.empty()) {
      *who = std::string("not signed by a known key (") + PMSResultText(outcome) + ")";
    } else {
      *who = "signed by key " + signer + ", which no trusted source vouches for (" +
             std::string(PMSResultText(outcome)) + ")";
    }
  }
  return verdict;
}

// Everything a staged install creates, removed again unless committed.
// Each folder is removed only strictly inside the folder that owns it, so a
// staging that failed before its names were made removes nothing.
struct Staging {
  std::string id;
  std::string record_name;
  std::string record;   // <root>/var/packages/.records/<name>
  std::string store;    // <root>/<volume>/@appstore
  std::string target;   // <store>/<name>
  std::string appdata;  // <root>/<volume>/@appdata
  std::string data;     // <appdata>/<id>
  bool created_data = false;
  bool fresh_account = false;  // a fresh install's account: removed with it
  bool committed = false;

  ~Staging() {
    if (committed) return;
    // A folder that stays is no package's: the next operation's clean-up
    // removes the record and the payload; a data folder made for nothing is
    // empty but for what preinst wrote.
    static_cast<void>(PMSRemoveTree(PackageRegistry::RecordsDir(), record));
    static_cast<void>(PMSRemoveTree(store, target));
    if (created_data) static_cast<void>(PMSRemoveTree(appdata, data));
    std::string error;
    if (fresh_account) static_cast<void>(PMSRetirePackageAccount(id, "", &error));
  }
};

bool WriteRecordMembers(const PackageFileHeader& header, const KeyValueMap& info,
                        const Staging& s) {
  if (KIVOFSMkdirP((s.record + "/scripts").c_str()) != 0) return false;
  std::string info_text;
  for (const auto& kv : info) info_text += KIVOKeyValueLine(kv.first, kv.second) + "\n";
  if (!KIVOWriteFileAtomic(s.record + "/INFO", info_text)) return false;
  for (const auto& m : header.members) {
    if (m.first == "INFO") continue;
    std::string path = s.record + "/" + m.first;
    if (KIVOFSMkdirP(path.substr(0, path.rfind('/')).c_str()) != 0) return false;
    unsigned mode = m.first.compare(0, 8, "scripts/") == 0 ? 0755 : 0644;
    if (!KIVOWriteFileAtomic(path, m.second, SyncToDisk::No, mode)) return false;
  }
  return symlink(s.target.c_str(), (s.record + "/target").c_str()) == 0 &&
         symlink(s.data.c_str(), (s.record + "/var").c_str()) == 0;
}

// Runs the installed version's start-stop-status with `action`.
bool ControlRecord(const std::string& record, const PackageInfo& info, const std::string& action,
                   const Operation& op) {
  auto env = PMSScriptEnv(info, record, action, op, Json::Value());
  return PMSRunPackageScript(record, "start-stop-status", action, env, op);
}

// Makes the package's data folder unless it exists: on Btrfs a subvolume,
// so that the copy before an upgrade is a snapshot (btrfs_subvolume.h). A
// data folder found in place, of either kind, stays as it is.
bool MakeDataFolder(const Staging& s) {
  const bool subvolume =
      s.created_data && KIVOFSMkdirP(s.appdata.c_str()) == 0 && PMSOnBtrfs(s.appdata);
  return subvolume ? PMSMakeSubvolume(s.data, 0755) : KIVOFSMkdirP(s.data.c_str()) == 0;
}

std::string MiB(uint64_t bytes) { return std::to_string((bytes + (1 << 20) - 1) >> 20) + " MiB"; }

// The last lines of the installed package's own log, for an answer that
// says why an upgrade failed; "" when it has none.
std::string PackageLogTail(const std::string& id) {
  std::string tail = PMSPackageLogTail(id, 10);
  return tail.empty() ? "" : "\nThe last lines of " + id + "'s log:\n" + tail;
}

struct InstallJob {
  std::string path, volume, user, language;
  Json::Value wizard;
  bool run_after = false, force = true, check_codesign = true;
  PMSInstallSource source;  // where the file comes from; a file unless the caller says
};

class Installer {
 public:
  Installer(const InstallJob& job, std::string* message, Json::Value* details)
      : job_(job), message_(message), details_(details) {
    source_keys_.source = job.source.origin.feed;
    source_keys_.keys = job.source.feed_keys;
  }

  int Run();
  // Hands the operation's log text and worker messages to the caller and
  // removes the log.
  void Report();

 private:
  int Refuse(int code, const std::string& text) {
    *message_ = text;
    return code;
  }
  int CheckVersions(const PackageInfo& info);
  // The keys of the feed the file comes from; null for any other source.
  const PMSSourceKeys* SourceKeys() const {
    return job_.source.origin.kind == PMSOriginKind::kFeed ? &source_keys_ : nullptr;
  }
  // Records where the file comes from and who signed it (`found`, what the
  // signature check saw), and for an upgrade applies the origin rule
  // (package_origin.h).
  int CheckOrigin(const SignatureSeen& found);
  int Stage(PackageFileReader* reader, const PackageInfo& info, Staging* s);
  // Stage's folders, record and payload on `volume`.
  int Unpack(PackageFileReader* reader, const PackageInfo& info, const VolumeConfig& volume,
             Staging* s);
  // Starts the planned copy of the data on a thread of its own when it is
  // a snapshot (see the definition).
  void SnapshotOnAThread();
  // Whether the data may change: once the snapshot on its thread is whole,
  // or when none is under way. Waits for it.
  bool SnapshotAllowsChanges();
  // Drops a snapshot taken beside an unpacking that then failed.
  void DropEarlySnapshot();
  // Before anything is written: whether the upgrade can copy the data
  // folder of `volume`, and whether the volume has room for the copy besides
  // the install's `needed` bytes (307, 308). Sets snapshot_ when a copy is
  // to be taken.
  int PlanDataCopy(const PackageInfo& info, const VolumeConfig& volume, uint64_t needed);
  int RunScriptsAndPublish(const PackageInfo& info, Staging* s);
  // preinst; or, for an upgrade, stopping the old version, copying the data
  // and preupgrade.
  int PrepareInstall(const std::map<std::string, std::string>& env, Staging* s);
  int PrepareUpgrade(const PackageInfo& info, const std::map<std::string, std::string>& env,
                     Staging* s);
  // Takes the planned copy of the data, or collects the one taken on a
  // thread.
  int TakeDataCopy();
  // The package's own account (package_confinement.h), before its first
  // script of this operation; nothing in the data changes unless
  // `may_change` allows it.
  int SettleAccount(Staging* s, const DataChangeGate& may_change = {});
  // After a refusal that changed nothing but stopping the old version: it
  // runs again, and the answer says so.
  int RestartOld(int code);
  // After any failure of an upgrade once its scripts began (`failure` says
  // what the new version did: "failed in postupgrade", ...): the new version
  // stopped, the old one back with its data and started when it ran, and an
  // answer that says what really happened.
  int RestoreAfterFailure(const PackageInfo& info, Staging* s, const std::string& failure);
  // Puts the old version back (with its data when it was copied); true when
  // it is whole again. *state says what happened in words.
  bool PutOldBack(const PackageInfo& info, std::string* state);
  std::string PartialRestoreText(RestoreState restored, const std::string& error,
                                 const PackageInfo& info);
  int WithdrawInstall(const PackageInfo& info, Staging* s);
  int Finish(const PackageInfo& info, Staging* s);
  // An upgraded package that ran (or was asked to) starts and must pass
  // the health gate; one that was stopped is judged by its scripts alone.
  int StartUpgraded(const PackageInfo& info, Staging* s);
  // The commit of an upgrade that copied the data: the copy becomes the old
  // version's kept revision, or is dropped when keep_revisions is 0.
  [[nodiscard]] bool ConfirmUpgrade(const Staging& s);
  [[nodiscard]] bool RemoveOldVersion();

  const InstallJob& job_;
  std::string* message_;
  Json::Value* details_;
  std::unique_ptr<Operation> op_;
  bool upgrade_ = false;
  bool was_running_ = false;
  bool published_ = false;                  // the new version is published
  bool new_started_ = false;                // the new version was started: a restore stops it first
  std::unique_ptr<DataSnapshot> snapshot_;  // the planned copy of the data; null for none
  bool copy_taken_ = false;
  // The snapshot taken on a thread (beside the unpacking, or beside the
  // settling of the account); else invalid.
  std::shared_future<TreeCopyResult> snapshot_thread_;
  std::string thread_error_;  // its error, once snapshot_thread_ is ready
  bool old_kept_ = false;     // the old version stays as a kept revision (revisions.h)
  PackageInfo old_;
  std::string old_record_;
  std::string id_;
  std::string signature_note_;  // which key signed the file, who vouched for it
  PMSSourceKeys source_keys_;   // the feed's keys, for a file from a feed
  PMSPackageOrigin incoming_;   // the file's origin and signer, recorded with it
};

int Installer::CheckVersions(const PackageInfo& info) {
  upgrade_ = PMSLoadInstalled(info.getId(), &old_);
  if (!upgrade_) return PKG_OK;
  old_record_ = PackageRegistry::PublishedRecord(info.getId());
  // A roll-back republishes this name and the clean-up removes it: both need
  // a record of the registry's own making.
  if (!PackageRegistry::IsRecordNameOf(info.getId(), old_record_)) {
    return Refuse(PKG_ERR_BROKEN, "the installed record of " + info.getId() + " is not a record");
  }
  (*details_)["curVersion"] = old_.getVersion();
  (*details_)["insVersion"] = info.getVersion();
  if (!job_.force && PMSCompareVersion(info.getVersion(), old_.getVersion()) <= 0) {
    return Refuse(PKG_ERR_NOT_NEWER, "version " + old_.getVersion() + " is installed");
  }
  // Running packages that depend on this one must accept the new version.
  for (const std::string& other : PMSInstalledDependents(info.getId())) {
    PackageInfo dependent;
    if (!PMSLoadInstalled(other, &dependent) || !PMSIsRunning(other, dependent)) continue;
    for (const PackageBasicInfo& dep : dependent.getDependencies()) {
      if (dep.getName() == info.getId() && !dep.accepts(info.getVersion())) {
        (*details_)["deppkg"] = other;
        return Refuse(PKG_ERR_DEPENDENTS_RUNNING, other + " runs and needs " + dep.toString());
      }
    }
  }
  return PKG_OK;
}

int Installer::CheckOrigin(const SignatureSeen& found) {
  PMSIncoming incoming;
  incoming.origin = job_.source.origin;
  // Only a signature that verified names its signer: the key an unverified
  // signature names is a claim anybody can make.
  incoming.origin.signer = found.outcome == PKG_OK ? found.signer : "";
  incoming.origin.recorded = true;
  incoming.by_keyring = found.outcome == PKG_OK && found.voucher == kPMSKeyringVoucher;
  incoming_ = incoming.origin;
  if (!upgrade_) return PKG_OK;
  const PMSPackageOrigin installed = PMSReadOrigin(PackageRegistry::Dir() + "/" + old_record_);
  std::string why;
  if (PMSJudgeUpgradeOrigin(id_, installed, incoming, PMSOriginChange::kRefuse, &why) == PKG_OK)
    return PKG_OK;
  if (job_.source.choices.change == PMSOriginChange::kRefuse) {
    op_->Log("origin: " + why);
    return Refuse(PKG_ERR_OTHER_ORIGIN, why);
  }
  // The administrator's explicit act: it stays in the operation's log and
  // the system log.
  const std::string note = "origin switched by " + job_.user + ": " + PMSSourceText(installed) +
                           " -> " + PMSSourceText(incoming_) + ", signer " +
                           (incoming_.signer.empty() ? "none" : incoming_.signer);
  op_->Log("origin: " + note);
  syslog(LOG_NOTICE, "pkgtool: %s %s", id_.c_str(), note.c_str());
  return PKG_OK;
}

int Installer::Stage(PackageFileReader* reader, const PackageInfo& info, Staging* s) {
  VolumeConfig volume;
  std::string text;
  uint64_t needed = PMSNeededBytes(info, reader->header().payload_size);
  int code = PMSChooseVolume(info, job_.volume, needed, &volume, &text);
  if (code != PKG_OK) return Refuse(code, text);
  if (upgrade_ && (code = PlanDataCopy(info, volume, needed)) != PKG_OK) return code;
  // Whether the old version runs decides when its data may be copied (and
  // whether it is stopped and started again); the package's lock keeps it
  // so until the upgrade ends.
  if (upgrade_) was_running_ = PMSIsRunning(id_, old_);
  if (!was_running_) SnapshotOnAThread();
  code = Unpack(reader, info, volume, s);
  if (code != PKG_OK) DropEarlySnapshot();
  return code;
}

int Installer::Unpack(PackageFileReader* reader, const PackageInfo& info,
                      const VolumeConfig& volume, Staging* s) {
  const std::string record_name = PackageRegistry::NewRecordName(info.getId());
  if (record_name.empty()) return Refuse(PKG_ERR_INTERNAL, "cannot make a fresh record name");
  s->id = info.getId();
  s->record_name = record_name;
  s->record = PackageRegistry::RecordsDir() + "/" + record_name;
  s->store = KIVORootPath(volume.path + "/@appstore");
  s->target = s->store + "/" + record_name;
  s->appdata = KIVORootPath(volume.path + "/@appdata");
  s->data = s->appdata + "/" + info.getId();
  s->created_data = !KLIBCFileExist(s->data.c_str());
  KeyValueMap installed = reader->header().info;
  installed["install_volume"] = volume.path;
  installed["installed_time"] = std::to_string(time(nullptr));
  installed["installed_by"] = job_.user;
  if (KIVOFSMkdirP(s->target.c_str()) != 0 || !MakeDataFolder(*s) ||
      !WriteRecordMembers(reader->header(), installed, *s) ||
      !KIVOWriteFileAtomic(s->record + "/ORIGIN", PMSOriginText(incoming_), SyncToDisk::No)) {
    return Refuse(KLIBCErrGet() == KLIBC_ERR_NO_SPACE ? PKG_ERR_NO_SPACE : PKG_ERR_INTERNAL,
                  "cannot prepare the package's folders");
  }
  PMSFaultPoint("staged");
  std::string error;
  const std::string id = info.getId();
  const int code = reader->ReadPayload(
      PackageFileReader::Payload::Extract, s->target,
      [&id](double f) { PMSSetProgress(id, f * 0.9); }, &error);
  if (code != PKG_OK) return Refuse(code, error);
  PMSFaultPoint("extracted");
  return PKG_OK;
}

int Installer::PlanDataCopy(const PackageInfo& info, const VolumeConfig& volume, uint64_t needed) {
  const std::string appdata = KIVORootPath(volume.path + "/@appdata");
  auto snapshot = std::make_unique<DataSnapshot>(appdata, id_, old_record_.substr(9));
  if (!info.getBool(kPMSDataCopyKey, true)) {
    op_->Log("no safety copy of the data: the package declares it needs none");
    return PKG_OK;
  }
  if (!KLIBCFileExist(snapshot->data_dir().c_str())) return PKG_OK;  // no data to copy
  if (!snapshot->IsValid()) return Refuse(PKG_ERR_INTERNAL, "cannot name the copy of the data");
  uint64_t room = 0;
  std::string problem;
  if (!PMSDataCopyRoom(appdata, snapshot->data_dir(), &room, &problem)) {
    return Refuse(PKG_ERR_DATA_NOT_COPYABLE,
                  "The data of " + id_ + " cannot be copied safely before the upgrade: " + problem +
                      ". Nothing was changed.");
  }
  VolumeConfig same;
  std::string text;
  if (room > 0 &&
      PMSChooseVolume(info, volume.path, needed + room, &same, &text) == PKG_ERR_NO_SPACE) {
    if (job_.source.choices.without_data_copy) {
      op_->Log("no safety copy of the data: " + volume.path + " has no room for its " + MiB(room) +
               " and " + job_.user +
               " chose to upgrade without one; a failed upgrade cannot bring the data back");
      return PKG_OK;
    }
    return Refuse(PKG_ERR_NO_ROOM_FOR_DATA_COPY,
                  "The upgrade of " + id_ + " needs " + MiB(room) +
                      " for a safety copy of its data besides " + MiB(needed) +
                      " for its files, and " + volume.path + " has " +
                      MiB(std::max<int64_t>(KIVOVolumeFreeBytes(volume), 0)) +
                      " free. Nothing was changed.");
  }
  snapshot_ = std::move(snapshot);
  return PKG_OK;
}

int Installer::RunScriptsAndPublish(const PackageInfo& info, Staging* s) {
  auto env = PMSScriptEnv(info, s->record, upgrade_ ? "upgrade" : "install", *op_, job_.wizard,
                          upgrade_ ? old_.getVersion() : "");
  int code = upgrade_ ? PrepareUpgrade(info, env, s) : PrepareInstall(env, s);
  if (code != PKG_OK) return code;
  PMSFaultPoint("before_publish");
  if (!PackageRegistry::Publish(info.getId(), ".records/" + s->record_name)) {
    return Refuse(PKG_ERR_INTERNAL, "cannot publish the package record");
  }
  published_ = true;
  PMSFaultPoint("published");
  if (PMSRunPackageScript(s->record, upgrade_ ? "postupgrade" : "postinst", "", env, *op_))
    return PKG_OK;
  // The new version failed its last step: put back what was there before.
  return upgrade_ ? RestoreAfterFailure(info, s, "failed in postupgrade")
                  : WithdrawInstall(info, s);
}

int Installer::PrepareInstall(const std::map<std::string, std::string>& env, Staging* s) {
  int code = SettleAccount(s);
  if (code != PKG_OK) return code;
  if (PMSRunPackageScript(s->record, "preinst", "", env, *op_)) return PKG_OK;
  return Refuse(PKG_ERR_SCRIPT_FAILED, "preinst failed");
}

int Installer::PrepareUpgrade(const PackageInfo& info,
                              const std::map<std::string, std::string>& env, Staging* s) {
  const std::string old_record = PackageRegistry::RecordDir(info.getId());
  if (was_running_ && !ControlRecord(old_record, old_, "stop", *op_)) {
    return Refuse(PKG_ERR_SCRIPT_FAILED,
                  old_.getVersion() + " did not stop; it stays installed and running");
  }
  // The data of the old version, stopped now, changes no more: its
  // snapshot is taken beside the settling of the account, which changes
  // nothing in the data before the snapshot is whole.
  if (was_running_) SnapshotOnAThread();
  const bool on_thread = snapshot_thread_.valid();
  int code = on_thread ? PKG_OK : TakeDataCopy();
  if (code != PKG_OK) return RestartOld(code);
  // Only now: the old version, stopped above, may have run as root.
  const int settled = SettleAccount(s, [this] { return SnapshotAllowsChanges(); });
  if (on_thread && (code = TakeDataCopy()) != PKG_OK) return RestartOld(code);
  if (settled != PKG_OK) return RestoreAfterFailure(info, s, *message_);
  if (PMSRunPackageScript(s->record, "preupgrade", "", env, *op_)) return PKG_OK;
  return RestoreAfterFailure(info, s, "failed in preupgrade");
}

int Installer::SettleAccount(Staging* s, const DataChangeGate& may_change) {
  std::string error;
  const int code = PMSSettlePackageAccount(id_, s->record, op_->log_path(), DataOwnership::kWhole,
                                           &error, may_change);
  s->fresh_account = !upgrade_;
  if (code == PKG_OK) return PKG_OK;
  op_->Log("account: " + error);
  return Refuse(code, "cannot give " + id_ + " an account of its own: " + error);
}

// A snapshot is one step, but one that waits for the file system to commit
// a transaction: about 2 ms whatever the data holds, several percent of a
// short upgrade. So it is taken on a thread of its own while this one goes
// on with work that changes nothing in the data folder: when the old
// version does not run, beside the unpacking of the new version (nothing
// changes the data from here on: the package's lock keeps every other
// operation out); when it runs, once it is stopped, beside the settling of
// the account, whose changes to the data wait for the snapshot. A copy
// file by file reports progress and stays in line.
void Installer::SnapshotOnAThread() {
  if (!snapshot_ || snapshot_thread_.valid() || !PMSCopiesBySnapshot(snapshot_->data_dir())) return;
  const DataSnapshot* copy = snapshot_.get();
  std::string* error = &thread_error_;
  try {
    snapshot_thread_ = std::async(std::launch::async, [copy, error] {
                         return PMSTakeSnapshot(*copy, error);
                       }).share();
  } catch (const std::system_error&) {
    // No thread to spare: TakeDataCopy takes the snapshot in line.
  }
}

bool Installer::SnapshotAllowsChanges() {
  return !snapshot_thread_.valid() || snapshot_thread_.get() == TreeCopyResult::kCopied;
}

void Installer::DropEarlySnapshot() {
  if (!snapshot_thread_.valid() || snapshot_thread_.get() != TreeCopyResult::kCopied) return;
  if (!PMSDiscardSnapshot(*snapshot_))
    op_->Log("the copy of the data taken before the unpacking failed stays: " + snapshot_->copy());
}

int Installer::TakeDataCopy() {
  if (!snapshot_) return PKG_OK;
  std::string error;
  const std::string what = "The data of " + id_;
  const bool on_thread = snapshot_thread_.valid();
  const TreeCopyResult result =
      on_thread ? snapshot_thread_.get() : PMSTakeSnapshot(*snapshot_, &error);
  if (on_thread) error = thread_error_;
  switch (result) {
    case TreeCopyResult::kCopied:
      copy_taken_ = true;
      PMSFaultPoint("snapshot_taken");
      return PKG_OK;
    case TreeCopyResult::kNoSpace:
      return Refuse(PKG_ERR_NO_ROOM_FOR_DATA_COPY, "The volume filled up while the data of " + id_ +
                                                       " was copied before the upgrade (" + error +
                                                       ").");
    case TreeCopyResult::kRefused:
      return Refuse(PKG_ERR_DATA_NOT_COPYABLE,
                    what + " cannot be copied safely before the upgrade: " + error + ".");
    case TreeCopyResult::kFailed:
      break;
  }
  return Refuse(PKG_ERR_INTERNAL, what + " could not be copied before the upgrade: " + error + ".");
}

int Installer::RestartOld(int code) {
  const std::string old = old_.getVersion();
  if (!was_running_) {
    *message_ += " Nothing was changed.";
  } else if (ControlRecord(PackageRegistry::RecordDir(id_), old_, "start", *op_)) {
    *message_ += " Nothing was changed; " + old + " runs again.";
  } else {
    *message_ += " Nothing was changed, but " + old + " did not start again.";
  }
  return code;
}

int Installer::RestoreAfterFailure(const PackageInfo& info, Staging* s,
                                   const std::string& failure) {
  const std::string head = "The upgrade to " + info.getVersion() + " " + failure;
  // Read before the data folder, which holds the log, is put back.
  const std::string log = PackageLogTail(id_);
  std::string state;
  bool whole = false;
  if (new_started_ && !ControlRecord(s->record, info, "stop", *op_) && PMSIsRunning(id_, info)) {
    state = info.getVersion() + " did not stop: it stays installed and running with the data it " +
            "changed" +
            (copy_taken_ ? "; " + old_.getVersion() +
                               " and the copy of its data are kept, and the next package "
                               "operation puts them back once " +
                               info.getVersion() + " stops"
                         : "");
  } else {
    whole = PutOldBack(info, &state);
  }
  // The new version's folders stay exactly when it is still the one
  // published: the published name must never lead nowhere.
  s->committed = PackageRegistry::PublishedRecord(id_) == ".records/" + s->record_name;
  *message_ = head + (whole ? "; " : ", and ") + state + "." + log;
  return whole ? PKG_ERR_UPGRADE_ROLLED_BACK : PKG_ERR_SCRIPT_FAILED;
}

bool Installer::PutOldBack(const PackageInfo& info, std::string* state) {
  const std::string old = old_.getVersion();
  bool whole = false;
  if (copy_taken_) {
    std::string error;
    RestoreState restored = PMSRestoreSnapshot(*snapshot_, &error);
    whole = restored == RestoreState::kRestored;
    *state =
        whole ? old + " and its data were restored" : PartialRestoreText(restored, error, info);
  } else if (published_ && !PackageRegistry::Publish(id_, old_record_)) {
    *state = old + " could not be put back (" + strerror(errno) + "): " + info.getVersion() +
             " stays installed";
  } else {
    whole = true;
    *state = old + (published_ ? " was restored" : " stays installed") +
             (!info.getBool(kPMSDataCopyKey, true)
                  ? "; its data was not copied before the upgrade and stays as the upgrade left it"
                  : "");
  }
  if (whole && was_running_ &&
      !ControlRecord(PackageRegistry::RecordDir(id_), old_, "start", *op_)) {
    *state += ", but " + old + " did not start again";
  }
  return whole;
}

std::string Installer::PartialRestoreText(RestoreState restored, const std::string& error,
                                          const PackageInfo& info) {
  const std::string old = old_.getVersion(), now = info.getVersion();
  const std::string code = published_ ? now : old;  // the version published now
  switch (restored) {
    case RestoreState::kUntouched:
      return "putting " + old + "'s data back failed (" + error + "): " + code +
             " stays installed, stopped, with the data the upgrade changed; the copy of " + old +
             "'s data is kept, and the next package operation puts " + old + " back with it";
    case RestoreState::kDataAside:
      return "putting " + old + "'s data back failed half way (" + error + "): the data folder " +
             snapshot_->data_dir() + " is missing; the data the upgrade changed is in " +
             snapshot_->Named(".replaced") + ", the copy of " + old + "'s in " + snapshot_->copy() +
             ", and the next package operation puts " + old + " back with it";
    case RestoreState::kNotPublished:
      return old + "'s data is back, but its record could not be published again (" + error +
             "): " + now + " stays installed over " + old +
             "'s data, stopped, until the next package operation finishes the restore";
    default:
      return "the copy of " + old + "'s data could not be put back (" + error + "): " + code +
             " stays installed, stopped, with the data the upgrade changed";
  }
}

int Installer::WithdrawInstall(const PackageInfo& info, Staging* s) {
  if (!PackageRegistry::Unpublish(info.getId())) {
    s->committed = true;  // still published: its folders must stay
    return Refuse(PKG_ERR_SCRIPT_FAILED,
                  "postinst failed, and the package could not be withdrawn; it stays installed");
  }
  return Refuse(PKG_ERR_SCRIPT_FAILED, "postinst failed");
}

int Installer::Finish(const PackageInfo& info, Staging* s) {
  bool started = job_.run_after || was_running_;
  if (upgrade_) {
    int code = StartUpgraded(info, s);
    if (code != PKG_OK) return code;
    // The commit of the upgrade: from here on the new version stays.
    if (copy_taken_ && !ConfirmUpgrade(*s)) {
      return RestoreAfterFailure(info, s,
                                 std::string("could not be confirmed (") + strerror(errno) + ")");
    }
  } else if (job_.run_after && !ControlRecord(s->record, info, "start", *op_)) {
    op_->Log("installed, but the package did not start");
    started = false;
  }
  s->committed = true;
  if (started && !KIVOWriteFileAtomic(s->record + "/enabled", "", SyncToDisk::No)) {
    op_->Log("started, but cannot record that the package is meant to run");
  }
  // Unless it is kept, the old version's record and files are no longer
  // reachable; what cannot be removed now, the next operation's clean-up
  // removes.
  if (upgrade_ && !old_kept_ && !RemoveOldVersion()) {
    op_->Log("some files of the previous version stay");
  }
  if (upgrade_ && !PMSTrimRevisions(id_, PMSKeepRevisionsSetting())) {
    op_->Log("some earlier versions beyond keep_revisions stay until the next operation");
  }
  PMSFaultPoint("done");
  return PKG_OK;
}

int Installer::StartUpgraded(const PackageInfo& info, Staging* s) {
  if (!job_.run_after && !was_running_) return PKG_OK;
  new_started_ = true;
  if (!ControlRecord(s->record, info, "start", *op_)) {
    return RestoreAfterFailure(info, s, "did not start (its start script failed)");
  }
  auto env = PMSScriptEnv(info, s->record, "upgrade", *op_, job_.wizard, old_.getVersion());
  HealthVerdict verdict = PMSHealthGate(id_, info, s->record, env, *op_);
  if (verdict == HealthVerdict::kHealthy) return PKG_OK;
  return RestoreAfterFailure(info, s, PMSHealthVerdictText(verdict, PMSHealthLimits(info)));
}

bool Installer::ConfirmUpgrade(const Staging& s) {
  const bool keep = PMSKeepRevisionsSetting() > 0;
  // REPLACED before the commit: a kept revision the clean-up finishes
  // needs it.
  if (keep && !PMSMarkReplaced(*snapshot_)) return false;
  if (!PMSConfirmUpgrade(*snapshot_, s.record)) return false;
  PMSFaultPoint("confirmed");
  // From here on the new version stays: a rename lost in a crash is
  // finished by the clean-up.
  if (!keep) {
    if (!PMSDiscardSnapshot(*snapshot_, PMSRenameSync::kWithTheVolume))
      op_->Log("the copy of the data stays until the next operation: " + snapshot_->copy());
    return true;
  }
  // The old version's record and payload stay with it either way.
  old_kept_ = true;
  if (PMSRenameCopy(snapshot_->copy(), snapshot_->Named(kPMSKeptSuffix),
                    PMSRenameSync::kWithTheVolume)) {
    op_->Log(old_.getVersion() + " and its data are kept: a rollback returns to them");
  } else {
    op_->Log(old_.getVersion() + " and its data are kept from the next operation on (" +
             strerror(errno) + ")");
  }
  return true;
}

bool Installer::RemoveOldVersion() {
  bool ok =
      PMSRemoveTree(PackageRegistry::RecordsDir(), PackageRegistry::Dir() + "/" + old_record_);
  const std::string& target = old_.getTarget();
  if (!target.empty()) ok &= PMSRemoveTree(PMSVolumeFolderHolding(target, "@appstore"), target);
  return ok;
}

int Installer::Run() {
  PackageFileReader reader;
  std::string error;
  int code = reader.Open(job_.path, &error);
  if (code != PKG_OK) return Refuse(code, error);
  PackageInfo info;
  InfoFromHeader(job_.path, reader.header(), PKG_OP_NONE, nullptr, &info);
  // The id names folders and the registry entry: it is checked here even
  // though the package file's reader checks it too.
  if (!PMSIsValidPackageId(info.getId())) {
    return Refuse(PKG_ERR_BAD_ID, "the package id is not valid");
  }
  id_ = info.getId();
  code = CheckVersions(info);
  op_.reset(new Operation(upgrade_ ? "upgrade" : "install", info.getId()));
  if (code != PKG_OK) return code;
  if ((code = PMSCheckPackageFits(info, PKG_ERR_NOT_SUPPORTED, message_, details_)) != PKG_OK)
    return code;
  // Not checking the signature is the administrator's confirmation of its
  // warning, never a way past the trust level.
  SignatureSeen seen;
  code = SignatureVerdict(reader.header(), SourceKeys(),
                          job_.check_codesign ? SignatureConfirmed::No : SignatureConfirmed::Yes,
                          message_, &signature_note_, &seen);
  op_->Log("signature: " + signature_note_);
  // Whatever the trust level let through, root needs the keyring's key.
  const int root = PMSCheckRootSigner(info, seen.outcome, seen.voucher, message_);
  if (root != PKG_OK) {
    op_->Log("root: " + *message_);
    return root;
  }
  if (code != PKG_OK) return code;
  code = CheckOrigin(seen);
  if (code != PKG_OK) return code;
  Staging staging;
  if ((code = Stage(&reader, info, &staging)) != PKG_OK) return code;
  if ((code = RunScriptsAndPublish(info, &staging)) != PKG_OK) return code;
  code = Finish(info, &staging);
  (*details_)["installReboot"] = info.getBool("install_reboot");
  return code;
}

void Installer::Report() {
  if (!id_.empty()) PMSClearProgress(id_);
  if (!op_) return;
  // Worker messages are only what the package's scripts told the user; the
  // signature's outcome has a member of its own (and a line in the log).
  (*details_)["workerMessage"] = op_->WorkerMessages();
  if (!signature_note_.empty()) (*details_)["signature"] = signature_note_;
  std::string log = PMSReadPackageLog(op_->log_path());
  if (!log.empty()) *message_ += (message_->empty() ? "" : "\n") + log;
  unlink(op_->log_path().c_str());
}

// The record of a package file; with the wizard, the install wizard (or the
// upgrade wizard when the package is installed) in `language`. A file with a
// member that does not match MANIFEST is still described when its INFO could
// be read, with 289 as the result: the signature check judges it.
int QueryFile(const std::string& path, PackageInfo& info, bool with_wizard, const char* language) {
  PackageFileReader reader;
  std::string error;
  int result = reader.Open(path, &error);
  const bool describable = result == PKG_ERR_BAD_SIGNATURE && !reader.header().info.empty();
  if (result != PKG_OK && !describable) return result;
  PKG_INSTALLATION_TYPE wizard = PKG_OP_NONE;
  if (with_wizard) {
    bool installed = PackageRegistry::IsInstalled(PackageInfo(reader.header().info).getId());
    wizard = installed ? PKG_OP_UPGRADE : PKG_OP_INSTALL;
  }
  InfoFromHeader(path, reader.header(), wizard, language, &info);
  return result;
}

// A package file whose whole payload passed the check is remembered by
// its identity (path, inode, size, modification time, MANIFEST digest), so
// that the install right after an upload does not unpack it once more just
// to look. The install's extraction checks every entry and the digest again.
std::string CheckedMarker(const std::string& path, const PackageFileHeader& header) {
  struct stat st;
  if (stat(path.c_str(), &st) != 0) return "";
  std::string identity = path + "\n" + std::to_string(st.st_ino) + " " +
                         std::to_string(st.st_size) + " " + std::to_string(st.st_mtim.tv_sec) +
                         "." + std::to_string(st.st_mtim.tv_nsec) + " " +
                         PMSSha256Hex(header.manifest);
  return KIVORootPath("/run/kivo/pkgtool/checked/") + PMSSha256Hex(identity);
}

bool PayloadCheckedBefore(const std::string& marker) {
  return !marker.empty() && access(marker.c_str(), F_OK) == 0;
}

void RememberChecked(const std::string& marker) {
  if (marker.empty()) return;
  std::string dir = marker.substr(0, marker.rfind('/'));
  if (KIVOFSMkdirP(dir.c_str()) != 0) return;
  KIVORemoveFilesOlderThan(dir, "", 24 * 3600);
  // The marker only saves the install a second look at the payload: without
  // it the install checks the payload once more.
  static_cast<void>(KIVOWriteFileAtomic(marker, "", SyncToDisk::No));
}

bool CheckFile(const char* language, const std::string& path, std::string& message,
               PKG_ERRCODE& code, Json::Value& details, PackageInfo& info) {
  PackageFileReader reader;
  int result = reader.Open(path, &message);
  if (result == PKG_OK) {
    bool installed = PackageRegistry::IsInstalled(PackageInfo(reader.header().info).getId());
    InfoFromHeader(path, reader.header(), installed ? PKG_OP_UPGRADE : PKG_OP_INSTALL, language,
                   &info);
    std::string marker = CheckedMarker(path, reader.header());
    if (!PayloadCheckedBefore(marker)) {
      result = reader.ReadPayload(PackageFileReader::Payload::Check, "", nullptr, &message);
      if (result == PKG_OK) RememberChecked(marker);
    }
  }
  if (result == PKG_OK) result = PMSCheckPackageFits(info, PKG_ERR_ARCH, &message, &details);
  if (result == PKG_OK) {
    VolumeConfig volume;
    result = PMSChooseVolume(info, "", PMSNeededBytes(info, reader.header().payload_size), &volume,
                             &message);
  }
  // The signature comes last, so that a package that cannot be installed
  // says why before it says who signed it. A package that asks for root
  // and lacks the keyring's signature is refused outright: no confirmation
  // could let it through later, so the check does not offer one.
  if (result == PKG_OK) {
    std::string who;
    SignatureSeen seen;
    result =
        SignatureVerdict(reader.header(), nullptr, SignatureConfirmed::No, &message, &who, &seen);
    details["signature"] = who;
    const int root = PMSCheckRootSigner(info, seen.outcome, seen.voucher, &message);
    if (root != PKG_OK) result = root;
  }
  code = static_cast<PKG_ERRCODE>(result);
  return result == PKG_OK;
}

bool InstallFile(const std::string& user, const std::string& path, const std::string& volume,
                 int reserved, const std::string& extraValues, bool typeFlag,
                 const std::string& language, std::string& message, PKG_ERRCODE& code,
                 Json::Value& details, bool force, bool checkCodesign,
                 const PMSInstallSource* source) {
  const PMSInstallSource from = source ? *source : PMSInstallSource();
  InstallJob job{path, volume, user, language, Json::Value(), typeFlag, force, checkCodesign, from};
  details = Json::Value(Json::objectValue);
  details["workerMessage"] = Json::Value(Json::arrayValue);
  if (!extraValues.empty() && !KIVOParseJson(extraValues, &job.wizard)) {
    code = PKG_ERR_BAD_WIZARD_VALUES;
    message = "the wizard values are not valid JSON";
    return false;
  }
  PackageManager lock_holder;
  if (!lock_holder.ExLock(PMSLockWaitSeconds())) {
    code = PKG_ERR_BUSY;
    message = PMSResultText(PKG_ERR_BUSY);
    return false;
  }
  bool recovered = PMSRecoverLeftovers();
  Installer installer(job, &message, &details);
  int result = installer.Run();
  installer.Report();
  if (!recovered) {
    message += std::string(message.empty() ? "" : "\n") +
               "some leftovers of earlier operations could not be removed";
  }
  code = static_cast<PKG_ERRCODE>(result);
  return result == PKG_OK;
}

const PackageFileOps kOps = {QueryFile, CheckFile, InstallFile};

}  // namespace

extern "C" __attribute__((visibility("default"))) const PackageFileOps* KivoPackageFileOps() {
  return &kOps;
}
