// The one rule for account and group names. Every name that becomes part of
// a path (per-user settings, sessions) or a line of the accounts files is
// checked with it first.
#pragma once

#include <string>

// True when `name` is a valid account or group name: [a-z_][a-z0-9_.-]{0,31}.
// "." and ".." can never match, since the first character is a letter or "_".
bool KIVOAccountNameValid(const std::string& name);

// The lock file that guards the root's etc/passwd, etc/group and etc/shadow:
// every writer of those files (administrators' accounts, packages' own
// accounts) holds it (klibc/file_lock.h) from its read to its last write,
// so that no writer replaces a file with a copy that lacks another's change.
std::string KIVOAccountsLockPath();
