// Result codes of the package tool (PackageManager::getResult and the
// operations' error codes). docs/package-tool.md gives each its meaning.
#pragma once

enum PKG_RESULT {
  PKG_RESULT_OK = 0,
  PKG_RESULT_BROKEN = 150,
  PKG_RESULT_NOT_INSTALLED = 255,
  PKG_RESULT_NA = 256,
  PKG_RESULT_BROKEN_RECORD = 258,
  PKG_RESULT_VERSION_LIMIT = 259,
  PKG_RESULT_BAD_ID = 262,
  PKG_RESULT_REGISTRY = 263,
};
