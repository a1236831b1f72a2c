// The answer codes of the package center's web API module, one name each.
// docs/error-codes.md gives every code its meaning and what its "errors"
// hold; the package tool's own result codes are PKG_ERR_* of
// pkgtool/result_codes.h, and the module's tables map those onto these.
#pragma once

#include <cstddef>

#include "webapi/api_upload.h"

namespace KIVO_PACKAGE {

enum ApiError : int {
  kErrUploadNotStored = 108,  // the posted file could not be received
  kErrBadParameter = 4500,    // a parameter fault found by a handler
  kErrFailed = 4501,          // a general failure, or a method not built yet
  kErrNoVolume = 4502,        // no room or no usable volume
  kErrNoTmpDir = 4503,        // no temporary folder can be made
  kErrNoRoomOnVolume = 4504,  // the install volume lacks room for the package
  kErrVolumeUnusable = 4505,  // the install volume is crashed or missing
  kErrInstallRunning = 4506,  // an install under way is not cancelled
  kErrNoSpace = 4520,         // no space for the upload or the install
  kErrNotPackageFile = 4521,  // not a readable package file
  kErrBadPackageFile = 4522,  // the package file's check found it is no package
  kErrConflict = 4524,
  kErrServiceNotRunning = 4525,
  kErrDependencyMissing = 4526,  // a needed package is not installed or not running
  kErrPortInUse = 4527,
  kErrNotSupported = 4528,  // architecture or device kind
  kErrUnsafeMember = 4529,  // the package file's check found a hostile member
  kErrBusy = 4530,          // another package operation holds the package tool
  kErrNoSignature = 4531,
  kErrBadSignature = 4532,  // bad signature, or a member that does not match MANIFEST
  kErrUnknownSigner = 4533,
  kErrExpiredKey = 4534,
  kErrRevokedKey = 4535,
  kErrOsTooNew = 4537,
  kErrOsTooOld = 4538,
  kErrExtractFailed = 4540,
  kErrUnsafePayload = 4541,  // the install found a hostile member
  kErrUpgradeRolledBack = 4542,
  kErrOtherOrigin = 4543,  // an upgrade from another origin or signer than the installed one's
  kErrBadWizardValues = 4544,
  kErrInstallNotInstalled = 4545,  // an installed package was expected
  kErrNotNewer = 4546,
  kErrInstallDependency = 4547,
  kErrVersionLimit = 4548,
  kErrScriptFailed = 4549,
  kErrCancelled = 4550,
  kErrDependentsRunning = 4552,
  kErrNoRoomForDataCopy = 4553,  // no room for the safety copy an upgrade takes of the data
  kErrDataNotCopyable = 4554,    // the data holds what a safety copy cannot hold
  kErrNotFeasible = 4556,
  kErrUninstallFailed = 4560,
  kErrUninstallBadValues = 4561,
  kErrUninstallDependents = 4562,
  kErrStartFailed = 4580,
  kErrStopFailed = 4581,
  kErrStopDependents = 4582,
  kErrStartVersionLimit = 4583,
  kErrStartDependency = 4584,
  kErrImageNotFound = 4586,      // no such screenshot, installed or on the server
  kErrFeedNotServer = 4590,      // the feed does not answer as a package server
  kErrFeedExists = 4591,         // the feed address is already in the list
  kErrKeyUnreadable = 4592,      // the uploaded key file cannot be read
  kErrKeyNotPublic = 4593,       // the file holds no OpenPGP public key
  kErrKeySecret = 4594,          // the file holds a secret key
  kErrKeyringUnwritable = 4595,  // the appliance keyring cannot be written
  // INFO memory_limit_mb or process_limit above the appliance's bound
  kErrLimitAboveBound = 4615,
  // a package that asks to run as root, not signed by a key of the appliance keyring
  kErrRootNotTrusted = 4620,
  // no free id for the package's own account in pkgtool.conf's range
  kErrNoAccountId = 4645,
  // the appliance's account files cannot be read, locked or written
  kErrAccountFiles = 4646,
};

// One row of a table that maps a code of something the module calls onto
// an answer: a package-tool result (PKG_ERR_*), the platform's last error
// (KLIBC_ERR_*), the code-signing script's exit status.
struct ToolCodeMapping {
  int tool;
  int error;  // ApiError
};

// The answer for `tool` in `table`, or kErrFailed when the table has no row
// for it.
template <size_t N>
int MapToolCode(const ToolCodeMapping (&table)[N], int tool) {
  for (const ToolCodeMapping& row : table) {
    if (row.tool == tool) return row.error;
  }
  return kErrFailed;
}

// The answer for a result of APIUpload::GetUploadFile or
// KIVOCreateUploadFile other than UPLOAD_OK.
inline int UploadError(int result) {
  switch (result) {
    case UPLOAD_NO_VOLUME:
      return kErrNoVolume;
    case UPLOAD_NO_TMP_DIR:
      return kErrNoTmpDir;
    case UPLOAD_NO_SPACE:
    case UPLOAD_TOO_LARGE:
      return kErrNoSpace;
    default:
      return kErrUploadNotStored;
  }
}

}  // namespace KIVO_PACKAGE
