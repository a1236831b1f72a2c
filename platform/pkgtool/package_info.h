// PackageInfo: the package tool's record of one package, read from an
// installed package, a package file or a package server. Its fields are the
// INFO keys of docs/package-format.md, plus what the tool learned reading it.
#pragma once

#include <cstdint>
#include <string>

#include <json/value.h>

#include "klibc/key_value_file.h"
#include "pkgtool/dependency.h"

// Which operation a package's wizard pages or a package operation belong to.
enum PKG_INSTALLATION_TYPE {
  PKG_OP_NONE = 0,
  PKG_OP_INSTALL = 1,
  PKG_OP_UPGRADE = 2,
  PKG_OP_UNINSTALL = 4,
  PKG_OP_START = 8,
  PKG_OP_STOP = 16,
};

// The wizard file of each operation, as a member name of the package
// ("WIZARD_UIFILES/install_uifile"); language variants add "_<lang>".
struct PMSWizardFile {
  const char* member;
  PKG_INSTALLATION_TYPE op;
};
extern const PMSWizardFile kPMSWizardFiles[3];
// The member of `op`'s wizard; the install wizard's for anything else.
const char* PMSWizardMember(int op);

class PackageInfo {
 public:
  PackageInfo() = default;
  explicit PackageInfo(KeyValueMap info) : info_(std::move(info)) {}

  // The raw INFO value of `key`, "" when absent.
  std::string get(const std::string& key) const;
  // "yes"/"true"/"1" (any case) are true; absent is `def`.
  bool getBool(const std::string& key, bool def = false) const;
  // The value of `key` for `language` ("key_<lang>"), else the plain key.
  std::string getLocalized(const std::string& key, const std::string& language) const;
  const KeyValueMap& all() const { return info_; }
  void set(const std::string& key, const std::string& value) { info_[key] = value; }

  std::string getId() const { return get("package"); }
  std::string getVersion() const { return get("version"); }
  std::string getDisplayName(const std::string& language) const;
  std::string getDescription(const std::string& language) const {
    return getLocalized("description", language);
  }
  bool isBeta() const { return getBool("beta"); }
  bool isStartable() const { return getBool("startable", true); }
  int getAdminPort() const;
  DepPkgVector getDependencies() const;
  DepPkgVector getConflicts() const;
  std::string getServiceString() const { return get("install_dep_services"); }

  // The interface language the record was read in ("enu" when not given);
  // the display name and description follow it.
  const std::string& getLanguage() const { return language_; }
  void setLanguage(const std::string& language) { language_ = language.empty() ? "enu" : language; }
  std::string getDisplayName() const { return getDisplayName(language_); }
  std::string getDescription() const { return getDescription(language_); }

  // Where the record came from: the package file, or the installed target.
  const std::string& getFilePath() const { return file_path_; }
  void setFilePath(const std::string& path) { file_path_ = path; }
  const std::string& getTarget() const { return target_; }
  void setTarget(const std::string& target) { target_ = target; }

  // The end-user licence text ("" when none).
  const std::string& getLicense() const { return license_; }
  void setLicense(const std::string& text) { license_ = text; }
  // The package file's release notes, CHANGELOG ("" when none; release_notes.h).
  const std::string& getReleaseNotes() const { return release_notes_; }
  void setReleaseNotes(const std::string& text) { release_notes_ = text; }
  // The loaded wizard description of one operation (null when none loaded).
  const Json::Value& getUIFile() const { return ui_file_; }
  void setUIFile(const Json::Value& ui) { ui_file_ = ui; }
  // Which wizards the package has, whether loaded or not.
  bool hasWizard(PKG_INSTALLATION_TYPE op) const;
  void setWizardMask(unsigned mask) { wizard_mask_ = mask; }

 private:
  KeyValueMap info_;
  std::string language_ = "enu";
  std::string file_path_;
  std::string target_;
  std::string license_;
  std::string release_notes_;
  Json::Value ui_file_;
  unsigned wizard_mask_ = 0;
};

// The INFO keys a package must have and the form of every field that
// becomes a path, a registry name, an environment value or a number: the
// checks `kivoctl build` makes and the package-file reader repeats. Returns
// "" when `info` is acceptable, else what is wrong, for the author; `*field`
// (when given) gets the key at fault.
std::string PMSCheckInfo(const KeyValueMap& info, std::string* field = nullptr);
