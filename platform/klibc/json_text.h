// The one way this system reads and writes JSON text. Much of what it reads
// comes from elsewhere (request parameters, package files, package servers and feeds,
// files other processes write), and jsoncpp throws when a document nests
// deeper than its stack limit, so a reader that let the exception out would
// end its process on one hostile catalogue. This one never throws.
#pragma once

#include <memory>
#include <string>
#include <string_view>

#include <json/reader.h>
#include <json/value.h>
#include <json/writer.h>

enum class JsonSyntax {
  // RFC 8259 and nothing else: no comments, no trailing commas, nothing
  // after the document, no duplicate member names; any value as the root.
  Strict,
  // What package servers have always been allowed to send: comments and
  // a few other liberties jsoncpp accepts by default.
  Lenient,
};

// Deeper documents are refused as malformed: no catalogue, setting or
// request of ours comes near it.
constexpr int kMaxJsonDepth = 200;

// Parses `text` into *out. False when it is not one JSON document of
// `syntax` or nests deeper than kMaxJsonDepth; *out is then null.
[[nodiscard]] bool KIVOParseJson(std::string_view text, Json::Value* out,
                                 JsonSyntax syntax = JsonSyntax::Strict);

// KIVOParseJson for many small documents in a row (a record of each of
// hundreds of packages): the reader and its settings are made once, which
// costs about as much as parsing a record of a few hundred bytes.
class KIVOJsonParser {
 public:
  explicit KIVOJsonParser(JsonSyntax syntax = JsonSyntax::Strict);

  // As KIVOParseJson(text, out, syntax).
  [[nodiscard]] bool Parse(std::string_view text, Json::Value* out);

 private:
  std::unique_ptr<Json::CharReader> reader_;
};

// A writer of the one form this system writes JSON in: jsoncpp's defaults
// (members in name order, reals to 17 significant digits, every character
// beyond ASCII escaped as \uXXXX, so the text is valid UTF-8 whatever its
// strings hold) with `indentation` as one level's indentation. With ""
// the document is compact: one line, no space between tokens, which is what
// answers, task data and state files are written as; an indented form is
// for what people or scripts read a line at a time (a settings file,
// kivoctl's output, a package script's wizard answers).
std::unique_ptr<Json::StreamWriter> KIVONewJsonWriter(const std::string& indentation = "");

// `value` as written by KIVONewJsonWriter(indentation), with no newline
// after it.
std::string KIVOWriteJson(const Json::Value& value, const std::string& indentation = "");
