#include "testing/upgrade_fixture.h"

#include <algorithm>

#include "klibc/atomic_file.h"
#include "pkgtool/registry.h"

const char kWriteTestData[] =
    "D=\"$KIVO_PKG_VAR\"\n"
    "mkdir -p \"$D/db/journal\"\n"
    "printf 'row1\\000row2\\377\\n' > \"$D/db/main.db\"\n"
    "echo 'entry' > \"$D/db/journal/0001\"\n"
    "echo 'secret=1' > \"$D/config\"; chmod 600 \"$D/config\"\n"
    "ln -s db/main.db \"$D/current\"\n"
    "ln \"$D/config\" \"$D/config.bak\"\n"
    "touch -d '2001-02-03 04:05:06' \"$D/db/journal/0001\" \"$D/db\"\n";

const char kRewriteTestData[] =
    "D=\"$KIVO_PKG_VAR\"\n"
    "echo 'migrated' > \"$D/db/main.db\"\n"
    "rm -rf \"$D/db/journal\" \"$D/current\"\n"
    "echo 'new' > \"$D/v2-only\"\n"
    "chmod 644 \"$D/config\"\n";

void UpgradeFixture::SetUp() {
  root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
  dir_ = root_.Path("/tmp/packages");
  data_ = root_.Path("/volume1/@appdata/test-app");
  ASSERT_EQ(0, KIVOFSMkdirP(dir_.c_str()));
  v1_.files = {{"version.txt", "1\n"}};
  v1_.scripts = {{"postinst", kWriteTestData}};
  v2_ = v1_;
  v2_.version = "2.0";
  v2_.files = {{"version.txt", "2\n"}};
  v2_.scripts = {};
}

void UpgradeFixture::TearDown() { StopInstalledPackages(); }

int UpgradeFixture::Install(const TestPackage& p, const std::vector<std::string>& extra) {
  std::vector<std::string> args = {"install", p.Build(dir_)};
  args.insert(args.end(), extra.begin(), extra.end());
  return Kivoctl(args, &out_);
}

void UpgradeFixture::ExpectSaid(const std::string& words) {
  EXPECT_NE(std::string::npos, out_.find(words)) << "missing: " << words << "\n" << out_;
}

std::string UpgradeFixture::Status() {
  std::string out;
  Kivoctl({"status", "test-app"}, &out);
  return out;
}

std::string UpgradeFixture::Fingerprint() {
  std::string listing, digests;
  RunProgram({"sh", "-c",
              "find \"$1\" -mindepth \"$2\" -not -name daemon.pid -printf "
              "'%P|%y|%m|%U:%G|%s|%T@|%n|%l\\n' | sort",
              "sh", data_, fingerprint_folder_itself_ ? "0" : "1"},
             &listing);
  RunProgram(
      {"sh", "-c", "cd \"$1\" && find . -type f -not -name daemon.pid -exec sha256sum {} + | sort",
       "sh", data_},
      &digests);
  return listing + digests;
}

void UpgradeFixture::ExpectNothingLeftBut(size_t kept) {
  const DataCopies copies = ListDataCopies(root_.Path("/volume1/@appdata/.snapshots"));
  EXPECT_EQ(kept, copies.entries.size());
  EXPECT_EQ(kept, copies.kept);
  const size_t installed = PackageRegistry::List().size();
  for (const char* dir : {"/var/packages/.records", "/volume1/@appstore"}) {
    const std::string names = Entries(dir);
    EXPECT_EQ(installed + kept, static_cast<size_t>(std::count(names.begin(), names.end(), '\n')))
        << dir << ":\n"
        << names;
  }
}

std::string UpgradeFixture::Entries(const std::string& dir) {
  std::string out;
  RunProgram({"ls", "-A", root_.Path(dir)}, &out);
  return out.find("No such file") != std::string::npos ? "" : out;
}
