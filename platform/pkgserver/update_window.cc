#include "pkgserver/update_window.h"

#include <algorithm>
#include <cerrno>
#include <random>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/last_error.h"
#include "klibc/sysroot.h"

namespace KIVOPackageServer {

namespace {

constexpr char kDaysKey[] = "window_days";
constexpr char kStartKey[] = "window_start";
constexpr char kEndKey[] = "window_end";
constexpr char kDelayKey[] = "random_delay_minutes";
constexpr const char* kKeys[] = {kDaysKey, kStartKey, kEndKey, kDelayKey};
// Indexed by tm_wday.
constexpr const char* kDayNames[] = {"sun", "mon", "tue", "wed", "thu", "fri", "sat"};
constexpr int kMinutesPerDay = 24 * 60;
// Far more than the four settings a window file holds.
constexpr size_t kMaxFileBytes = 4096;

bool Fail(const char* key, const std::string& reason, WindowError* error) {
  *error = {key, reason};
  return false;
}

int DayIndex(const std::string& name) {
  for (int i = 0; i < 7; ++i) {
    if (name == kDayNames[i]) return i;
  }
  return -1;
}

// "mon,tue" -> the day bits; false on an unknown or repeated day.
bool ParseDays(const std::string& text, unsigned* days, std::string* reason) {
  *days = 0;
  size_t start = 0;
  while (start <= text.size()) {
    size_t comma = text.find(',', start);
    if (comma == std::string::npos) comma = text.size();
    const std::string name = text.substr(start, comma - start);
    const int day = DayIndex(name);
    if (day < 0) {
      *reason = "\"" + name.substr(0, 16) + "\" is not one of sun, mon, tue, wed, thu, fri, sat";
      return false;
    }
    if (*days & (1u << day)) {
      *reason = name + " is named twice";
      return false;
    }
    *days |= 1u << day;
    start = comma + 1;
  }
  return true;
}

// "HH:MM" -> minutes after midnight, from `min` to `max`.
bool ParseClock(const std::string& text, int min, int max, int* minutes) {
  if (text.size() != 5 || text[2] != ':') return false;
  for (size_t i : {0, 1, 3, 4}) {
    if (text[i] < '0' || text[i] > '9') return false;
  }
  const int hours = (text[0] - '0') * 10 + (text[1] - '0');
  const int mins = (text[3] - '0') * 10 + (text[4] - '0');
  if (mins > 59) return false;
  *minutes = hours * 60 + mins;
  return *minutes >= min && *minutes <= max;
}

std::string ClockText(int minutes) {
  char text[24];  // room for any int, though minutes stay below 24 * 60
  snprintf(text, sizeof(text), "%02d:%02d", minutes / 60, minutes % 60);
  return text;
}

std::string DaysText(unsigned days) {
  std::string text;
  for (int i = 1; i <= 7; ++i) {  // Monday first, as the week is read
    if (days & (1u << (i % 7))) text += (text.empty() ? "" : ",") + std::string(kDayNames[i % 7]);
  }
  return text;
}

// The local midnight `offset` days from the local date of `now`, as a tm
// ready for mktime (minutes still to be set).
struct tm LocalDay(int64_t now, int offset) {
  const time_t t = static_cast<time_t>(now);
  struct tm day {};
  localtime_r(&t, &day);
  day.tm_mday += offset;
  day.tm_hour = 0;
  day.tm_min = 0;
  day.tm_sec = 0;
  day.tm_isdst = -1;
  struct tm normal = day;
  mktime(&normal);  // finds the weekday and folds the day into its month
  normal.tm_hour = 0;
  normal.tm_min = 0;
  normal.tm_sec = 0;
  normal.tm_isdst = -1;
  return normal;
}

// mktime of `day` at `minutes` after its midnight, `add_days` later.
int64_t At(struct tm day, int add_days, int minutes) {
  day.tm_mday += add_days;
  day.tm_min = minutes;
  day.tm_isdst = -1;
  return static_cast<int64_t>(mktime(&day));
}

// The opening of `window` on the local day `offset` days from now's, if the
// window opens on that day.
bool OpeningOn(const UpdateWindow& window, int64_t now, int offset, WindowOpening* out) {
  const struct tm day = LocalDay(now, offset);
  if ((window.days & (1u << day.tm_wday)) == 0) return false;
  out->opens = At(day, 0, window.start_minute);
  out->closes = At(day, window.end_minute <= window.start_minute ? 1 : 0, window.end_minute);
  return true;
}

}  // namespace

bool ParseUpdateWindow(const KeyValueMap& conf, UpdateWindow* out, WindowError* error) {
  for (const auto& setting : conf) {
    const std::string& key = setting.first;
    if (std::find_if(std::begin(kKeys), std::end(kKeys), [&](const char* k) { return key == k; }) ==
        std::end(kKeys))
      return Fail(kDaysKey, "unknown setting \"" + key.substr(0, 40) + "\"", error);
  }
  auto value = [&](const char* key) {
    auto it = conf.find(key);
    return it == conf.end() ? std::string() : it->second;
  };
  UpdateWindow w;
  const std::string days = value(kDaysKey), start = value(kStartKey), end = value(kEndKey),
                    delay = value(kDelayKey);
  std::string reason;
  w.limited = !days.empty();
  if (w.limited && !ParseDays(days, &w.days, &reason)) return Fail(kDaysKey, reason, error);
  if (!w.limited && (!start.empty() || !end.empty()))
    return Fail(kDaysKey, "hours are set but no day", error);
  if (w.limited && !ParseClock(start, 0, kMinutesPerDay - 1, &w.start_minute))
    return Fail(kStartKey, "not a time from 00:00 to 23:59", error);
  if (w.limited && !ParseClock(end, 1, kMinutesPerDay, &w.end_minute))
    return Fail(kEndKey, "not a time from 00:01 to 24:00", error);
  if (w.limited && w.end_minute == w.start_minute)
    return Fail(kEndKey, "the window would end when it starts", error);
  if (!delay.empty()) {
    if (delay.size() > 3 || delay.find_first_not_of("0123456789") != std::string::npos ||
        std::stoi(delay) > kMaxRandomDelayMinutes)
      return Fail(kDelayKey, "not a whole number of minutes from 0 to 720", error);
    w.random_delay_minutes = std::stoi(delay);
  }
  *out = w;
  return true;
}

std::string UpdateWindowText(const UpdateWindow& window) {
  std::string text = "# When kivoctl auto-update may upgrade packages (docs/settings.md).\n" +
                     KIVOKeyValueLine(kDaysKey, window.limited ? DaysText(window.days) : "") + "\n";
  if (window.limited) {
    text += KIVOKeyValueLine(kStartKey, ClockText(window.start_minute)) + "\n" +
            KIVOKeyValueLine(kEndKey, ClockText(window.end_minute)) + "\n";
  }
  return text + KIVOKeyValueLine(kDelayKey, std::to_string(window.random_delay_minutes)) + "\n";
}

std::string UpdateWindowPath() { return KIVORootPath("/etc/kivo/autoupdate.conf"); }

bool LoadUpdateWindow(UpdateWindow* out, WindowError* error) {
  const std::string path = UpdateWindowPath();
  if (access(path.c_str(), F_OK) != 0 && errno == ENOENT) {
    *out = UpdateWindow();
    return true;
  }
  std::string text;
  if (!KIVOReadFile(path, &text, kMaxFileBytes + 1) || text.size() > kMaxFileBytes)
    return Fail(kDaysKey, "the file cannot be read", error);
  // Every line that is not blank or a comment must be a setting: a line the
  // reader would pass over is a mistake the administrator should hear of.
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find('\n', start);
    if (end == std::string::npos) end = text.size();
    const std::string line = text.substr(start, end - start);
    const size_t first = line.find_first_not_of(" \t\r");
    if (first != std::string::npos && line[first] != '#' && KIVOKeyValueParse(line).empty())
      return Fail(kDaysKey, "a line is no setting", error);
    start = end + 1;
  }
  return ParseUpdateWindow(KIVOKeyValueParse(text), out, error);
}

