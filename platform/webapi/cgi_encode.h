// Percent-encoding for text the web desktop decodes with decodeURIComponent.
#pragma once

// Encodes `in` into `out` (at most `out_size` bytes, NUL included): letters,
// digits and -_.!~*'() stay, every other byte becomes %XX. 0 on success, -1
// when `out` is too small (it then holds an empty string).
int KivoCgiURLEncode(const char* in, char* out, int out_size);
