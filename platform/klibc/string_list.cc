#include "klibc/string_list.h"

#include <new>

#include "klibc/last_error.h"

PKLIBSZLIST KLIBCSzListAlloc(int capacity) {
  auto* list = new (std::nothrow) KLIBSZLIST;
  if (!list) {
    KLIBCErrSet(KLIBC_ERR_OUT_OF_MEMORY);
    return nullptr;
  }
  if (capacity > 0) list->items.reserve(static_cast<size_t>(capacity));
  return list;
}

void KLIBCSzListFree(PKLIBSZLIST list) { delete list; }

int KLIBCSzListPush(PKLIBSZLIST* list, const char* value) {
  if (!list || !*list || !value) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  (*list)->items.emplace_back(value);
  return 0;
}

const char* KLIBCSzListGet(PKLIBSZLIST list, int i) {
  if (!list || i < 0 || i >= list->nItem()) return nullptr;
  return list->items[static_cast<size_t>(i)].c_str();
}

PKLIBSZHASH KLIBCSzHashAlloc(int capacity) {
  auto* hash = new (std::nothrow) KLIBSZHASH;
  if (!hash) {
    KLIBCErrSet(KLIBC_ERR_OUT_OF_MEMORY);
    return nullptr;
  }
  if (capacity > 0) hash->entries.reserve(static_cast<size_t>(capacity));
  return hash;
}

void KLIBCSzHashFree(PKLIBSZHASH hash) { delete hash; }

int KLIBCSzHashSetValue(PKLIBSZHASH* hash, const char* key, const char* value) {
  if (!hash || !*hash || !key || !value) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  for (auto& entry : (*hash)->entries) {
    if (entry.first == key) {
      entry.second = value;
      return 0;
    }
  }
  (*hash)->entries.emplace_back(key, value);
  return 0;
}

const char* KLIBCSzHashGetValue(PKLIBSZHASH hash, const char* key) {
  if (!hash || !key) return nullptr;
  for (const auto& entry : hash->entries) {
    if (entry.first == key) return entry.second.c_str();
  }
  return nullptr;
}
