// The activity log: who changed what on the appliance, when, from where and
// with what outcome. One SQLite database under the system root,
// "var/lib/kivo/activity.db" (mode 0600), written by the process that does
// the work: an entry is begun when an operation starts and finished when it
// ends, so an operation whose process was killed stays begun and reads as
// "unfinished" once its process is gone.
//
// Recording never stands in the way of the operation it records: every
// write failure (a missing folder, a lock held too long, a damaged file) is
// logged to syslog and answered false or 0, and the caller goes on. A file
// that is not a database is set aside ("activity.db.damaged-<ms>") and a
// fresh one started.
//
// The log is bounded by the root's "etc/kivo/activity.conf": at most
// `max_entries` entries (default 10000) and none older than `max_age_days`
// (default 365); each new entry drops what falls outside, oldest first.
//
// An ActivityLog holds one connection for the process that made it; a child
// forked from that process opens its own. Not for use by two threads at once.
#pragma once

#include <string>
#include <sys/types.h>
#include <vector>

#include <json/value.h>

struct sqlite3;

namespace KivoActivity {

// Where an operation came from.
inline constexpr char kOriginWeb[] = "web";
inline constexpr char kOriginKivoctl[] = "kivoctl";
inline constexpr char kOriginWatchdog[] = "watchdog";
// The upgrades `kivoctl auto-update` makes, one entry each.
inline constexpr char kOriginAutoUpdate[] = "auto-update";

// An entry's state: under way, ended well or badly, or begun by a process
// that is gone without finishing it.
inline constexpr char kStateRunning[] = "running";
inline constexpr char kStateSuccess[] = "success";
inline constexpr char kStateFailure[] = "failure";
inline constexpr char kStateUnfinished[] = "unfinished";

// Who asked for an operation: an account (web) or a unix user (kivoctl), its
// origin and, for the web, the client's address.
struct Actor {
  std::string name;
  std::string origin;
  std::string address;
};

// What an operation is and what it named: `target` is an object of the
// request's recordable values only (never a secret); `packages` the package
// ids it concerns, by which the log is searched.
struct Operation {
  std::string name;  // "Installation.install", "Control.start", "sign-in", ...
  Json::Value target = Json::Value(Json::objectValue);
  std::vector<std::string> packages;
};

// How it ended: the answer's code (0 for success) and its words.
struct Outcome {
  int code = 0;
  std::string words;
};

// What a reader asks for. Empty strings and negative times filter nothing;
// `state` is one of the states above. Times are ms since the epoch.
struct Filter {
  std::string package;
  std::string account;
  std::string operation;
  std::string state;
  long long since_ms = -1;
  long long until_ms = -1;
};

// The most entries one page may hold.
inline constexpr int kMaxPage = 500;

// The log's bounds as the root's configuration sets them.
struct Bounds {
  long long max_entries = 10000;
  long long max_age_days = 365;
};
Bounds LoadBounds();

// `text` without the user and password an address may carry
// ("https://user:pw@host/" -> "https://host/"): what is recorded of any
// address.
std::string WithoutCredentials(std::string text);

// The milliseconds since the epoch, the log's clock.
long long NowMs();

class ActivityLog {
 public:
  ActivityLog();
  ~ActivityLog();
  ActivityLog(const ActivityLog&) = delete;
  ActivityLog& operator=(const ActivityLog&) = delete;

  // Records that `actor` started `op` now, by this process; drops what falls
  // outside the bounds. The entry's id, or 0 when it cannot be recorded.
  [[nodiscard]] long long Begin(const Actor& actor, const Operation& op);
  // Records how entry `id` (from Begin) ended, unless this process handed
  // it over (HandOver), in which case it is left to the taker. False when it
  // cannot be written (or `id` is 0).
  [[nodiscard]] bool Finish(long long id, const Outcome& outcome);
  // Hands the entries this process began and has not finished to process
  // `taker`, a child that goes on with the work after this process answers
  // (a server install's download worker): from now on they are running
  // while the taker lives, unfinished once it is gone, and ended by its
  // FinishHandedOver. False when the log cannot be written; the entries then
  // stay this process's.
  [[nodiscard]] bool HandOver(pid_t taker);
  // In the taker: records how the entries handed to this process ended.
  // False when they cannot be written; true when there were none.
  [[nodiscard]] bool FinishHandedOver(const Outcome& outcome);
  // Begin and Finish in one, for an operation that is over as it is known
  // (a sign-in).
  [[nodiscard]] bool Record(const Actor& actor, const Operation& op, const Outcome& outcome);

  // The entries that match `filter`, newest first, from `offset` on, at most
  // `limit` (1 to kMaxPage); `*total` gets how many match in all. Each entry
  // is an object: id, started, ended (null unless finished), duration_ms,
  // actor, origin, address, operation, target, packages, state, code, words.
  // Entries begun by a process that is gone are marked unfinished first.
  // False when the log cannot be read (a log never written reads empty).
  [[nodiscard]] bool List(const Filter& filter, long long offset, int limit, Json::Value* entries,
                          long long* total);

  // Marks the entries begun by processes that are gone as unfinished.
  // False when the log cannot be written.
  [[nodiscard]] bool SweepUnfinished();

  // "<root>/var/lib/kivo/activity.db".
  static std::string Path();

 private:
  sqlite3* db_ = nullptr;
  pid_t pid_ = 0;
  std::string path_;

  // The connection of this process, opened on first use; null on failure.
  sqlite3* Open();
  bool OpenFile(const std::string& path);
  void Close();
  bool Exec(const char* sql);
  bool DropOutsideBounds(long long newest_id);
};

}  // namespace KivoActivity
