// HTTP transfers of the package server library. They live in
// libkivo_pkgserver_net.so with libcurl and OpenSSL's digests, which most
// web API requests never need: every request is a new process, and loading
// libcurl with its dozen dependencies would slow each one. The light library
// loads the transfer library on the first transfer (server_net.cc).
//
// Only http and https are ever enabled, for the first request and for
// redirects (at most kMaxRedirects). Loopback addresses bypass any proxy.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

constexpr int kMaxRedirects = 3;

// Time and size bounds of one transfer.
struct HttpLimits {
  long connect_timeout_s = 10;
  long total_timeout_s = 0;   // 0: no bound on the whole transfer
  long stall_timeout_s = 30;  // fail when no byte arrived for this long
  uint64_t max_bytes = 0;     // 0: no bound; more bytes fail the transfer
};

// A GET (or, with `form`, a urlencoded POST) whose answer is kept in memory.
struct HttpFetch {
  std::string url;
  std::string form;               // "a=1&b=2": POST it
  std::string if_none_match;      // conditional request when set
  std::string if_modified_since;  // conditional request when set

  // For addresses that a server's answer names (images), not the operator.
  // With `servers_only`, the address and every redirect must lie on the host
  // and port of one of `servers` (none: nothing may be fetched), judged by
  // the transfer's own URL parser; a redirect elsewhere fails the transfer.
  // With `public_only`, every connection must go to a public address: it is
  // checked after the name is resolved, on each connection (redirects too),
  // and no proxy is used, so the address checked is the one asked.
  bool servers_only = false;
  std::vector<std::string> servers;
  bool public_only = false;

  long status = 0;  // HTTP status of the last answer (0: none)
  std::string body;
  std::string etag;
  std::string last_modified;
  std::string error;  // why the transfer failed, for the log
};

// A download into a file, resumed with range requests after a dropped
// connection. The file grows at its end; bytes already in it when the
// download starts are kept (and hashed first) when the server honours the
// range, else the file starts over.
struct HttpDownload {
  std::string url;
  std::string path;
  int retries = 3;  // further attempts after a dropped or stalled connection
  bool want_md5 = false;
  bool want_sha256 = false;
  // Called as bytes arrive (the caller throttles); `total` is 0 when unknown.
  void (*progress)(void* context, uint64_t have, uint64_t total) = nullptr;
  // Polled during the transfer; true aborts it.
  bool (*canceled)(void* context) = nullptr;
  void* context = nullptr;

  enum class Outcome { kOk, kNetwork, kHttpStatus, kTooLarge, kDisk, kCanceled };
  Outcome outcome = Outcome::kNetwork;
  long status = 0;
  uint64_t bytes = 0;  // the file's size at the end
  std::string md5_hex;
  std::string sha256_hex;
  std::string error;
};

// The table libkivo_pkgserver_net.so exports as KivoPackageServerNet().
struct PackageServerNetOps {
  // True when an answer came (any status; see `status`).
  bool (*fetch)(const HttpLimits& limits, HttpFetch& fetch);
  // True when the whole file arrived (outcome kOk).
  bool (*download)(const HttpLimits& limits, HttpDownload& download);
};

extern "C" {
using KivoPackageServerNetFn = const PackageServerNetOps* (*)();
}

// The loaded table, or null (with `*error` set) when the library cannot be
// loaded. Loaded once per process.
const PackageServerNetOps* PMSServerNetOps(std::string* error);

// The table's fetch: true when an answer came (any status). False with
// `fetch.error` saying why when there was none, the library's failing to
// load among the reasons.
[[nodiscard]] bool PMSServerFetch(const HttpLimits& limits, HttpFetch& fetch);
