// The tables through which a web API module tells the host what it serves.
// Their layout is a binary interface between host and module: keep it.
#pragma once

class APIRequest;
class APIResponse;

using WebAPIHandler = void (*)(APIRequest*, APIResponse*);
using WebAPIChecker = bool (*)(APIRequest*, APIResponse*);

// One dispatch row: four machine words. The table ends with an all-zero row.
struct WEBAPI_TABLE_ROW {
  const char* api;
  int version;
  const char* method;
  WebAPIHandler handler;
};

// One check row: six machine words, the last two reserved and zero.
struct WEBAPI_CHECK_ROW {
  const char* api;
  int version;
  const char* method;
  WebAPIChecker checker;
  void* reserved1;
  void* reserved2;
};

static_assert(sizeof(WEBAPI_TABLE_ROW) == 4 * sizeof(void*), "dispatch row is four words");
static_assert(sizeof(WEBAPI_CHECK_ROW) == 6 * sizeof(void*), "check row is six words");

// The two functions a module exports with C linkage.
extern "C" {
using GetAPITableFn = const WEBAPI_TABLE_ROW* (*)();
using GetAPICheckTableFn = const WEBAPI_CHECK_ROW* (*)();
}
