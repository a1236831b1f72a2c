// Upgrades a package whose data folder holds many files (1 GiB in 10,000 by
// default) with the safety copy of its data and without it, and prints both
// times next to `cp -a` of the same folder, all measured in the same run:
// first on the file system of the temporary root, then on an XFS file system
// with reflinks and last on a Btrfs one (where the data folder is a
// subvolume and its copy a snapshot), each made in a file under the
// temporary root and mounted through a loop device as the root's only
// volume (this needs root, mkfs.xfs or mkfs.btrfs and a free loop device;
// the benchmark says which is missing).
//
//   upgrade_bench [data MiB] [files] [rounds] [file systems]
//
// (default 1024, 10000, 3, and every file system: "root,xfs,btrfs").
//
// Each figure is the median of `rounds` measurements. Every timed step
// starts after a sync, so that none pays for writing back what the one
// before it wrote, and reads the data from the page cache.

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <fcntl.h>
#include <functional>
#include <string>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <vector>

#include "bench_setup.h"
#include "pkgtool/btrfs_subvolume.h"
#include "pkgtool/data_snapshot.h"
#include "pkgtool/tree_copy.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr char kId[] = "bench-data";
// What the tool's operation log says when the package declines the copy.
constexpr char kNoCopyNote[] = "no safety copy of the data";

// Where the benchmark measures: the temporary root's own file system, XFS
// with reflinks, Btrfs.
enum FileSystems : unsigned { kOnRoot = 1, kOnXfs = 2, kOnBtrfs = 4, kOnAll = 7 };

struct Options {
  uint64_t data_bytes = 1024ull << 20;
  uint64_t files = 10000;
  int rounds = 3;
  unsigned file_systems = kOnAll;
};

// Reads a comma-separated list of "root", "xfs" and "btrfs" into *set;
// false when it names anything else.
bool ParseFileSystems(const std::string& list, unsigned* set) {
  *set = 0;
  for (size_t start = 0; start <= list.size();) {
    size_t end = list.find(',', start);
    if (end == std::string::npos) end = list.size();
    const std::string name = list.substr(start, end - start);
    if (name == "root")
      *set |= kOnRoot;
    else if (name == "xfs")
      *set |= kOnXfs;
    else if (name == "btrfs")
      *set |= kOnBtrfs;
    else
      return false;
    start = end + 1;
  }
  return *set != 0;
}

// Reads the command line into *o; false when one of the first three
// arguments is not a positive number or the fourth names no file system.
bool ParseOptions(int argc, char** argv, Options* o) {
  uint64_t values[3] = {o->data_bytes >> 20, o->files, static_cast<uint64_t>(o->rounds)};
  if (argc > 5) return false;
  for (int i = 1; i < argc && i <= 3; ++i) {
    char* end = nullptr;
    values[i - 1] = std::strtoull(argv[i], &end, 10);
    if (*end != '\0' || values[i - 1] == 0 || values[i - 1] > 1000000) return false;
  }
  if (argc == 5 && !ParseFileSystems(argv[4], &o->file_systems)) return false;
  o->data_bytes = values[0] << 20;
  o->files = values[1];
  o->rounds = static_cast<int>(values[2]);
  return true;
}

std::string Trimmed(std::string text) {
  while (!text.empty() && (text.back() == '\n' || text.back() == ' ')) text.pop_back();
  return text;
}

// Runs a command; true when it exits 0. Its output (stdout and stderr) goes
// to *out.
bool Succeeds(const std::vector<std::string>& argv, std::string* out = nullptr) {
  std::string text;
  const bool ok = RunProgram(argv, &text) == 0;
  if (out) *out = Trimmed(text);
  return ok;
}

// The seconds a command takes, started after a sync; ends the program when
// the command fails. Its output goes to *out.
double TimeOrExit(const std::vector<std::string>& argv, std::string* out = nullptr) {
  Require(Succeeds({"sync"}), "sync");
  const Clock::time_point start = Clock::now();
  std::string text;
  const bool ok = Succeeds(argv, &text);
  const double seconds = std::chrono::duration<double>(Clock::now() - start).count();
  Require(ok, argv[0] + " " + argv[1] + ": " + text);
  if (out) *out = text;
  return seconds;
}

