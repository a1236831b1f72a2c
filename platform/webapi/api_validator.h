// Value tests that checkers apply after the type checks.
#pragma once

#include <string>

#include <json/value.h>

namespace APIValidator {

// `set` is a JSON array of allowed strings. For a string value: true when it
// is one of them. For an array value: true when every element is one of them
// (so an empty array belongs to any set). Anything else: false.
bool IsBelong(const Json::Value& value, const Json::Value& set);
bool IsBelong(const std::string& value, const Json::Value& set);

// True when the string value equals `expected`.
bool IsEqual(const std::string& value, const std::string& expected);

}  // namespace APIValidator
