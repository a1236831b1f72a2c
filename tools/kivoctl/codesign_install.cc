#include "tools/kivoctl/codesign_install.h"

#include "codesign_script.h"
#include "klibc/atomic_file.h"

bool KIVOInstallCodesignScript(const std::string& dir, std::string* error) {
  const std::string path = dir + "/usr/kivo/bin/codesign.php";
  // Always rewritten, so a root made by an older kivoctl gets the script
  // that this build's module expects.
  if (!KIVOWriteFileAtomic(path, kCodesignScript, SyncToDisk::No, 0755)) {
    *error = "cannot write " + path;
    return false;
  }
  return true;
}
