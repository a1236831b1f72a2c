// The one way this system reads JSON text. Much of what it reads comes from
// elsewhere (request parameters, package files, package servers and feeds,
// files other processes write), and jsoncpp throws when a document nests
// deeper than its stack limit, so a reader that let the exception out would
// end its process on one hostile catalogue. This one never throws.
#pragma once

#include <string_view>

#include <json/value.h>

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