// Writes `files` files of `bytes` in all (give or take a few bytes) below
// `dir`, 100 to a folder, their sizes spread from a quarter of the mean to
// 1.75 times it. Returns the bytes written.
uint64_t WriteDataOrExit(const std::string& dir, uint64_t bytes, uint64_t files) {
  constexpr size_t kChunk = 1 << 20;
  std::vector<char> random(kChunk + 4096);
  uint64_t seed = 88172645463325252ull;
  for (size_t i = 0; i + 8 <= random.size(); i += 8) {
    seed ^= seed << 13;
    seed ^= seed >> 7;
    seed ^= seed << 17;
    std::copy_n(reinterpret_cast<const char*>(&seed), 8, &random[i]);
  }
  const uint64_t mean = bytes / files;
  const uint64_t quarters[] = {1, 2, 4, 6, 7};  // mean 4 quarters
  uint64_t written = 0;
  for (uint64_t n = 0; n < files; ++n) {
    const std::string folder = dir + "/d" + std::to_string(n / 100);
    if (n % 100 == 0) MakeDirOrExit(folder);
    const std::string path = folder + "/f" + std::to_string(n);
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
    Require(fd >= 0, "create " + path);
    uint64_t left = mean * quarters[n % 5] / 4;
    for (size_t offset = (n * 8) % 4096; left > 0;) {
      const ssize_t done = write(fd, &random[offset], std::min<uint64_t>(left, kChunk));
      Require(done > 0, "write " + path);
      left -= static_cast<uint64_t>(done);
      written += static_cast<uint64_t>(done);
    }
    Require(close(fd) == 0, "close " + path);
  }
  return written;
}

// The two packages the benchmark upgrades: one never started, whose upgrade
// takes what the tool itself spends, and one whose service runs, whose
// upgrade also stops it, starts it again and waits for the health gate, as
// an upgrade on an appliance does.
enum class Kind { kIdle, kService };

// Version `major`.0 of the benchmark's package of kind `kind`: a small
// payload. `copy` false declines the safety copy in INFO; nothing else
// differs.
std::string BuildVersionOrExit(const std::string& dir, int major, bool copy, Kind kind) {
  TestPackage p;
  p.id = kId;
  p.version = std::to_string(major) + ".0";
  p.daemon = kind == Kind::kService;
  if (kind == Kind::kIdle) p.info = {{"startable", "no"}};
  if (!copy) p.info[kPMSDataCopyKey] = "no";
  p.files = {{"bin/app", "#!/bin/sh\necho " + p.version + "\n"}};
  const std::string file = p.Build(dir);
  Require(access(file.c_str(), R_OK) == 0, std::string("build of ") + kId + " " + p.version);
  return file;
}

double Median(std::vector<double> v) {
  std::sort(v.begin(), v.end());
  return v[v.size() / 2];
}

struct Samples {
  std::vector<double> with_copy, without_copy, cp, rm;
};

// One round: cp -a of the data folder to a sibling, the upgrade to
// `major`.0 without the safety copy and the upgrade to `major`+1 with it,
// each timed. Each copy first removes what the same copy of the round
// before left: cp -a's copy (the removal timed apart), and the safety copy
// that upgrade kept (untimed: an upgrade that keeps its own copy drops the
// one before, keep_revisions, and removing a gigabyte is not what the copy
// costs). The removals must come in that order, each right before its
// copy: ext4 passes over inodes freed in the last half minute when it
// allocates new ones, so a copy that follows the removal of 10,000 files
// is slower than one that does not, and an order that spared either copy
// would misstate the ratio. Checks from the tool's log that each upgrade
// did what it is timed as.
void MeasureRoundOrExit(const std::string& packages, const std::string& data, int major, Kind kind,
                        Samples* s) {
  const std::string sibling = data + ".cp";
  const std::string kivoctl = BuildDir() + "/bin/kivoctl";
  if (access(sibling.c_str(), F_OK) == 0) s->rm.push_back(TimeOrExit({"rm", "-rf", sibling}));
  s->cp.push_back(TimeOrExit({"cp", "-a", data, sibling}));
  const std::string without = BuildVersionOrExit(packages, major, false, kind);
  const std::string with = BuildVersionOrExit(packages, major + 1, true, kind);
  std::string log;
  s->without_copy.push_back(TimeOrExit({kivoctl, "install", without}, &log));
  Require(log.find(kNoCopyNote) != std::string::npos, "the upgrade without a copy: " + log);
  // The first upgrade with the copy has no kept copy to drop.
  if (major > 2) Require(Succeeds({kivoctl, "drop-revision", kId}), "drop-revision");
  s->with_copy.push_back(TimeOrExit({kivoctl, "install", with}, &log));
  Require(log.find(kNoCopyNote) == std::string::npos, "the upgrade with the copy: " + log);
}

