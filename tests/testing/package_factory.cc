#include "testing/package_factory.h"

#include <cstdlib>
#include <fcntl.h>
#include <signal.h>
#include <sys/sysmacros.h>
#include <sys/wait.h>
#include <unistd.h>

#include <archive.h>
#include <archive_entry.h>
#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/package_builder.h"
#include "pkgtool/package_file.h"
#include "pkgtool/registry.h"
#include "testing/temp_root.h"

namespace {

const char kDaemonScript[] =
    "PIDFILE=\"$KIVO_PKG_VAR/daemon.pid\"\n"
    "running() { [ -f \"$PIDFILE\" ] && kill -0 \"$(cat \"$PIDFILE\")\" 2>/dev/null; }\n"
    "case \"$1\" in\n"
    "  start) running && exit 0\n"
    "    sh -c 'trap \"exit 0\" TERM; while :; do sleep 0.2; done' >/dev/null 2>&1 </dev/null &\n"
    "    echo $! >\"$PIDFILE\" ;;\n"
    "  stop) running && kill \"$(cat \"$PIDFILE\")\"; rm -f \"$PIDFILE\" ;;\n"
    "  status) running ;;\n"
    "esac\n";

void Write(const std::string& path, const std::string& content, unsigned mode = 0644) {
  ASSERT_EQ(0, KIVOFSMkdirP(path.substr(0, path.rfind('/')).c_str())) << path;
  ASSERT_TRUE(KIVOWriteFileAtomic(path, content, SyncToDisk::No, mode)) << path;
}

}  // namespace

std::string TestPackage::Build(const std::string& dir) const {
  std::string src = dir + "/src-" + id + "-" + version;
  std::string info_text = "package=\"" + id + "\"\nversion=\"" + version + "\"\n";
  std::map<std::string, std::string> keys = info;
  if (daemon) keys.emplace("pidfile", "daemon.pid");
  for (const auto& kv : keys) info_text += kv.first + "=\"" + kv.second + "\"\n";
  Write(src + "/INFO", info_text);
  EXPECT_EQ(0, KIVOFSMkdirP((src + "/package").c_str())) << src;
  for (const auto& f : files) Write(src + "/package/" + f.first, f.second);
  std::map<std::string, std::string> all_scripts = scripts;
  if (daemon) all_scripts.emplace("start-stop-status", kDaemonScript);
  for (const auto& s : all_scripts)
    Write(src + "/scripts/" + s.first, "#!/bin/sh\n" + s.second, 0755);
  for (const auto& m : members) Write(src + "/" + m.first, m.second);
  std::string out = dir + "/" + id + "-" + version + ".kpk";
  std::string error;
  EXPECT_TRUE(PMSBuildPackage(src, out, BuildOptions(), &error)) << error;
  return out;
}

void WriteRawPayload(const std::string& path, const std::vector<RawEntry>& entries) {
  struct archive* a = archive_write_new();
  archive_write_set_format_pax_restricted(a);
  archive_write_add_filter_gzip(a);
  ASSERT_EQ(ARCHIVE_OK, archive_write_open_filename(a, path.c_str())) << path;
  for (const RawEntry& e : entries) {
    struct archive_entry* entry = archive_entry_new();
    archive_entry_set_pathname(entry, e.path.c_str());
    archive_entry_set_perm(entry, e.mode);
    std::string data = e.type == 'f' ? "content of " + e.path + "\n" : "";
    switch (e.type) {
      case 'f':
        archive_entry_set_filetype(entry, AE_IFREG);
        break;
      case 'd':
        archive_entry_set_filetype(entry, AE_IFDIR);
        break;
      case 'l':
        archive_entry_set_filetype(entry, AE_IFLNK);
        archive_entry_set_symlink(entry, e.target.c_str());
        break;
      case 'h':
        archive_entry_set_filetype(entry, AE_IFREG);
        archive_entry_set_hardlink(entry, e.target.c_str());
        break;
      case 'c':
        archive_entry_set_filetype(entry, AE_IFCHR);
        archive_entry_set_rdev(entry, makedev(1, 3));
        break;
    }
    archive_entry_set_size(entry, static_cast<la_int64_t>(data.size()));
    EXPECT_EQ(ARCHIVE_OK, archive_write_header(a, entry)) << e.path;
    if (!data.empty()) {
      EXPECT_EQ(static_cast<la_ssize_t>(data.size()),
                archive_write_data(a, data.data(), data.size()));
    }
    archive_entry_free(entry);
  }
  EXPECT_EQ(ARCHIVE_OK, archive_write_close(a));
  archive_write_free(a);
}

