// JSON helpers of the web API framework and the decoding of parameter values.
#pragma once

#include <string>

#include <json/value.h>

namespace WebAPIUtil {

// Parses `text` (any JSON document) into `out`. False when it is not JSON.
bool ParseJson(const std::string& text, Json::Value& out);

// True when `array` is an array holding a string equal to `value`.
bool JsonArrayHasString(const Json::Value& array, const std::string& value);

// Turns a parameter's text as sent into its value: text that is valid JSON
// and an object, array, quoted string, integer, true, false or null becomes
// that JSON value; anything else (reals such as 1.10 among them) stays the
// string as sent, so a version "1.10" is never turned into 1.1. JSON whose
// strings or member names would hold a NUL character (\u0000) stays the
// text as sent too, so no decoded value holds a NUL byte.
Json::Value DecodeParamValue(const std::string& raw);

}  // namespace WebAPIUtil
