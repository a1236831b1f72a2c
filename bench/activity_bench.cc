// What the activity log costs:
//
// 1. The time recording adds to a trivial changing web API call (Setting
//    "set" of the update channel, through the real entry.cgi): the median of
//    the same call with recording on and with recording off, alternated in
//    one run. Off is the log made unavailable the cheapest way the product
//    knows (a folder stands where the file would be: the call goes on
//    unrecorded at once, after loading libsqlite3 as on, and as a kivo-webd
//    child finds it loaded). Beside it, the median of what a request
//    process does to record (a fresh connection, Begin, Finish) measured in
//    process.
// 2. A query of one package's history (its newest 50 entries and the count)
//    among 100,000 entries: in process with a fresh connection as each
//    request has, and through entry.cgi ("KIVO.Core.Package.Activity"
//    "list").
//
//   activity_bench [calls per side]      (default 100)

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include "activity/activity_log.h"
#include "bench_setup.h"
#include "taskmgr/sqlite_api.h"
#include "testing/cgi_client.h"
#include "testing/temp_root.h"

namespace {

using Clock = std::chrono::steady_clock;
using KivoActivity::ActivityLog;

constexpr long long kEntries = 100000;
constexpr int kPackages = 300;
constexpr char kSetting[] = "KIVO.Core.Package.Setting";
constexpr char kActivity[] = "KIVO.Core.Package.Activity";

double Ms(Clock::duration d) { return std::chrono::duration<double, std::milli>(d).count(); }

double Median(std::vector<double> v) {
  std::sort(v.begin(), v.end());
  return v.empty() ? 0 : v[v.size() / 2];
}

std::string PackageId(long long i) { return "bench-pkg-" + std::to_string(i % kPackages); }

// Fills the log with kEntries finished entries, spread over kPackages
// packages, in one transaction: the product writes one entry per commit,
// which for 100,000 would measure the disk, not the query.
void Fill(const std::string& path) {
  {
    ActivityLog log;  // makes the file and its schema
    KivoActivity::Operation op;
    op.name = "Control.start";
    op.packages = {PackageId(0)};
    Require(log.Record({"admin", KivoActivity::kOriginWeb, "127.0.0.1"}, op, {0, "success"}),
            "first entry");
  }
  sqlite3* db = nullptr;
  Require(NVX::Sqlite()->open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE, nullptr) == SQLITE_OK,
          "open " + path);
  auto exec = [&](const char* sql) {
    Require(NVX::Sqlite()->exec(db, sql, nullptr, nullptr, nullptr) == SQLITE_OK, sql);
  };
  exec("BEGIN");
  sqlite3_stmt* entry = nullptr;
  sqlite3_stmt* package = nullptr;
  NVX::Sqlite()->prepare_v2(db,
                            "INSERT INTO activity (started, ended, state, actor, origin, address,"
                            " operation, target, code, words, pid, pid_start)"
                            " VALUES (?, ?, 'success', 'admin', 'web', '192.0.2.1', ?, ?, 0,"
                            " 'success', 1, 1)",
                            -1, &entry, nullptr);
  NVX::Sqlite()->prepare_v2(db, "INSERT INTO activity_package VALUES (?, last_insert_rowid())", -1,
                            &package, nullptr);
  Require(entry && package, "prepare");
  const char* operations[] = {"Control.start", "Control.stop", "Installation.install",
                              "Setting.set"};
  const long long now = KivoActivity::NowMs();
  for (long long i = 1; i < kEntries; ++i) {
    const long long started = now - (kEntries - i) * 1000;
    const std::string id = PackageId(i);
    const std::string target = "{\"id\":\"" + id + "\"}";
    NVX::Sqlite()->bind_int64(entry, 1, started);
    NVX::Sqlite()->bind_int64(entry, 2, started + 40);
    NVX::Sqlite()->bind_text(entry, 3, operations[i % 4], -1, SQLITE_TRANSIENT);
    NVX::Sqlite()->bind_text(entry, 4, target.c_str(), -1, SQLITE_TRANSIENT);
    Require(NVX::Sqlite()->step(entry) == SQLITE_DONE, "insert entry");
    NVX::Sqlite()->reset(entry);
    NVX::Sqlite()->bind_text(package, 1, id.c_str(), -1, SQLITE_TRANSIENT);
    Require(NVX::Sqlite()->step(package) == SQLITE_DONE, "insert package");
    NVX::Sqlite()->reset(package);
  }
  NVX::Sqlite()->finalize(entry);
  NVX::Sqlite()->finalize(package);
  exec("COMMIT");
  NVX::Sqlite()->close(db);
}

