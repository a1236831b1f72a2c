// application/x-www-form-urlencoded text: query strings and form bodies.
#pragma once

#include <string>
#include <utility>
#include <vector>

using FormFields = std::vector<std::pair<std::string, std::string>>;

// Splits "a=1&b=%22x%22" into its fields in order, decoding '+' and %XX.
// A field without '=' has the empty value; empty fields ("a=1&&b=2") are
// skipped. Returns false with `*error` set on an invalid escape (a '%' not
// followed by two hex digits); `*out` then holds the fields before it.
bool ParseUrlEncoded(const std::string& text, FormFields* out, std::string* error);

// Percent-decodes one component. False on an invalid escape.
bool UrlDecode(const std::string& in, std::string* out);
