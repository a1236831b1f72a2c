// Result codes of the package tool: PackageManager::getResult, the PKG_ERRCODE
// of package file checks and installs, and the operations of `kivoctl`.
// docs/package-tool.md gives each its meaning and where it comes from.
#pragma once

enum PKG_ERRCODE {
  PKG_OK = 0,
  PKG_ERR_SIGNATURE_UNCHECKABLE = 150,  // the signature could not be checked at all
  PKG_ERR_NOT_INSTALLED = 255,
  PKG_ERR_STATUS_UNKNOWN = 256,
  PKG_ERR_BROKEN = 258,         // record or installed files damaged
  PKG_ERR_VERSION_LIMIT = 259,  // a dependency's version does not satisfy the package
  PKG_ERR_SERVICE_NOT_RUNNING = 260,
  PKG_ERR_NOT_PACKAGE_FILE = 261,
  PKG_ERR_BAD_ID = 262,
  PKG_ERR_REGISTRY = 263,
  PKG_ERR_NOT_SUPPORTED = 264,  // architecture or device kind (install, status)
  PKG_ERR_BUILTIN = 265,
  PKG_ERR_NOT_NEWER = 267,   // same or newer version installed
  PKG_ERR_DEPENDENCY = 268,  // needed package missing or stopped; dependents (uninstall)
  PKG_ERR_DEPENDENTS_RUNNING = 269,
  PKG_ERR_BAD_WIZARD_VALUES = 270,
  PKG_ERR_SCRIPT_FAILED = 274,
  PKG_ERR_BUSY = 275,            // another package operation holds the lock
  PKG_ERR_EXTRACT = 276,         // the payload could not be extracted
  PKG_ERR_HOSTILE_MEMBER = 277,  // a member escapes its folder, a device node, setuid...
  PKG_ERR_INTERNAL = 278,
  PKG_ERR_NO_SPACE = 279,
  PKG_ERR_ARCH = 281,  // architecture or device kind (package file check)
  PKG_ERR_PORT_IN_USE = 283,
  PKG_ERR_CONFLICT = 284,
  PKG_ERR_NO_TMP = 285,
  PKG_ERR_NO_SIGNATURE = 288,
  PKG_ERR_BAD_SIGNATURE = 289,
  PKG_ERR_UNKNOWN_SIGNER = 290,
  PKG_ERR_EXPIRED_KEY = 291,
  PKG_ERR_REVOKED_KEY = 292,
  PKG_ERR_FORMAT_VERSION = 293,  // a package format newer than this tool
  PKG_ERR_VOLUME_CRASHED = 296,
  PKG_ERR_NO_VOLUME = 297,
  PKG_ERR_OS_TOO_NEW = 302,  // the OS is above the package's os_max_ver
  PKG_ERR_OS_TOO_OLD = 303,  // the OS is below the package's os_min_ver
  PKG_ERR_CANCELLED = 304,
  PKG_ERR_UPGRADE_ROLLED_BACK = 305,
  // an upgrade from another source, or signed by another key, than the
  // installed version's, without the administrator switching its origin
  PKG_ERR_OTHER_ORIGIN = 306,
  // an upgrade whose safety copy of the package's data does not fit on the volume
  PKG_ERR_NO_ROOM_FOR_DATA_COPY = 307,
  // an upgrade whose package data holds what cannot be copied safely (a
  // fifo, a socket, a device, an unreadable file, a symlink leading out)
  PKG_ERR_DATA_NOT_COPYABLE = 308,
  // a rollback, or the removal of a kept version, when no earlier version
  // of the package is kept
  PKG_ERR_NO_REVISION = 309,
  // no free id for the package's own account in the range of pkgtool.conf
  // (package_uid_first to package_uid_last)
  PKG_ERR_NO_ACCOUNT_ID = 310,
  // the root's account files (etc/passwd, etc/group) cannot be read,
  // locked or written for the package's own account
  PKG_ERR_ACCOUNT_FILES = 311,
  // INFO memory_limit_mb or process_limit above the appliance's bound
  // (etc/kivo/pkgtool.conf)
  PKG_ERR_LIMIT_ABOVE_BOUND = 315,
  // a package that asks to run as root (INFO run_as_root) without a
  // signature by a key of the appliance keyring
  PKG_ERR_ROOT_NOT_TRUSTED = 320,
  // the watchdog gave up restarting a package that kept dying (watchdog_record.h)
  PKG_ERR_CRASHED = 330,
  // etc/kivo/watchdog.conf breaks a rule (watchdog_record.h)
  PKG_ERR_WATCHDOG_SETTINGS = 331,
};

// A short English text for a code, for logs and the command line.
const char* PMSResultText(int code);
