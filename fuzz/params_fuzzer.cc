// Fuzzes the decoding of request parameters: an urlencoded query string or
// body split into fields, each value decoded by the JSON value rule and read
// through every checked reader of APIRequest, and the percent-encoding the
// host writes read back.
//
// Contracts checked (docs/http-api.md): a value that is not kept as JSON
// is the text as sent; reals never become numbers; each checked reader
// accepts exactly the JSON types it names; decoding undoes encoding.
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include <json/value.h>

#include "fuzz_support.h"
#include "webapi/api_request.h"
#include "webapi/cgi_encode.h"
#include "webapi/url_encoded.h"
#include "webapi/webapi_util.h"

namespace {

void CheckDecoded(const std::string& raw, const Json::Value& value) {
  FuzzRequire(value.type() != Json::realValue, "a real was decoded as a number");
  if (value.isString() && (raw.empty() || raw[0] != '"')) {
    FuzzRequire(value.asString() == raw, "a value kept as text differs from the text sent");
  }
}

void CheckReaders(const APIRequest& request, const std::string& name) {
  Json::Value value = request.GetParam(name);
  bool container = value.isObject() || value.isArray();
  APIParameter<std::string> text = request.GetAndCheckString(name, PARAM_REQUIRED);
  FuzzRequire(text.IsSet() && text.IsInvalid() == container, "string reader: wrong type rule");
  if (value.isString()) FuzzRequire(text.Get() == value.asString(), "string reader: wrong text");
  bool is_int = value.isInt() && value.isIntegral() && !value.isBool();
  FuzzRequire(request.GetAndCheckInt(name, PARAM_OPTIONAL).IsInvalid() != is_int,
              "int reader: wrong type rule");
  FuzzRequire(request.GetAndCheckBool(name, PARAM_OPTIONAL).IsInvalid() != value.isBool(),
              "bool reader: wrong type rule");
  FuzzRequire(request.GetAndCheckObject(name, PARAM_OPTIONAL).IsInvalid() != value.isObject(),
              "object reader: wrong type rule");
  APIParameter<Json::Value> unit = request.GetAndCheckUnitArray(name, PARAM_OPTIONAL);
  FuzzRequire(unit.IsInvalid() != (value.isArray() || value.isString()),
              "unit array reader: wrong type rule");
  if (!unit.IsInvalid()) FuzzRequire(unit.Get().isArray(), "unit array reader: not an array");
}

void CheckEncodingRoundTrip(const std::string& text) {
  std::string plain = text.c_str();  // the encoder takes a C string
  std::vector<char> encoded(plain.size() * 3 + 1);
  FuzzRequire(
      KivoCgiURLEncode(plain.c_str(), encoded.data(), static_cast<int>(encoded.size())) == 0,
      "encoder refused a buffer of three bytes per byte");
  std::string decoded;
  FuzzRequire(UrlDecode(encoded.data(), &decoded) && decoded == plain,
              "decoding does not undo encoding");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  std::string text(reinterpret_cast<const char*>(data), size);
  FormFields fields;
  std::string error;
  if (!ParseUrlEncoded(text, &fields, &error)) {
    FuzzRequire(!error.empty(), "a refused query string has no reason");
  }
  APIRequest request;
  for (const auto& field : fields) {
    CheckDecoded(field.second, WebAPIUtil::DecodeParamValue(field.second));
    request.AddRawParam(field.first, field.second);
  }
  for (const auto& field : fields) CheckReaders(request, field.first);
  CheckEncodingRoundTrip(text);
  return 0;
}
