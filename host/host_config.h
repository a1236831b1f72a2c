// The web API host's settings: "/etc/kivo/webapi.conf" of the system root,
// key/value. Missing or bad values (not a positive number) fall back to the
// defaults.
//
//   session_idle_timeout     seconds a session may go unused (1800)
//   session_max_age          seconds a session lives at most (86400)
//   session_max_per_account  live sessions one account may hold; a sign-in
//                            beyond it ends the oldest (16)
//   login_free_failures      failed sign-ins before the back-off starts (5)
//   login_backoff_base       seconds of the first back-off; each further
//                            failure doubles it (1)
//   login_backoff_max        seconds the back-off grows to at most (900)
//   max_upload_bytes         the largest multipart body accepted, and so the
//                            largest package file an appliance takes
//                            (kDefaultMaxUploadBytes); `kivoctl web-config`
//                            gives lighttpd the same limit
#pragma once

#include <cstdint>

#include "host/login_throttle.h"
#include "host/session_store.h"

// The default of max_upload_bytes: 4 GiB.
constexpr uint64_t kDefaultMaxUploadBytes = 4ULL << 30;

struct HostConfig {
  SessionLimits session;
  LoginLimits login;
  uint64_t max_upload_bytes = kDefaultMaxUploadBytes;
};

HostConfig LoadHostConfig();

inline SessionLimits LoadSessionLimits() { return LoadHostConfig().session; }
inline uint64_t LoadUploadLimit() { return LoadHostConfig().max_upload_bytes; }
