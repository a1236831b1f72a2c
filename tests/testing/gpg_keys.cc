#include "testing/gpg_keys.h"

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "pkgtool/package_builder.h"
#include "pkgtool/package_file.h"
#include "pkgtool/signature.h"
#include "testing/package_factory.h"

namespace {

const char kPast[] = "20200101T000000";

std::string Trim(std::string s) {
  while (!s.empty() && (s.back() == '\n' || s.back() == ' ')) s.pop_back();
  return s;
}

}  // namespace

TestKeys::TestKeys(const std::string& dir) : home_(dir + "/test-gnupg") {
  EXPECT_EQ(0, KIVOFSMkdirP(home_.c_str(), 0700)) << home_;
}

std::string TestKeys::Create(const std::string& uid, bool expired) {
  std::vector<std::string> args = {"gpg",     "--homedir",    home_, "--batch",
                                   "--quiet", "--passphrase", ""};
  if (expired) args.insert(args.end(), {"--faked-system-time", kPast});
  args.insert(args.end(), {"--quick-gen-key", uid, "ed25519", "sign", expired ? "1d" : "never"});
  std::string out;
  EXPECT_EQ(0, RunProgram(args, &out)) << out;
  EXPECT_EQ(0, RunProgram({"sh", "-c",
                           "gpg --homedir '" + home_ + "' --batch --with-colons --list-keys '" +
                               uid + "' 2>/dev/null | awk -F: '/^fpr/ {print $10; exit}'"},
                          &out));
  return Trim(out);
}

std::string InPublicArmor(std::string block) {
  for (const char* line : {"BEGIN", "END"}) {
    const std::string from = std::string("-----") + line + " PGP PRIVATE KEY BLOCK-----";
    const size_t at = block.find(from);
    EXPECT_NE(std::string::npos, at) << "not a secret key block";
    if (at != std::string::npos)
      block.replace(at, from.size(), std::string("-----") + line + " PGP PUBLIC KEY BLOCK-----");
  }
  return block;
}

std::string TestKeys::Export(const std::string& fpr, bool secret) const {
  std::string out;
  EXPECT_EQ(0, RunProgram({"gpg", "--homedir", home_, "--batch", "--pinentry-mode", "loopback",
                           "--passphrase", "", "--armor",
                           secret ? "--export-secret-keys" : "--export", fpr},
                          &out));
  return out;
}

void TestKeys::Revoke(const std::string& fpr) {
  // gpg keeps a revocation certificate for every key it makes; its armour
  // is commented out with ':' until it is needed.
  std::string cert;
  ASSERT_TRUE(KIVOReadFile(home_ + "/openpgp-revocs.d/" + fpr + ".rev", &cert));
  size_t at = cert.find(":-----BEGIN");
  ASSERT_NE(std::string::npos, at);
  cert.erase(at, 1);
  std::string path = home_ + "/revoke.asc";
  ASSERT_TRUE(KIVOWriteFileAtomic(path, cert.substr(at), SyncToDisk::No));
  std::string out;
  EXPECT_EQ(0,
            RunProgram({"gpg", "--homedir", home_, "--batch", "--quiet", "--import", path}, &out))
      << out;
}

void TestKeys::Trust(const std::string& fpr) const {
  std::string key = home_ + "/" + fpr + ".asc", out;
  EXPECT_EQ(0, RunProgram({"sh", "-c",
                           "gpg --homedir '" + home_ + "' --batch --armor --export " + fpr +
                               " > '" + key + "'"},
                          &out));
  EXPECT_EQ(
      0, RunProgram({"gpg", "--homedir", PMSKeyringHome(), "--batch", "--quiet", "--import", key},
                    &out))
      << out;
}

void TestKeys::Sign(const std::string& package, const std::string& fpr, bool expired) const {
  PackageFileReader reader;
  std::string error;
  ASSERT_EQ(0, reader.Open(package, &error)) << error;
  std::string manifest = package + ".manifest", sig = package + ".manifest.asc", out;
  ASSERT_TRUE(KIVOWriteFileAtomic(manifest, reader.header().manifest, SyncToDisk::No));
  std::vector<std::string> args = {"gpg", "--homedir", home_, "--batch", "--quiet", "--yes"};
  if (expired) args.insert(args.end(), {"--faked-system-time", kPast});
  args.insert(args.end(),
              {"--local-user", fpr, "--armor", "--detach-sign", "--output", sig, manifest});
  ASSERT_EQ(0, RunProgram(args, &out)) << out;
  std::string signature;
  ASSERT_TRUE(KIVOReadFile(sig, &signature));
  ASSERT_TRUE(PMSAttachSignature(package, package, signature, &error)) << error;
}