// Recording on or off for the calls that follow: off, a folder stands
// where the log would be and the log is kept aside.
void SetRecording(bool on, const std::string& path) {
  const std::string aside = path + ".bench-aside";
  if (on) {
    Require(rmdir(path.c_str()) == 0 && rename(aside.c_str(), path.c_str()) == 0, "recording on");
  } else {
    Require(rename(path.c_str(), aside.c_str()) == 0 && mkdir(path.c_str(), 0700) == 0,
            "recording off");
  }
}

void CostOfRecording(const ApiClient& admin, const std::string& path, int calls) {
  std::vector<double> on, off, in_process;
  const char* channels[] = {"Beta", "Stable"};
  for (int i = 0; i < calls; ++i) {
    for (bool recording : {true, false}) {
      if (!recording) SetRecording(false, path);
      const auto begun = Clock::now();
      CgiAnswer a = admin.Call(kSetting, "set", 1, {{"update_channel", channels[i % 2]}});
      (recording ? on : off).push_back(Ms(Clock::now() - begun));
      Require(a.Success(), "Setting set: " + a.body);
      if (!recording) SetRecording(true, path);
    }
    const auto begun = Clock::now();
    {
      ActivityLog log;  // a fresh connection, as each request process has
      KivoActivity::Operation op;
      op.name = "Setting.set";
      op.target["update_channel"] = channels[i % 2];
      long long id = log.Begin({"admin", KivoActivity::kOriginWeb, "127.0.0.1"}, op);
      Require(log.Finish(id, {0, "success"}), "in-process entry");
    }
    in_process.push_back(Ms(Clock::now() - begun));
  }
  printf("trivial changing call (Setting set, entry.cgi), %d calls each, median:\n", calls);
  printf("  recording on   %8.2f ms\n", Median(on));
  printf("  recording off  %8.2f ms\n", Median(off));
  printf("  added          %8.2f ms   (target: under 1 ms)\n", Median(on) - Median(off));
  printf("  recording alone, in process (open, begin, finish): %.2f ms\n", Median(in_process));
}

void HistoryQuery(const ApiClient& admin, int queries) {
  std::vector<double> in_process, through_api;
  long long total = 0;
  for (int i = 0; i < queries; ++i) {
    KivoActivity::Filter filter;
    filter.package = PackageId(i * 7);
    const auto begun = Clock::now();
    {
      ActivityLog log;
      Json::Value entries;
      Require(log.List(filter, 0, 50, &entries, &total), "list");
      Require(entries.size() == 50, "a page of 50");
    }
    in_process.push_back(Ms(Clock::now() - begun));
    const auto asked = Clock::now();
    CgiAnswer a = admin.Call(kActivity, "list", 1, {{"package", filter.package}, {"limit", "50"}});
    through_api.push_back(Ms(Clock::now() - asked));
    Require(a.Success() && a.Data()["entries"].size() == 50, "Activity list: " + a.body);
  }
  printf("one package's history (newest 50 of %lld) among %lld entries, %d queries, median:\n",
         total, kEntries, queries);
  printf("  in process, fresh connection  %8.2f ms   (target: under 20 ms)\n", Median(in_process));
  printf("  through entry.cgi             %8.2f ms\n", Median(through_api));
}

}  // namespace

int main(int argc, char** argv) {
  UseBuildDirOfThisProgram();
  const int calls = argc > 1 ? std::max(1, atoi(argv[1])) : 100;
  TempRoot root;
  root.AddAccount("admin", "secret", {"administrators"});
  // Room for the 100,000 entries: the bound drops the oldest beyond it.
  root.Write("/etc/kivo/activity.conf", "max_entries=\"200000\"\n");
  const std::string path = ActivityLog::Path();
  Fill(path);
  ApiClient admin("admin", "secret");
  Require(admin.signed_in(), "sign-in");
  CostOfRecording(admin, path, calls);
  HistoryQuery(admin, 50);
  return 0;
}
