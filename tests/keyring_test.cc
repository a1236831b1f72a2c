// The appliance keyring through the real host and the real code-signing
// script (php-cli and gpg): importing a public key, refusing a secret key,
// garbage and unreadable files, listing, deleting, and the uploaded key
// file removed whatever the outcome.

#include <unistd.h>

#include <gtest/gtest.h>
#include <json/writer.h>

#include "klibc/atomic_file.h"
#include "testing/cgi_client.h"
#include "testing/gpg_keys.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kKeyringApi[] = "KIVO.Core.Package.Feed.Keyring";

class KeyringTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_.AddAccount("admin", "secret", {"administrators"});
    client_.reset(new ApiClient("admin", "secret"));
  }
  std::string Export(const std::string& fpr, bool secret) {
    std::string out;
    EXPECT_EQ(0, RunProgram({"gpg", "--homedir", keys_.home(), "--batch", "--pinentry-mode",
                             "loopback", "--passphrase", "", "--armor",
                             secret ? "--export-secret-keys" : "--export", fpr},
                            &out));
    return out;
  }
  // Stores `content` where the host stores an upload and asks for its import.
  CgiAnswer Import(const std::string& content, std::string* stored) {
    *stored = root_.Path("/tmp/upload_keyring-" + std::to_string(++uploads_));
    EXPECT_TRUE(KIVOWriteFileAtomic(*stored, content));
    return client_->Call(kKeyringApi, "add", 1,
                         {{"upload_keyring", "key.asc"}, {"upload_keyring_tmp", *stored}});
  }
  Json::Value List() {
    CgiAnswer a = client_->Call(kKeyringApi, "list", 1);
    EXPECT_TRUE(a.Success()) << a.body;
    EXPECT_EQ(a.Data()["items"].size(), a.Data()["total"].asUInt());
    return a.Data()["items"];
  }
  CgiAnswer Delete(const Json::Value& fprs) {
    Json::StreamWriterBuilder b;
    b["indentation"] = "";
    return client_->Call(kKeyringApi, "delete", 1,
                         {{"list", Json::writeString(b, Json::Value(Json::writeString(b, fprs)))}});
  }
  bool Listed(const std::string& fpr) {
    for (const Json::Value& key : List()) {
      if (key["fingerprint"].asString() == fpr) return true;
    }
    return false;
  }

  TempRoot root_;
  TestKeys keys_{root_.Path("/test-gnupg")};
  std::unique_ptr<ApiClient> client_;
  int uploads_ = 0;
};

TEST_F(KeyringTest, ImportsPublicKeysAndRefusesEverythingElse) {
  EXPECT_TRUE(List().empty());
  const std::string fpr = keys_.Create("Publisher <pub@example.org>");
  std::string stored;

  CgiAnswer secret = Import(Export(fpr, true), &stored);
  EXPECT_EQ(4594, secret.Code()) << secret.body;
  EXPECT_FALSE(KLIBCFileExist(stored.c_str()));
  EXPECT_EQ(4593, Import("garbage\n", &stored).Code());
  EXPECT_FALSE(KLIBCFileExist(stored.c_str()));
  EXPECT_TRUE(List().empty());

  // A path the host did not make is neither read nor deleted.
  const std::string outside = root_.Path("/etc/passwd");
  CgiAnswer bad = client_->Call(kKeyringApi, "add", 1,
                                {{"upload_keyring", "x"}, {"upload_keyring_tmp", outside}});
  EXPECT_EQ(4592, bad.Code());
  EXPECT_TRUE(KLIBCFileExist(outside.c_str()));
  bad = client_->Call(kKeyringApi, "add", 1,
                      {{"upload_keyring", "x"}, {"upload_keyring_tmp", root_.Path("/tmp/none")}});
  EXPECT_EQ(4592, bad.Code());

  CgiAnswer ok = Import(Export(fpr, false), &stored);
  ASSERT_TRUE(ok.Success()) << ok.body;
  EXPECT_FALSE(KLIBCFileExist(stored.c_str()));
  Json::Value items = List();
  ASSERT_EQ(1u, items.size());
  EXPECT_EQ(fpr, items[0]["fingerprint"].asString());
  EXPECT_EQ("Publisher <pub@example.org>", items[0]["uids"][0].asString());
  EXPECT_GT(items[0]["created"].asInt64(), 0);
  EXPECT_FALSE(items[0]["revoked"].asBool());
}

TEST_F(KeyringTest, DeletesInOrderAndStopsAtTheFirstFailure) {
  const std::string a = keys_.Create("A <a@example.org>");
  const std::string c = keys_.Create("C <c@example.org>");
  std::string stored;
  ASSERT_TRUE(Import(Export(a, false), &stored).Success());
  ASSERT_TRUE(Import(Export(c, false), &stored).Success());
  EXPECT_TRUE(Delete(Json::Value(Json::arrayValue)).Success());
  Json::Value three(Json::arrayValue);
  three.append(a);
  three.append(std::string(40, '0'));  // in no keyring
  three.append(c);
  EXPECT_EQ(4501, Delete(three).Code());
  EXPECT_FALSE(Listed(a));
  EXPECT_TRUE(Listed(c));
  EXPECT_EQ(4501, client_->Call(kKeyringApi, "delete", 1, {{"list", "\"[not json\""}}).Code());
}

}  // namespace