bool SaveUpdateWindow(const UpdateWindow& window) {
  if (KIVOFSMkdirP(KIVORootPath("/etc/kivo").c_str()) != 0) {
    KLIBCErrSet(KLIBC_ERR_FILE_WRITE);
    return false;
  }
  return KIVOWriteFileAtomic(UpdateWindowPath(), UpdateWindowText(window));
}

Json::Value UpdateWindowJson(const UpdateWindow& window) {
  Json::Value v(Json::objectValue);
  v["limited"] = window.limited;
  v["days"] = Json::Value(Json::arrayValue);
  for (int i = 1; i <= 7; ++i) {
    if (window.days & (1u << (i % 7))) v["days"].append(kDayNames[i % 7]);
  }
  v["start"] = window.limited ? ClockText(window.start_minute) : "";
  v["end"] = window.limited ? ClockText(window.end_minute) : "";
  v["random_delay_minutes"] = window.random_delay_minutes;
  return v;
}

WindowState WindowStateAt(const UpdateWindow& window, int64_t now, int64_t last_run) {
  WindowState state;
  if (!window.limited) {
    state.inside = true;
    return state;
  }
  // An opening that began yesterday may run past midnight into today.
  for (int offset : {-1, 0}) {
    WindowOpening o;
    if (OpeningOn(window, now, offset, &o) && o.opens <= now && now < o.closes) {
      state.inside = true;
      state.current = o;
    }
  }
  state.already_ran = state.inside && last_run >= state.current.opens;
  if (state.inside && !state.already_ran) {
    state.has_next = true;
    state.next = state.current;
    return state;
  }
  for (int offset = 0; offset <= 8 && !state.has_next; ++offset) {
    WindowOpening o;
    if (OpeningOn(window, now, offset, &o) && o.opens > now) {
      state.has_next = true;
      state.next = o;
    }
  }
  return state;
}

