#include "tools/kivoctl/confine_command.h"

#include <iostream>

#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"
#include "pkgtool/package_cgroup.h"
#include "pkgtool/package_confinement.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/pms.h"
#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"

namespace {

int Fail(const std::string& message, int code) {
  std::cerr << "kivoctl: " << message << " [" << code << "]\n";
  return 1;
}

}  // namespace

int KivoctlConfine(const std::vector<std::string>& args) {
  if (args.size() != 1) {
    std::cerr << "kivoctl: confine takes one package id\n";
    return 2;
  }
  const std::string& id = args[0];
  if (!PMSIsValidPackageId(id))
    return Fail(PMSResultText(PKG_ERR_NOT_INSTALLED), PKG_ERR_NOT_INSTALLED);
  // The accounts and the record change: under the tool's lock, as every
  // changing operation.
  PackageManager pm;
  if (!pm.ExLock(PMSLockWaitSeconds())) return Fail(PMSResultText(PKG_ERR_BUSY), PKG_ERR_BUSY);
  if (!PackageRegistry::IsInstalled(id)) {
    return Fail(id + ": " + PMSResultText(PKG_ERR_NOT_INSTALLED), PKG_ERR_NOT_INSTALLED);
  }
  std::string error;
  const int code = PMSSettlePackageAccount(id, PackageRegistry::RecordDir(id), "",
                                           DataOwnership::kWhole, &error);
  if (code != PKG_OK) return Fail(id + ": " + PMSResultText(code) + ": " + error, code);
  std::string record;
  if (!KIVOReadFile(PackageRegistry::RecordDir(id) + "/" + kPMSConfinementFile, &record, 1 << 16)) {
    return Fail(id + ": the confinement record cannot be read", PKG_ERR_INTERNAL);
  }
  std::cout << record;
  return 0;
}

int KivoctlDropGroups(const std::vector<std::string>& args) {
  if (!args.empty()) {
    std::cerr << "kivoctl: drop-groups takes no argument\n";
    return 2;
  }
  const std::string root = KIVOSysRoot();
  if (root.empty() || root == "/") {
    std::cerr << "kivoctl: drop-groups is for a root about to be removed (--root DIR), never "
                 "the running system\n";
    return 2;
  }
  std::string problem;
  if (!PackageCgroupRemoveRoot(root, &problem)) {
    std::cerr << "kivoctl: " << problem << "\n";
    return 1;
  }
  return 0;
}
