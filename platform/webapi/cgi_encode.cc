#include "webapi/cgi_encode.h"

#include <cctype>
#include <cstring>

int KivoCgiURLEncode(const char* in, char* out, int out_size) {
  static const char kHex[] = "0123456789ABCDEF";
  if (!in || !out || out_size <= 0) return -1;
  int n = 0;
  for (const unsigned char* p = reinterpret_cast<const unsigned char*>(in); *p; ++p) {
    bool plain = isalnum(*p) || strchr("-_.!~*'()", *p);
    int need = plain ? 1 : 3;
    if (n + need >= out_size) {
      out[0] = '\0';
      return -1;
    }
    if (plain) {
      out[n++] = static_cast<char>(*p);
    } else {
      out[n++] = '%';
      out[n++] = kHex[*p >> 4];
      out[n++] = kHex[*p & 15];
    }
  }
  out[n] = '\0';
  return 0;
}