int64_t RandomDelaySeconds(const UpdateWindow& window, const WindowState& state, int64_t now,
                           uint64_t seed) {
  int64_t bound = static_cast<int64_t>(window.random_delay_minutes) * 60;
  if (window.limited && state.inside) bound = std::min(bound, state.current.closes - now);
  if (bound <= 1) return 0;
  std::mt19937_64 generator(seed);
  return std::uniform_int_distribution<int64_t>(0, bound - 1)(generator);
}

std::string LocalTimeText(int64_t when) {
  const time_t t = static_cast<time_t>(when);
  struct tm local {};
  char text[40] = "";
  if (localtime_r(&t, &local) == nullptr ||
      strftime(text, sizeof(text), "%Y-%m-%d %H:%M", &local) == 0)
    return "an unknown time";
  return text;
}

bool ParseLocalTime(const std::string& text, int64_t* out) {
  // "YYYY-MM-DDTHH:MM"
  if (text.size() != 16 || text[4] != '-' || text[7] != '-' ||
      (text[10] != 'T' && text[10] != ' ') || text[13] != ':')
    return false;
  for (size_t i : {0, 1, 2, 3, 5, 6, 8, 9, 11, 12, 14, 15}) {
    if (text[i] < '0' || text[i] > '9') return false;
  }
  struct tm t {};
  t.tm_year = std::stoi(text.substr(0, 4)) - 1900;
  t.tm_mon = std::stoi(text.substr(5, 2)) - 1;
  t.tm_mday = std::stoi(text.substr(8, 2));
  t.tm_hour = std::stoi(text.substr(11, 2));
  t.tm_min = std::stoi(text.substr(14, 2));
  t.tm_isdst = -1;
  if (t.tm_mon > 11 || t.tm_mday < 1 || t.tm_mday > 31 || t.tm_hour > 23 || t.tm_min > 59)
    return false;
  const int mday = t.tm_mday;
  const time_t when = mktime(&t);
  if (when == static_cast<time_t>(-1) || t.tm_mday != mday) return false;  // no such day
  *out = static_cast<int64_t>(when);
  return true;
}

}  // namespace KIVOPackageServer