std::string BuildRawPackage(const std::string& dir, const std::string& id,
                            const std::vector<RawEntry>& entries) {
  std::string payload = dir + "/" + id + ".payload.tgz";
  WriteRawPayload(payload, entries);
  std::string out = dir + "/" + id + ".kpk";
  std::string error;
  // Room enough for every entry: what is tested here is what they are.
  std::string extractsize = std::to_string(4 * (entries.size() + 1));
  std::map<std::string, std::string> members = {
      {"INFO", "package=\"" + id + "\"\nversion=\"1.0\"\nstartable=\"no\"\nextractsize=\"" +
                   extractsize + "\"\n"}};
  EXPECT_TRUE(PMSWritePackage(members, payload, "", out, &error)) << error;
  unlink(payload.c_str());
  return out;
}

void WriteRawPackageFile(const std::string& path, const MemberList& members) {
  struct archive* a = archive_write_new();
  archive_write_set_format_pax_restricted(a);
  ASSERT_EQ(ARCHIVE_OK, archive_write_open_filename(a, path.c_str())) << path;
  for (const auto& m : members) {
    struct archive_entry* entry = archive_entry_new();
    archive_entry_set_pathname(entry, m.first.c_str());
    archive_entry_set_filetype(entry, AE_IFREG);
    archive_entry_set_perm(entry, 0644);
    archive_entry_set_size(entry, static_cast<la_int64_t>(m.second.size()));
    EXPECT_EQ(ARCHIVE_OK, archive_write_header(a, entry)) << m.first;
    if (!m.second.empty()) {
      EXPECT_EQ(static_cast<la_ssize_t>(m.second.size()),
                archive_write_data(a, m.second.data(), m.second.size()));
    }
    archive_entry_free(entry);
  }
  EXPECT_EQ(ARCHIVE_OK, archive_write_close(a));
  archive_write_free(a);
}

std::string Manifest(const MemberList& members) {
  std::string text = "KIVO-MANIFEST 1\n";
  for (const auto& m : members) text += "sha256 " + PMSSha256Hex(m.second) + " " + m.first + "\n";
  return text;
}

TestPackage PackageWithInfo(const std::string& id, const std::map<std::string, std::string>& info) {
  TestPackage package;
  package.id = id;
  package.info = info;
  return package;
}

int RunProgram(const std::vector<std::string>& argv, std::string* out,
               const std::map<std::string, std::string>& extra_env) {
  int fds[2];
  if (pipe(fds) != 0) return -1;
  pid_t pid = fork();
  if (pid == 0) {
    dup2(fds[1], STDOUT_FILENO);
    dup2(fds[1], STDERR_FILENO);
    close(fds[0]);
    for (const auto& e : extra_env) setenv(e.first.c_str(), e.second.c_str(), 1);
    std::vector<char*> args;
    for (const std::string& a : argv) args.push_back(const_cast<char*>(a.c_str()));
    args.push_back(nullptr);
    execvp(args[0], args.data());
    _exit(127);
  }
  close(fds[1]);
  std::string text;
  char buf[4096];
  for (ssize_t n; (n = read(fds[0], buf, sizeof(buf))) > 0;)
    text.append(buf, static_cast<size_t>(n));
  close(fds[0]);
  int status = 0;
  waitpid(pid, &status, 0);
  if (out) *out = text;
  return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

void KillAndReap(const std::vector<pid_t>& pids) {
  for (pid_t pid : pids) {
    kill(pid, SIGKILL);
    waitpid(pid, nullptr, 0);
  }
}

int Kivoctl(const std::vector<std::string>& args, std::string* out,
            const std::map<std::string, std::string>& extra_env) {
  std::vector<std::string> argv = {BuildDir() + "/bin/kivoctl"};
  argv.insert(argv.end(), args.begin(), args.end());
  return RunProgram(argv, out, extra_env);
}

void StopInstalledPackages() {
  for (const std::string& id : PackageRegistry::List()) Kivoctl({"stop", id});
}
