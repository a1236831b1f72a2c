// Package versions such as "1.2.3-0045": compared part by part, where parts
// are runs of digits (compared as numbers) or of letters (compared as text),
// and '.', '-', '_', '+' only separate. A missing part is 0, so "1.2" equals
// "1.2.0" and "1.2-0001" is above "1.2". A letter part is below a number part
// ("1.0.beta" < "1.0.0"), so pre-releases sort before their release.
#pragma once

#include <string>

// <0, 0, >0 as a is lower, equal or higher than b.
int PMSCompareVersion(const std::string& a, const std::string& b);

// Comparison operators of PackageBasicInfo::compare and dependency strings.
enum PKG_VERSION_COMPOP {
  PKG_VER_EQ = 0,
  PKG_VER_GT = 1,
  PKG_VER_GE = 2,
  PKG_VER_LT = 3,  // "the installed version is lower"
  PKG_VER_LE = 4,
  PKG_VER_NE = 5,
};

bool PMSVersionMatches(const std::string& a, PKG_VERSION_COMPOP op, const std::string& b);

// "=", ">", ">=", "<", "<=", "!=" and back. False / "" for anything else.
bool PMSParseCompOp(const std::string& text, PKG_VERSION_COMPOP* op);
const char* PMSCompOpText(PKG_VERSION_COMPOP op);

// A version is 1 to 32 characters of [A-Za-z0-9._+-] with at least one digit.
bool PMSIsValidVersion(const std::string& version);