// The room a copy of `dir` takes: what the upgrades must leave unchanged.
uint64_t SurveyOrExit(const std::string& dir) {
  TreeSurvey survey;
  Require(PMSSurveyTree(dir, &survey), "survey of " + dir + ": " + survey.problem);
  return survey.bytes;
}

void PrintRow(const char* what, double seconds, double mib) {
  printf("  %-44s %8.3f", what, seconds);
  if (mib > 0 && seconds > 0) printf(" %8.0f", mib / seconds);
  printf("\n");
}

// Whether a target was met, or that it is another file system's.
const char* Verdict(bool applies, bool met) {
  if (!applies) return "does not apply here";
  return met ? "met" : "NOT met";
}

// How much the rounds differ: the copy's part of each round, with the
// upgrade without the copy of the same round taken from the one with it.
void PrintSpread(const Samples& s) {
  std::vector<double> parts;
  for (size_t i = 0; i < s.with_copy.size() && i < s.without_copy.size(); ++i)
    parts.push_back((s.with_copy[i] - s.without_copy[i]) * 1000);
  std::sort(parts.begin(), parts.end());
  printf("  the copy's part per round: least %.1f ms, median %.1f ms, most %.1f ms\n",
         parts.front(), Median(parts), parts.back());
}

void Report(const Samples& s, double mib, bool reflinks) {
  const double a = Median(s.with_copy), b = Median(s.without_copy);
  const double cp = Median(s.cp), copy = a - b;
  printf("  %-44s %8s %8s\n", "", "seconds", "MiB/s");
  PrintRow("(a) upgrade with the safety copy", a, 0);
  PrintRow("(b) upgrade with upgrade_data_copy=no", b, 0);
  PrintRow("    the copy's part, a - b", copy, mib);
  PrintRow("(c) cp -a of the data folder", cp, mib);
  PrintRow("    rm -rf of cp -a's copy (not in c)", Median(s.rm), 0);
  PrintSpread(s);
  const double overhead = copy / b * 100;
  printf("  copy overhead (a - b) / b: %.1f%%; target with reflinks < 5%%: %s\n", overhead,
         Verdict(reflinks, overhead < 5));
  if (copy <= 0) {
    printf("  copy speed vs cp -a: the copy took no measurable time\n");
    return;
  }
  const double speed = cp / copy;
  printf("  copy speed vs cp -a, c / (a - b): %.2fx; target without reflinks >= 0.8x: %s\n", speed,
         Verdict(!reflinks, speed >= 0.8));
}

// The rounds for the package of kind `kind`, installed as version
// `*major`.0, and their figures; `*major` is then the last version.
void MeasureKind(const std::string& packages, const std::string& data, const Options& o, double mib,
                 bool reflinks, Kind kind, int* major) {
  Samples s;
  for (int round = 0; round < o.rounds; ++round, *major += 2)
    MeasureRoundOrExit(packages, data, *major + 1, kind, &s);
  s.rm.push_back(TimeOrExit({"rm", "-rf", data + ".cp"}));
  Report(s, mib, reflinks);
}

// Installs the package on volume `volume` of `root` (the only volume the
// tool will choose), fills its data folder and prints the figures: for the
// package never started, and where copies share blocks (where the copy is
// cheap enough that what else the upgrade does matters) for the package
// whose service runs. Ends the program when a step fails.
void MeasureVolume(const TempRoot& root, const std::string& volume, const Options& o) {
  WriteOrExit(root.Path("/etc/kivoinfo.conf"), "pkg_source_trust_level=\"1\"\n");
  const std::string packages = root.Path("/tmp/packages");
  MakeDirOrExit(packages);
  std::string out;
  const std::string kivoctl = BuildDir() + "/bin/kivoctl";
  int major = 1;
  const std::string first = BuildVersionOrExit(packages, major, true, Kind::kIdle);
  Require(Succeeds({kivoctl, "install", first}, &out), "install: " + out);
  const std::string appdata = root.Path(volume + "/@appdata");
  const std::string data = appdata + "/" + kId;
  const Clock::time_point start = Clock::now();
  const double mib = WriteDataOrExit(data, o.data_bytes, o.files) / 1048576.0;
  const double writing = std::chrono::duration<double>(Clock::now() - start).count();
  const uint64_t room = SurveyOrExit(data);
  Require(Succeeds({"findmnt", "-n", "-o", "FSTYPE", "-T", data}, &out), "findmnt " + data);
  const bool reflinks = PMSSnapshotsShareBlocks(appdata);
  printf(
      "%s: %.0f MiB in %llu files (written in %.1f s), reflinks: %s, copy: %s, median of %d "
      "rounds\n",
      out.c_str(), mib, static_cast<unsigned long long>(o.files), writing, reflinks ? "yes" : "no",
      PMSIsSubvolume(data) ? "a snapshot" : "file by file", o.rounds);
  printf("Upgrades of a package never started (what the tool itself spends):\n");
  MeasureKind(packages, data, o, mib, reflinks, Kind::kIdle, &major);
  if (reflinks) {
    printf("Upgrades of a package whose service runs (stopped, started again, health gate):\n");
    const std::string service = BuildVersionOrExit(packages, ++major, true, Kind::kService);
    Require(Succeeds({kivoctl, "install", service}, &out), "install: " + out);
    Require(Succeeds({kivoctl, "start", kId}, &out), "start: " + out);
    MeasureKind(packages, data, o, mib, reflinks, Kind::kService, &major);
    Require(Succeeds({kivoctl, "stop", kId}, &out), "stop: " + out);
  }
  Require(SurveyOrExit(data) == room, "the data folder changed during the upgrades");
}

