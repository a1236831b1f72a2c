// Damaged and hostile package files, made at test time from a good one
// built by the project's own builder and changed by a mutator: cut short at
// every member boundary and inside the payload, bytes flipped, members
// duplicated, hostile ids and INFO fields, size bombs. Each one is refused
// by `kivoctl inspect` and by `kivoctl install` with its result code, no
// process dies of a signal, and nothing is written under the system root or
// outside it.

#include <cstdlib>
#include <cstring>
#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/package_builder.h"
#include "pkgtool/package_file.h"
#include "pkgtool/result_codes.h"
#include "pkgtool/signature.h"
#include "testing/cgi_client.h"
#include "testing/gpg_keys.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

// One member of an uncompressed tar as the bytes lie: where its first
// header block starts (a pax header's, when it has one), where its data
// starts, and how long the data is.
struct TarMember {
  std::string name;
  size_t header = 0;
  size_t data = 0;
  size_t size = 0;
};

std::vector<TarMember> WalkTar(const std::string& bytes) {
  std::vector<TarMember> out;
  size_t pos = 0, first_header = 0;
  bool pending = false;
  while (pos + 512 <= bytes.size() && bytes[pos] != '\0') {
    const char* block = bytes.data() + pos;
    size_t size = std::strtoull(std::string(block + 124, 12).c_str(), nullptr, 8);
    if (!pending) first_header = pos;
    pending = block[156] == 'x' || block[156] == 'g';  // a pax header: the entry follows
    if (!pending)
      out.push_back({std::string(block, strnlen(block, 100)), first_header, pos + 512, size});
    pos += 512 + (size + 511) / 512 * 512;
  }
  return out;
}

// What a refusal must look like: kivoctl ran to its end (exit status 1,
// no signal) and named one of the expected codes.
struct Expect {
  std::string what;
  std::vector<int> codes;
};

class PackageCorpusTest : public ::testing::Test {
 protected:
  void SetUp() override {
    corpus_ = root_.Path("/corpus");
    ASSERT_EQ(0, KIVOFSMkdirP(corpus_.c_str()));
    root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"1\"\n");
    escape_ = "kivo-corpus-escape-" + std::to_string(getpid());
    TestPackage app;
    app.id = "corpus-app";
    std::string text;
    for (int i = 0; i < 2000; ++i) text += "line " + std::to_string(i * 7919 % 10007) + "\n";
    app.files = {{"bin/run.sh", "#!/bin/sh\necho run\n"}, {"share/data.txt", text}};
    app.scripts = {{"postinst", "exit 0\n"}};
    app.members = {{"LICENSE", "Use it well.\n"}, {"WIZARD_UIFILES/install_uifile", "[]"}};
    good_ = app.Build(corpus_);
    ASSERT_TRUE(KIVOReadFile(good_, &good_bytes_));
    members_ = WalkTar(good_bytes_);
    ASSERT_GE(members_.size(), 7u);
    ASSERT_EQ("package.tgz", members_.back().name);
    // The package tool's own folders, which the first install of any root
    // makes, and its lock file: they are not what this test looks for.
    for (const char* dir : {"/var/packages/.records", "/volume1/@appstore", "/volume1/@appdata",
                            "/run/kivo/pkgtool/progress"}) {
      ASSERT_EQ(0, KIVOFSMkdirP(root_.Path(dir).c_str())) << dir;
    }
    Kivoctl({"install", root_.Path("/etc/kivoinfo.conf")});
    before_ = Snapshot();
  }

  // Every path under the root but the corpus, with kind and (for
  // everything but folders) size.
  std::string Snapshot() const {
    std::string out;
    RunProgram({"sh", "-c",
                "find \"$0\" -path \"$1\" -prune -o -type d -printf '%P d\\n' -o -printf '%P %y "
                "%s\\n' | sort",
                root_.dir(), corpus_},
               &out);
    return out;
  }

  // Nothing of a hostile id reached a folder outside the root.
  bool Escaped() const {
    std::string out;
    RunProgram({"sh", "-c", "ls -d /tmp/" + escape_ + "* 2>/dev/null"}, &out);
    return !out.empty();
  }

  std::string Save(const std::string& name, const std::string& bytes) {
    std::string path = corpus_ + "/" + name + ".kpk";
    EXPECT_TRUE(KIVOWriteFileAtomic(path, bytes, SyncToDisk::No)) << path;
    return path;
  }

  // Both commands refuse `file` with one of `e.codes`. (Each test then
  // checks the root once: a listing per file would cost more than the
  // commands.)
  void ExpectRefused(const std::string& file, const Expect& e) {
    for (const char* command : {"inspect", "install"}) {
      std::string out;
      int status = Kivoctl({command, file}, &out);
      ASSERT_EQ(1, status) << command << " " << e.what << ":\n" << out;
      bool named = false;
      for (int code : e.codes)
        named |= out.find("[" + std::to_string(code) + "]") != std::string::npos;
      EXPECT_TRUE(named) << command << " " << e.what << ":\n" << out;
    }
  }
  // The root holds what it held before, and nothing escaped it.
  void ExpectNothingWritten() {
    EXPECT_EQ(before_, Snapshot());
    EXPECT_FALSE(Escaped());
  }

  const TarMember& Member(const std::string& name) const {
    for (const TarMember& m : members_) {
      if (m.name == name) return m;
    }
    ADD_FAILURE() << "no member " << name;
    return members_.front();
  }
  std::string Data(const std::string& name) const {
    const TarMember& m = Member(name);
    return good_bytes_.substr(m.data, m.size);
  }
  // The good package's members as (name, content), in archive order.
  MemberList GoodMembers() const {
    MemberList list;
    for (const TarMember& m : members_) list.emplace_back(m.name, Data(m.name));
    return list;
  }
  // The good package's payload as a file of its own.
  std::string GoodPayload() {
    std::string path = corpus_ + "/good.payload.tgz";
    EXPECT_TRUE(KIVOWriteFileAtomic(path, Data("package.tgz"), SyncToDisk::No));
    return path;
  }
  // The good package with another INFO, written as the builder writes it
  // (a MANIFEST that matches), for what the builder itself refuses.
  std::string WithInfo(const std::string& name, const std::string& info) {
    std::map<std::string, std::string> members;
    for (const auto& m : GoodMembers()) {
      if (m.first != "MANIFEST" && m.first != "package.tgz") members[m.first] = m.second;
    }
    members["INFO"] = info;
    std::string out = corpus_ + "/" + name + ".kpk", error;
    EXPECT_TRUE(PMSWritePackage(members, GoodPayload(), "", out, &error)) << error;
    return out;
  }

  TempRoot root_;
  std::string corpus_, escape_, good_, good_bytes_, before_;
  std::vector<TarMember> members_;
};

