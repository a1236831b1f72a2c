// A request parameter read through one of the checked readers of APIRequest.
#pragma once

#include <json/value.h>

// Whether a parameter must be sent. Only these two values are used.
enum PARAM_NECESSITY {
  PARAM_REQUIRED = 0,
  PARAM_OPTIONAL = 1,
};

// An optional extra test of a parameter's decoded value; a parameter whose
// value fails it is invalid.
using APIParamValidator = bool (*)(const Json::Value& value);

template <typename T>
class APIParameter {
 public:
  APIParameter() = default;
  APIParameter(bool set, bool invalid, T value)
      : set_(set), invalid_(invalid), value_(std::move(value)) {}

  // The client sent the parameter (with whatever type).
  bool IsSet() const { return set_; }
  // Required and missing, or sent with the wrong type (or failing the validator).
  bool IsInvalid() const { return invalid_; }
  // The value; a default-constructed T when unset or invalid.
  const T& Get() const { return value_; }

 private:
  bool set_ = false;
  bool invalid_ = false;
  T value_{};
};
