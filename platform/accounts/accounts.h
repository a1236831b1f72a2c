// The appliance's accounts: the system root's own etc/passwd, etc/shadow and
// etc/group files, read with the C library's fgetpwent/fgetspent/fgetgrent,
// passwords hashed with yescrypt.
#pragma once

#include <string>
#include <vector>

#include "klibc/account_name.h"

// True when `account` exists, is not locked, and `password` matches its hash.
bool KIVOAccountCheckPassword(const std::string& account, const std::string& password);

// True when `account` is a member of `group` (listed in the group, or the
// group is its primary group).
bool KIVOAccountInGroup(const std::string& account, const std::string& group);

// Creates `account` (or replaces its password and groups when it exists) with
// a fresh yescrypt hash, adding it to each of `groups` (created when missing).
// Each file is replaced atomically. Returns false with `*error` set.
bool KIVOAccountSet(const std::string& account, const std::string& password,
                    const std::vector<std::string>& groups, std::string* error);