TEST_F(PackageCorpusTest, TheGoodPackageIsAcceptedAndSeen) {
  // The harness itself: the package every mutation starts from is sound,
  // and an install that did write something is noticed.
  std::string out;
  ASSERT_EQ(0, Kivoctl({"inspect", good_}, &out)) << out;
  ASSERT_EQ(0, Kivoctl({"install", good_}, &out)) << out;
  EXPECT_NE(before_, Snapshot());
}

TEST_F(PackageCorpusTest, CutShortAnywhere) {
  std::vector<std::pair<std::string, size_t>> cuts = {{"empty", 0}};
  for (const TarMember& m : members_) {
    cuts.emplace_back("before " + m.name, m.header);
    if (m.size > 1) cuts.emplace_back("inside " + m.name, m.data + m.size / 2);
  }
  const TarMember& payload = members_.back();
  cuts.emplace_back("inside the header of INFO", members_.front().header + 256);
  cuts.emplace_back("inside the header of package.tgz", payload.header + 256);
  for (int quarter = 1; quarter < 4; quarter += 2)
    cuts.emplace_back("payload at " + std::to_string(quarter) + "/4",
                      payload.data + payload.size * quarter / 4);
  cuts.emplace_back("payload but its last byte", payload.data + payload.size - 1);
  for (size_t i = 0; i < cuts.size(); ++i) {
    std::string file = Save("cut" + std::to_string(i), good_bytes_.substr(0, cuts[i].second));
    ExpectRefused(file, {"cut " + cuts[i].first, {PKG_ERR_NOT_PACKAGE_FILE}});
  }
  ExpectNothingWritten();
}

