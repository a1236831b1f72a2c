// Each installed package has a system account of its own, which its scripts
// and its service run as (package_confinement.h). The account lives in the
// system root's etc/passwd and etc/group, with a group of the same name and
// id, and is known as the package's by its comment field
// "kivo package <id>". Its id comes from the range "package_uid_first" to
// "package_uid_last" of etc/kivo/pkgtool.conf (30000 to 39999 by default).
//
// Names. A package id has up to 64 characters of A-Z a-z 0-9 . _ + -; an
// account name at most 32 of a-z 0-9 _ . - (klibc/account_name.h). An id of
// lower-case letters, digits, ".", "_" and "-" of up to 28 characters is
// named "pkg-<id>". Any other id (longer, with capitals or "+") is named
// "pkg-<stem>-<hash>": <stem> its first 17 characters in lower case with
// "+" as "_", <hash> 10 hex digits of the FNV-1a hash of the whole id, so
// "Demo" and "demo" get different names. When a name is taken by another
// account (an administrator's, or another package's), the next try hashes
// "<id>#1", "<id>#2", ... instead, up to 99 tries.
#pragma once

#include <functional>
#include <string>
#include <sys/types.h>

struct PackageAccount {
  std::string name;
  uid_t uid = 0;
  gid_t gid = 0;
};

// The account name of package `id` (valid: registry.h) at try `attempt`
// (0 first; see above).
std::string PMSPackageAccountName(const std::string& id, int attempt);

// The account of package `id` in the root's etc/passwd; false when it has
// none (not installed, or installed before packages had accounts).
bool PMSFindPackageAccount(const std::string& id, PackageAccount* account);

// Finds the account of `id`, or creates it (with its group) under the
// accounts lock (KIVOAccountsLockPath), each file replaced atomically;
// `*created` (when given) says which. PKG_OK, PKG_ERR_NO_ACCOUNT_ID or
// PKG_ERR_ACCOUNT_FILES (with `*error`).
[[nodiscard]] int PMSEnsurePackageAccount(const std::string& id, PackageAccount* account,
                                          std::string* error, bool* created = nullptr);

// Removes the account and group of `id`, when it has them. False (with
// `*error`) when the accounts files cannot be written.
[[nodiscard]] bool PMSRemovePackageAccount(const std::string& id, std::string* error);

// Asked before a change to a package's data folder: true lets it go ahead,
// false forbids it. An upgrade that copies the data on a thread of its own
// meanwhile answers once the copy is whole, and false when the copy failed:
// the data must then stay as the old version left it. It may be asked
// before every change and keeps its first answer; an empty gate allows all.
using DataChangeGate = std::function<bool()>;

// Gives `dir` and everything in it to `uid`:`gid`, never following a
// symbolic link; a file with more than one hard link keeps its owner (it
// may be a name for a file outside the folder). False (with `*error`) when
// something could not be changed, or `may_change` forbade a change.
[[nodiscard]] bool PMSChownTree(const std::string& dir, uid_t uid, gid_t gid, std::string* error,
                                const DataChangeGate& may_change = {});

// Adds search permission for everyone (o+x, never read) to each folder from
// the system root down to `path`'s parent, those strictly above the system
// root excepted: on an appliance "/" and the tool's folders are searchable
// already, and a test root made by mkdtemp (0700) becomes 0711.
void PMSMakeReachable(const std::string& path);
