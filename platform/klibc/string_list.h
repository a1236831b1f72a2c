// String lists and string hashes: the utility library's C-style containers
// that platform calls fill for their callers (the feasibility check's reasons,
// the parameters of a request to a package server).
//
// The caller allocates, the callee appends through the address of the
// pointer, the caller frees. Alloc returns null (last error
// KLIBC_ERR_OUT_OF_MEMORY) only when memory runs out.
#pragma once

#include <string>
#include <utility>
#include <vector>

struct KLIBSZLIST {
  std::vector<std::string> items;
  int nItem() const { return static_cast<int>(items.size()); }
};
using PKLIBSZLIST = KLIBSZLIST*;

PKLIBSZLIST KLIBCSzListAlloc(int capacity);
void KLIBCSzListFree(PKLIBSZLIST list);
// Appends a copy of `value`. 0 on success, -1 on bad input.
[[nodiscard]] int KLIBCSzListPush(PKLIBSZLIST* list, const char* value);
// The i-th entry, or null when `i` is out of range.
const char* KLIBCSzListGet(PKLIBSZLIST list, int i);

// Ordered key/value pairs; setting an existing key replaces its value.
struct KLIBSZHASH {
  std::vector<std::pair<std::string, std::string>> entries;
};
using PKLIBSZHASH = KLIBSZHASH*;

PKLIBSZHASH KLIBCSzHashAlloc(int capacity);
void KLIBCSzHashFree(PKLIBSZHASH hash);
// 0 on success, -1 on bad input.
[[nodiscard]] int KLIBCSzHashSetValue(PKLIBSZHASH* hash, const char* key, const char* value);
// The value of `key`, or null when absent.
const char* KLIBCSzHashGetValue(PKLIBSZHASH hash, const char* key);
