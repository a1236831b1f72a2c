#include "klibc/json_text.h"

#include <exception>
#include <memory>
#include <sstream>

#include <json/reader.h>

KIVOJsonParser::KIVOJsonParser(JsonSyntax syntax) {
  Json::CharReaderBuilder builder;
  if (syntax == JsonSyntax::Strict) {
    Json::CharReaderBuilder::strictMode(&builder.settings_);
    builder["strictRoot"] = false;
  }
  builder["collectComments"] = false;
  builder["stackLimit"] = kMaxJsonDepth;
  reader_.reset(builder.newCharReader());
}

bool KIVOJsonParser::Parse(std::string_view text, Json::Value* out) {
  Json::Value parsed;
  bool ok = false;
  try {
    ok = reader_->parse(text.data(), text.data() + text.size(), &parsed, nullptr);
  } catch (const std::exception&) {
    ok = false;  // nested past the stack limit
  }
  *out = ok ? std::move(parsed) : Json::Value();
  return ok;
}

bool KIVOParseJson(std::string_view text, Json::Value* out, JsonSyntax syntax) {
  return KIVOJsonParser(syntax).Parse(text, out);
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
