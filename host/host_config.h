// The web API host's settings: "/etc/kivo/webapi.conf" of the system root,
// key/value. Missing or bad values fall back to the defaults.
//
//   session_idle_timeout  seconds a session may go unused (1800)
//   session_max_age       seconds a session lives at most (86400)
//   max_upload_bytes      the largest multipart body accepted (4 GiB)
#pragma once

#include <cstdint>

#include "host/session_store.h"

struct HostConfig {
  SessionLimits session;
  uint64_t max_upload_bytes = 4ULL << 30;
};

HostConfig LoadHostConfig();

inline SessionLimits LoadSessionLimits() { return LoadHostConfig().session; }
inline uint64_t LoadUploadLimit() { return LoadHostConfig().max_upload_bytes; }
