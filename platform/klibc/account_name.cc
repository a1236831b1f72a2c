#include "klibc/account_name.h"

#include <algorithm>
#include <cctype>

#include "klibc/sysroot.h"

bool KIVOAccountNameValid(const std::string& name) {
  if (name.empty() || name.size() > 32) return false;
  if (!(islower(static_cast<unsigned char>(name[0])) || name[0] == '_')) return false;
  return std::all_of(name.begin(), name.end(), [](char c) {
    return islower(static_cast<unsigned char>(c)) || isdigit(static_cast<unsigned char>(c)) ||
           c == '_' || c == '.' || c == '-';
  });
}

std::string KIVOAccountsLockPath() { return KIVORootPath("/run/kivo/accounts.lock"); }
