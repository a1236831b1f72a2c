#include "pkgtool/result_codes.h"

const char* PMSResultText(int code) {
  switch (code) {
    case PKG_OK:
      return "success";
    case PKG_ERR_SIGNATURE_UNCHECKABLE:
      return "the signature could not be checked";
    case PKG_ERR_NOT_INSTALLED:
      return "the package is not installed";
    case PKG_ERR_STATUS_UNKNOWN:
      return "the package's status is unknown";
    case PKG_ERR_BROKEN:
      return "the package is broken";
    case PKG_ERR_VERSION_LIMIT:
      return "a needed package's version is not accepted";
    case PKG_ERR_SERVICE_NOT_RUNNING:
      return "a required service is not running";
    case PKG_ERR_NOT_PACKAGE_FILE:
      return "not a package file";
    case PKG_ERR_BAD_ID:
      return "invalid package id";
    case PKG_ERR_REGISTRY:
      return "the package registry cannot be read";
    case PKG_ERR_NOT_SUPPORTED:
      return "the package is not supported on this device";
    case PKG_ERR_BUILTIN:
      return "the package is built in";
    case PKG_ERR_NOT_NEWER:
      return "the same or a newer version is installed";
    case PKG_ERR_DEPENDENCY:
      return "a needed package is missing or stopped, or others need this one";
    case PKG_ERR_DEPENDENTS_RUNNING:
      return "running packages depend on this package";
    case PKG_ERR_BAD_WIZARD_VALUES:
      return "the wizard values are not valid JSON";
    case PKG_ERR_SCRIPT_FAILED:
      return "a package script failed";
    case PKG_ERR_BUSY:
      return "another package operation is running";
    case PKG_ERR_EXTRACT:
      return "the package's files could not be extracted";
    case PKG_ERR_HOSTILE_MEMBER:
      return "the package holds a member that is not allowed";
    case PKG_ERR_INTERNAL:
      return "internal error of the package tool";
    case PKG_ERR_NO_SPACE:
      return "not enough space";
    case PKG_ERR_ARCH:
      return "the package is not made for this device";
    case PKG_ERR_PORT_IN_USE:
      return "the package's port is in use";
    case PKG_ERR_CONFLICT:
      return "a conflicting package is installed";
    case PKG_ERR_NO_TMP:
      return "no temporary space";
    case PKG_ERR_NO_SIGNATURE:
      return "the package is not signed";
    case PKG_ERR_BAD_SIGNATURE:
      return "the package's signature is bad";
    case PKG_ERR_UNKNOWN_SIGNER:
      return "the package is signed by an unknown key";
    case PKG_ERR_EXPIRED_KEY:
      return "the package is signed by an expired key";
    case PKG_ERR_REVOKED_KEY:
      return "the package is signed by a revoked key";
    case PKG_ERR_FORMAT_VERSION:
      return "the package format is newer than this tool";
    case PKG_ERR_VOLUME_CRASHED:
      return "the volume is crashed";
    case PKG_ERR_NO_VOLUME:
      return "no usable volume";
    case PKG_ERR_OS_TOO_NEW:
      return "the OS version is too high for the package";
    case PKG_ERR_OS_TOO_OLD:
      return "the OS version is too low for the package";
    case PKG_ERR_CANCELLED:
      return "the operation was cancelled";
    case PKG_ERR_UPGRADE_ROLLED_BACK:
      return "the upgrade failed; the previous version was restored";
    case PKG_ERR_OTHER_ORIGIN:
      return "the package was installed from another source or signed by another key";
    case PKG_ERR_NO_ROOM_FOR_DATA_COPY:
      return "not enough space for a safety copy of the package's data";
    case PKG_ERR_DATA_NOT_COPYABLE:
      return "the package's data cannot be copied safely";
    case PKG_ERR_NO_REVISION:
      return "no earlier version of the package is kept";
    case PKG_ERR_NO_ACCOUNT_ID:
      return "no free account id is left for the package in the range of pkgtool.conf";
    case PKG_ERR_ACCOUNT_FILES:
      return "the package's account cannot be written to the accounts files";
    case PKG_ERR_LIMIT_ABOVE_BOUND:
      return "the package asks for more memory or processes than this appliance allows";
    case PKG_ERR_ROOT_NOT_TRUSTED:
      return "the package asks to run as root and is not signed by a key of the appliance keyring";
    case PKG_ERR_CRASHED:
      return "the package kept stopping; the watchdog stopped restarting it";
    case PKG_ERR_WATCHDOG_SETTINGS:
      return "the watchdog's settings are not valid";
  }
  return "unknown result";
}