// Runs `measure` in a child process, so that however it ends (a failed step
// ends the program), the caller still cleans up after it. False when it did
// not finish.
bool RunInChild(const std::function<void()>& measure) {
  fflush(stdout);
  fflush(stderr);
  const pid_t pid = fork();
  if (pid == 0) {
    signal(SIGINT, SIG_DFL);
    signal(SIGTERM, SIG_DFL);
    measure();
    fflush(stdout);
    _exit(0);
  }
  int status = 0;
  if (pid < 0) return false;
  while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
  }
  if (WIFSIGNALED(status)) printf("The measurement was ended by signal %d.\n", WTERMSIG(status));
  return WIFEXITED(status) && WEXITSTATUS(status) == 0;
}

// Keeps SIGINT and SIGTERM from ending this process while it lives: they
// end the measuring child, and this process then cleans up.
class HoldSignals {
 public:
  HoldSignals() {
    int_ = signal(SIGINT, SIG_IGN);
    term_ = signal(SIGTERM, SIG_IGN);
  }
  ~HoldSignals() {
    signal(SIGINT, int_);
    signal(SIGTERM, term_);
  }
  HoldSignals(const HoldSignals&) = delete;
  HoldSignals& operator=(const HoldSignals&) = delete;

 private:
  void (*int_)(int);
  void (*term_)(int);
};

// The full path of program `name` on PATH or in the system folders root's
// PATH holds; "" when there is none.
std::string FindProgram(const std::string& name) {
  const char* path = getenv("PATH");
  std::string dirs = std::string(path ? path : "") + ":/usr/sbin:/sbin:/usr/bin:/bin";
  for (size_t start = 0; start <= dirs.size();) {
    size_t end = dirs.find(':', start);
    if (end == std::string::npos) end = dirs.size();
    const std::string candidate = dirs.substr(start, end - start) + "/" + name;
    if (end > start && access(candidate.c_str(), X_OK) == 0) return candidate;
    start = end + 1;
  }
  return "";
}

// A file system that shares blocks between copies: XFS with reflinks, or
// Btrfs, whose package data folders are subvolumes copied by snapshot.
struct LoopFsKind {
  const char* type;        // for mount -t
  const char* mkfs;        // the program that makes it
  const char* package;     // the Debian package that brings `mkfs`
  const char* options[3];  // its options before the image, up to a null
};
constexpr LoopFsKind kXfs = {"xfs", "mkfs.xfs", "xfsprogs", {"-q", "-m", "reflink=1"}};
constexpr LoopFsKind kBtrfs = {"btrfs", "mkfs.btrfs", "btrfs-progs", {"-q", nullptr, nullptr}};

// Such a file system in a file, attached to a loop device and mounted. The
// destructor unmounts it and detaches the device, whatever happened in
// between; the file itself stays for its owner to remove.
class LoopFs {
 public:
  explicit LoopFs(const LoopFsKind& kind) : kind_(kind) {}
  ~LoopFs();
  LoopFs(const LoopFs&) = delete;
  LoopFs& operator=(const LoopFs&) = delete;

  // Makes the file system in the new file `image` (sparse, `bytes` long)
  // and mounts it on the new folder `mount_point`. False with *why when it
  // cannot; what was made by then is undone by the destructor.
  [[nodiscard]] bool Make(const std::string& image, uint64_t bytes, const std::string& mount_point,
                          std::string* why);

 private:
  std::vector<std::string> MkfsCommand(const std::string& mkfs, const std::string& image) const;

  const LoopFsKind& kind_;
  std::string device_, mount_point_;
};

