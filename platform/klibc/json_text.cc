#include "klibc/json_text.h"

#include <exception>
#include <memory>
#include <sstream>

#include <json/reader.h>

bool KIVOParseJson(std::string_view text, Json::Value* out, JsonSyntax syntax) {
  Json::CharReaderBuilder builder;
  if (syntax == JsonSyntax::Strict) {
    Json::CharReaderBuilder::strictMode(&builder.settings_);
    builder["strictRoot"] = false;
  }
  builder["collectComments"] = false;
  builder["stackLimit"] = kMaxJsonDepth;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  Json::Value parsed;
  bool ok = false;
  try {
    ok = reader->parse(text.data(), text.data() + text.size(), &parsed, nullptr);
  } catch (const std::exception&) {
    ok = false;  // nested past the stack limit
  }
  *out = ok ? std::move(parsed) : Json::Value();
  return ok;
}

std::unique_ptr<Json::StreamWriter> KIVONewJsonWriter(const std::string& indentation) {
  Json::StreamWriterBuilder builder;
  builder["indentation"] = indentation;
  return std::unique_ptr<Json::StreamWriter>(builder.newStreamWriter());
}

std::string KIVOWriteJson(const Json::Value& value, const std::string& indentation) {
  std::ostringstream out;
  KIVONewJsonWriter(indentation)->write(value, &out);
  return out.str();
}