TEST_F(PackageCorpusTest, FlippedBytes) {
  int n = 0;
  auto flip = [&](size_t at, const Expect& e) {
    std::string bytes = good_bytes_;
    bytes[at] ^= 0x01;
    ExpectRefused(Save("flip" + std::to_string(n++), bytes), e);
  };
  for (const TarMember& m : members_) {
    // The header's checksum covers every byte of it, the size field too.
    flip(m.header + 126, {"header of " + m.name, {PKG_ERR_NOT_PACKAGE_FILE}});
    // Whatever member changed, it no longer matches MANIFEST; a MANIFEST
    // changed may no longer be one.
    std::vector<int> codes = {PKG_ERR_BAD_SIGNATURE};
    if (m.name == "MANIFEST") codes.push_back(PKG_ERR_NOT_PACKAGE_FILE);
    if (m.size > 0) flip(m.data + m.size / 2, {"data of " + m.name, codes});
  }
  const TarMember& payload = members_.back();
  flip(payload.data, {"payload's first byte", {PKG_ERR_BAD_SIGNATURE}});
  flip(payload.data + payload.size - 1, {"payload's last byte", {PKG_ERR_BAD_SIGNATURE}});
  ExpectNothingWritten();
}

TEST_F(PackageCorpusTest, TwoMembersOfOneName) {
  MemberList good = GoodMembers();
  auto with = [&](size_t at, const std::pair<std::string, std::string>& extra) {
    MemberList list = good;
    list.insert(list.begin() + static_cast<long>(at), extra);
    return list;
  };
  std::string evil_info = "package=\"evil\"\nversion=\"9.9\"\nextractsize=\"99\"\n";
  MemberList listed_twice = with(1, {"INFO", evil_info});
  listed_twice[2].second = Manifest({listed_twice[0], listed_twice[1]}) +
                           good[1].second.substr(good[1].second.find('\n', 16) + 1);
  struct Case {
    std::string what;
    MemberList members;
  } cases[] = {
      {"INFO twice, both in MANIFEST", listed_twice},
      {"INFO twice, alike", with(1, good[0])},
      {"a script twice", with(3, {"scripts/postinst", "#!/bin/sh\nexit 0\n"})},
      {"package.tgz twice", with(good.size(), good.back())},
      {"INFO after the payload", with(good.size(), {"INFO", evil_info})},
  };
  for (size_t i = 0; i < sizeof(cases) / sizeof(cases[0]); ++i) {
    std::string file = corpus_ + "/dup" + std::to_string(i) + ".kpk";
    WriteRawPackageFile(file, cases[i].members);
    ExpectRefused(file, {cases[i].what, {PKG_ERR_HOSTILE_MEMBER}});
  }

  ExpectNothingWritten();

  // The same with MANIFEST signed by a key the appliance trusts, and the
  // appliance trusting nothing else.
  TestKeys keys(root_.Path("/corpus"));
  std::string fpr = keys.Create("Corpus Publisher <corpus@test.invalid>");
  keys.Trust(fpr);
  root_.Write("/etc/kivoinfo.conf", "pkg_source_trust_level=\"0\"\n");
  std::string signature, error;
  ASSERT_TRUE(PMSSignData(keys.home(), fpr, listed_twice[2].second, &signature, &error)) << error;
  MemberList signed_twice = listed_twice;
  signed_twice.insert(signed_twice.begin() + 3, {"signature.asc", signature});
  std::string file = corpus_ + "/dup-signed.kpk";
  WriteRawPackageFile(file, signed_twice);
  before_ = Snapshot();
  ExpectRefused(file, {"INFO twice in a signed MANIFEST", {PKG_ERR_HOSTILE_MEMBER}});
  ExpectNothingWritten();
}

