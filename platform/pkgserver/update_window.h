// The maintenance window of automatic updates: the days of the week and the
// hours, in the appliance's local time, in which `kivoctl auto-update` may
// upgrade packages, and the random delay a run waits inside it so that a
// fleet of appliances does not ask the package server at the same second.
//
// It lives in the root's "etc/kivo/autoupdate.conf" (key/value):
//
//   window_days="mon,tue,wed,thu,fri"   empty or absent: any time
//   window_start="02:00"                HH:MM, 00:00 to 23:59
//   window_end="05:00"                  HH:MM, 00:01 to 24:00; at or before
//                                       the start, the window runs past
//                                       midnight into the next day
//   random_delay_minutes="30"           0 to 720 (default 0)
//
// The file is checked whole: an unknown key, a bad value, hours without
// days or days without hours make all of it invalid, and a run refuses to
// upgrade anything rather than guess. Without the file, updates may run at
// any time without a delay (as before the window existed).
//
// A window is opened once per day it names; a run upgrades at most once per
// opening (WindowStateAt), so the scheduler may start it as often as it
// likes.
#pragma once

#include <cstdint>
#include <ctime>
#include <string>

#include <json/value.h>

#include "klibc/key_value_file.h"

namespace KIVOPackageServer {

struct UpdateWindow {
  bool limited = false;          // false: any time
  unsigned days = 0;             // bit n: weekday n as tm_wday counts (0 = Sunday)
  int start_minute = 0;          // minutes after local midnight, 0 to 1439
  int end_minute = 0;            // 1 to 1440; <= start_minute: the next day
  int random_delay_minutes = 0;  // 0 to kMaxRandomDelayMinutes
};

inline constexpr int kMaxRandomDelayMinutes = 720;

// What is wrong with a window: the key (or web API parameter) at fault and
// why, in words.
struct WindowError {
  std::string key;
  std::string reason;
};

// Parses the keys above, checked whole. False with *error set when any part
// is wrong; *out is then untouched.
[[nodiscard]] bool ParseUpdateWindow(const KeyValueMap& conf, UpdateWindow* out,
                                     WindowError* error);

// The file's text for `window` (which ParseUpdateWindow reads back as is).
std::string UpdateWindowText(const UpdateWindow& window);

// "<root>/etc/kivo/autoupdate.conf".
std::string UpdateWindowPath();

// Reads the stored window. A missing file is any time. False with *error
// set when the file cannot be read or fails a check.
[[nodiscard]] bool LoadUpdateWindow(UpdateWindow* out, WindowError* error);

// Replaces the stored window atomically. False (the last error set) when it
// cannot be written.
[[nodiscard]] bool SaveUpdateWindow(const UpdateWindow& window);

// {"limited", "days": ["mon", ...], "start": "HH:MM", "end": "HH:MM",
// "random_delay_minutes"}, as the web API answers it.
Json::Value UpdateWindowJson(const UpdateWindow& window);

// One opening of the window: from `opens` to `closes` (seconds since the
// epoch).
struct WindowOpening {
  int64_t opens = 0;
  int64_t closes = 0;
};

// Where a run at `now` stands, given when the last run that upgraded
// started (`last_run`, 0 for none).
struct WindowState {
  bool inside = false;       // now is inside an opening (always, without a window)
  bool already_ran = false;  // the last run started inside the current opening
  WindowOpening current;     // the current opening, when inside (limited only)
  // When updates may run next: the current opening when inside and not run
  // yet, else the next opening. `has_next` is false without a window (any
  // time) or with a window of no day.
  bool has_next = false;
  WindowOpening next;
};
WindowState WindowStateAt(const UpdateWindow& window, int64_t now, int64_t last_run);

// The random delay, in seconds, of a run at `now` inside `state`'s current
// opening: uniform from 0 to below the configured delay, and always ending
// before the opening closes. The same `seed` gives the same delay.
int64_t RandomDelaySeconds(const UpdateWindow& window, const WindowState& state, int64_t now,
                           uint64_t seed);

// "2024-05-06 02:00" in the appliance's local time.
std::string LocalTimeText(int64_t when);

// Parses "YYYY-MM-DDTHH:MM" (or with a space) as the appliance's local time.
// False when it is not such a time.
[[nodiscard]] bool ParseLocalTime(const std::string& text, int64_t* out);

}  // namespace KIVOPackageServer
