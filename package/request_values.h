// The rules for values a request hands the module that become paths, ids or
// arguments. Each is checked as a whole std::string (its length included)
// before any C string is taken from it, so a value can never name something
// other than what was checked.
#pragma once

#include <string>

#include <json/value.h>

namespace KIVO_PACKAGE {

// The one rule for a package id (the package tool's: 1 to 64 characters of
// [A-Za-z0-9._+-], starting with a letter or digit).
bool IsPackageId(const std::string& id);

// `value` is a string, or an array of strings, each of them empty or a
// package id. The checkers refuse any other id parameter ("condition").
bool AreIdsOrEmpty(const Json::Value& value);

// A path or argument: not empty and without a NUL byte.
bool IsCleanText(const std::string& text);
// Text that may be empty but holds no NUL byte.
bool HasNoNul(const std::string& text);

// The one package id of parameter `value` (a string, or an array of exactly
// one string) when it passes IsPackageId; otherwise false.
bool SinglePackageId(const Json::Value& value, std::string* id);

}  // namespace KIVO_PACKAGE