bool LoopFs::Make(const std::string& image, uint64_t bytes, const std::string& mount_point,
                  std::string* why) {
  const std::string mkfs = FindProgram(kind_.mkfs), losetup = FindProgram("losetup");
  std::string out;
  if (geteuid() != 0)
    *why = "it is not run as root";
  else if (mkfs.empty())
    *why = std::string(kind_.mkfs) + " is not installed (Debian package " + kind_.package + ")";
  else if (losetup.empty())
    *why = "losetup is not installed";
  if (!why->empty()) return false;
  const int fd = open(image.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, 0600);
  const bool sized = fd >= 0 && ftruncate(fd, static_cast<off_t>(bytes)) == 0;
  if (fd >= 0) close(fd);
  if (!sized)
    *why = "the image file " + image + " cannot be made";
  else if (!Succeeds(MkfsCommand(mkfs, image), &out))
    *why = std::string(kind_.mkfs) + ": " + out;
  else if (!Succeeds({losetup, "--find", "--show", image}, &out))
    *why = "no loop device: " + out;
  if (!why->empty()) return false;
  device_ = out;
  if (mkdir(mount_point.c_str(), 0755) != 0)
    *why = "cannot make " + mount_point;
  else if (!Succeeds({"mount", "-t", kind_.type, device_, mount_point}, &out))
    *why = "mount: " + out;
  else
    mount_point_ = mount_point;
  return why->empty();
}

std::vector<std::string> LoopFs::MkfsCommand(const std::string& mkfs,
                                             const std::string& image) const {
  std::vector<std::string> command = {mkfs};
  for (const char* option : kind_.options) {
    if (option) command.push_back(option);
  }
  command.push_back(image);
  return command;
}

LoopFs::~LoopFs() {
  std::string out;
  if (!mount_point_.empty() && !Succeeds({"umount", mount_point_}, &out)) {
    fprintf(stderr, "umount %s: %s; detaching it lazily\n", mount_point_.c_str(), out.c_str());
    if (!Succeeds({"umount", "-l", mount_point_}, &out))
      fprintf(stderr, "umount -l %s: %s\n", mount_point_.c_str(), out.c_str());
  }
  if (!device_.empty() && !Succeeds({FindProgram("losetup"), "-d", device_}, &out))
    fprintf(stderr, "losetup -d %s: %s\n", device_.c_str(), out.c_str());
}

// On the file system of the temporary root, volume /volume1 as the root is
// made.
bool MeasureOnTempRoot(const Options& o) {
  printf("\nOn the temporary root's file system:\n");
  TempRoot root;
  HoldSignals held;
  return RunInChild([&] { MeasureVolume(root, "/volume1", o); });
}

// On a file system of kind `kind` (`title` in the report) mounted as the
// root's only volume, /volume2.
bool MeasureOnLoop(const Options& o, const LoopFsKind& kind, const char* title) {
  TempRoot root;
  HoldSignals held;
  LoopFs fs(kind);
  const std::string volume = "/volume2";
  const uint64_t image_bytes = 3 * o.data_bytes + (1ull << 30);
  std::string why;
  if (!fs.Make(root.Path("/tmp/fs.img"), image_bytes, root.Path(volume), &why)) {
    printf("\nNo %s measurement: %s.\n", title, why.c_str());
    return true;
  }
  printf("\nOn %s in a loop-mounted file:\n", title);
  return RunInChild([&] {
    WriteOrExit(root.Path("/etc/kivo/volumes.json"),
                "[{\"path\": \"" + volume + "\", \"status\": \"normal\"}]\n");
    MeasureVolume(root, volume, o);
  });
}

}  // namespace

int main(int argc, char** argv) {
  Options o;
  if (!ParseOptions(argc, argv, &o)) {
    fprintf(stderr, "usage: upgrade_bench [data MiB] [files] [rounds]\n");
    return 2;
  }
  UseBuildDirOfThisProgram();
  std::string cp_version;
  Require(Succeeds({"cp", "--version"}, &cp_version), "cp --version");
  printf("cp -a is %s\n", cp_version.substr(0, cp_version.find('\n')).c_str());
  // A pass that failed or was interrupted ends the benchmark.
  if ((o.file_systems & kOnRoot) && !MeasureOnTempRoot(o)) return 1;
  if ((o.file_systems & kOnXfs) && !MeasureOnLoop(o, kXfs, "XFS (reflink=1)")) return 1;
  if ((o.file_systems & kOnBtrfs) &&
      !MeasureOnLoop(o, kBtrfs, "Btrfs (data folders are subvolumes)"))
    return 1;
  return 0;
}
