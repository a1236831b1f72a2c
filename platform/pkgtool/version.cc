#include "pkgtool/version.h"

#include <algorithm>
#include <cctype>
#include <vector>

namespace {

struct Part {
  bool numeric;
  unsigned long long number;
  std::string text;
};

bool IsSeparator(char c) { return c == '.' || c == '-' || c == '_' || c == '+'; }

std::vector<Part> Split(const std::string& v) {
  std::vector<Part> parts;
  size_t i = 0;
  while (i < v.size()) {
    if (IsSeparator(v[i])) {
      ++i;
      continue;
    }
    bool digits = isdigit(static_cast<unsigned char>(v[i]));
    size_t j = i;
    while (j < v.size() && !IsSeparator(v[j]) &&
           static_cast<bool>(isdigit(static_cast<unsigned char>(v[j]))) == digits) {
      ++j;
    }
    Part p{digits, 0, v.substr(i, j - i)};
    if (digits) {
      // Saturate rather than overflow on absurdly long numbers.
      for (char c : p.text) p.number = p.number > 1e17 ? p.number : p.number * 10 + (c - '0');
    }
    parts.push_back(p);
    i = j;
  }
  return parts;
}

int ComparePart(const Part& a, const Part& b) {
  if (a.numeric && b.numeric) return a.number < b.number ? -1 : a.number > b.number ? 1 : 0;
  if (a.numeric != b.numeric) return a.numeric ? 1 : -1;
  return a.text.compare(b.text) < 0 ? -1 : a.text.compare(b.text) > 0 ? 1 : 0;
}

}  // namespace

int PMSCompareVersion(const std::string& a, const std::string& b) {
  std::vector<Part> pa = Split(a), pb = Split(b);
  const Part zero{true, 0, "0"};
  for (size_t i = 0; i < std::max(pa.size(), pb.size()); ++i) {
    int c = ComparePart(i < pa.size() ? pa[i] : zero, i < pb.size() ? pb[i] : zero);
    if (c != 0) return c;
  }
  return 0;
}

bool PMSVersionMatches(const std::string& a, PKG_VERSION_COMPOP op, const std::string& b) {
  int c = PMSCompareVersion(a, b);
  switch (op) {
    case PKG_VER_EQ:
      return c == 0;
    case PKG_VER_GT:
      return c > 0;
    case PKG_VER_GE:
      return c >= 0;
    case PKG_VER_LT:
      return c < 0;
    case PKG_VER_LE:
      return c <= 0;
    case PKG_VER_NE:
      return c != 0;
  }
  return false;
}

bool PMSParseCompOp(const std::string& text, PKG_VERSION_COMPOP* op) {
  static const struct {
    const char* text;
    PKG_VERSION_COMPOP op;
  } kOps[] = {{"=", PKG_VER_EQ}, {">", PKG_VER_GT},  {">=", PKG_VER_GE},
              {"<", PKG_VER_LT}, {"<=", PKG_VER_LE}, {"!=", PKG_VER_NE}};
  for (const auto& o : kOps) {
    if (text == o.text) {
      *op = o.op;
      return true;
    }
  }
  return false;
}

const char* PMSCompOpText(PKG_VERSION_COMPOP op) {
  switch (op) {
    case PKG_VER_EQ:
      return "=";
    case PKG_VER_GT:
      return ">";
    case PKG_VER_GE:
      return ">=";
    case PKG_VER_LT:
      return "<";
    case PKG_VER_LE:
      return "<=";
    case PKG_VER_NE:
      return "!=";
  }
  return "";
}

bool PMSIsValidVersion(const std::string& version) {
  if (version.empty() || version.size() > 32) return false;
  bool digit = false;
  for (char c : version) {
    if (isdigit(static_cast<unsigned char>(c))) digit = true;
    if (!isalnum(static_cast<unsigned char>(c)) && !IsSeparator(c)) return false;
  }
  return digit;
}