TEST_F(PackageCorpusTest, HostileInfo) {
  const std::string rest = "version=\"1.0\"\nextractsize=\"64\"\n";
  const std::string ids[] = {"../x",
                             "-pwn",
                             "../../../tmp/pwn",
                             "../../../../../../../../../tmp/" + escape_,
                             ".x",
                             "x/y",
                             "x;touch x",
                             "\xc3\xa9t\xc3\xa9",
                             "x\x01y",
                             std::string("x\0y", 3),
                             std::string(65, 'a'),
                             ""};
  int n = 0;
  for (const std::string& id : ids) {
    std::string file = WithInfo("id" + std::to_string(n++), "package=\"" + id + "\"\n" + rest);
    ExpectRefused(file, {"id " + id, {PKG_ERR_BAD_ID}});
  }
  ExpectRefused(WithInfo("no-id", rest), {"no id", {PKG_ERR_BAD_ID}});
  const std::string fields[] = {
      "version=\"1.0/../../x\"\nextractsize=\"64\"\n",
      "version=\"1.0\"\nextractsize=\"64\"\nlogfile=\"../../../etc/shadow\"\n",
      "version=\"1.0\"\nextractsize=\"64\"\npidfile=\"/etc/passwd\"\n",
      "version=\"1.0\"\nextractsize=\"64\"\ninstall_dep_packages=\"../evil\"\n",
      "version=\"1.0\"\nextractsize=\"64\"\ndescription=\"\x1b[2J\"\n",
      "version=\"1.0\"\n",
      "version=\"1.0\"\nextractsize=\"-5\"\n",
      "version=\"1.0\"\nextractsize=\"99999999999999999999\"\n",
  };
  for (const std::string& info : fields) {
    std::string file = WithInfo("field" + std::to_string(n++), "package=\"fine\"\n" + info);
    ExpectRefused(file, {info, {PKG_ERR_NOT_PACKAGE_FILE}});
  }
  ExpectNothingWritten();
}

TEST_F(PackageCorpusTest, SizeBombs) {
  // 16 MiB of zeros packs into a few KiB; the package says 1 KiB.
  TestPackage bomb;
  bomb.id = "bomb";
  bomb.daemon = false;
  bomb.files = {{"zeros", std::string(16 << 20, '\0')}};
  std::string honest = bomb.Build(corpus_);
  std::string bytes;
  ASSERT_TRUE(KIVOReadFile(honest, &bytes));
  std::vector<TarMember> members = WalkTar(bytes);
  std::string payload = corpus_ + "/bomb.payload.tgz", error;
  ASSERT_TRUE(KIVOWriteFileAtomic(payload, bytes.substr(members.back().data, members.back().size),
                                  SyncToDisk::No));
  std::string info = "package=\"bomb\"\nversion=\"1.0\"\nextractsize=\"1\"\n";
  std::string lying = corpus_ + "/bomb-lying.kpk";
  ASSERT_TRUE(PMSWritePackage({{"INFO", info}}, payload, "", lying, &error)) << error;
  ExpectRefused(lying, {"16 MiB declared as 1 KiB", {PKG_ERR_HOSTILE_MEMBER}});

  // Many entries, each small, add up as well.
  std::vector<RawEntry> folders;
  for (int i = 0; i < 3000; ++i) folders.push_back({"d" + std::to_string(i), 'd', 0755, ""});
  WriteRawPayload(payload, folders);
  std::string many = corpus_ + "/bomb-many.kpk";
  std::string many_info = "package=\"bomb\"\nversion=\"1.0\"\nextractsize=\"100\"\n";
  ASSERT_TRUE(PMSWritePackage({{"INFO", many_info}}, payload, "", many, &error)) << error;
  ExpectRefused(many, {"3000 folders declared as 100 KiB", {PKG_ERR_HOSTILE_MEMBER}});
  ExpectNothingWritten();

  // A volume capped below the honest declaration refuses it before
  // extracting; the lying one fits the cap and is still stopped.
  root_.Write("/etc/kivo/volumes.json",
              "[{\"path\": \"/volume1\", \"status\": \"normal\", \"cap_bytes\": 1048576}]");
  before_ = Snapshot();
  std::string out;
  EXPECT_EQ(1, Kivoctl({"install", honest}, &out));
  EXPECT_NE(std::string::npos, out.find("[279]")) << out;
  ExpectRefused(lying, {"1 KiB declared on a capped volume", {PKG_ERR_HOSTILE_MEMBER}});
  ExpectNothingWritten();
}

TEST_F(PackageCorpusTest, TheHostSurvivesAFileCutShortInsideItsPayload) {
  root_.AddAccount("admin", "secret", {"administrators"});
  ApiClient client("admin", "secret");
  ASSERT_TRUE(client.signed_in());
  const TarMember& payload = members_.back();
  std::string file = Save("cut-payload", good_bytes_.substr(0, payload.data + payload.size / 2));
  CgiAnswer answer = client.Upload("KIVO.Core.Package.Installation", "upload", 1, {}, file);
  EXPECT_EQ(0, answer.exit_status) << answer.head << answer.body;
  ASSERT_FALSE(answer.json.isNull()) << answer.head << answer.body;
  EXPECT_FALSE(answer.Success()) << answer.body;
}

}  // namespace
