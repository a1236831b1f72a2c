// The appliance keyring through the real host and the real code-signing
// script (php-cli and gpg): importing a public key, refusing a secret key,
// garbage and unreadable files, listing, deleting, and the uploaded key
// file removed whatever the outcome.

#include <unistd.h>

#include <gtest/gtest.h>

#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/gpg_keys.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"

namespace {

constexpr char kKeyringApi[] = "KIVO.Core.Package.Feed.Keyring";

class KeyringTest : public AdminApiTest {
 protected:
  std::string Export(const std::string& fpr, bool secret) { return keys_.Export(fpr, secret); }
  // Posts `content` as the key file, as the page does: the host keeps it in
  // the root's tmp/ for the request, and nothing of it may stay there.
  CgiAnswer Import(const std::string& content) {
    CgiAnswer a =
        client().PostFilePart(kKeyringApi, "add", 1, "upload_keyring", "key.asc", content);
    EXPECT_EQ(0, CountEntries(root_.Path("/tmp"), "upload-")) << "an uploaded key file stayed";
    return a;
  }
  Json::Value List() {
    CgiAnswer a = client().Call(kKeyringApi, "list", 1);
    EXPECT_TRUE(a.Success()) << a.body;
    EXPECT_EQ(a.Data()["items"].size(), a.Data()["total"].asUInt());
    return a.Data()["items"];
  }
  CgiAnswer Delete(const Json::Value& fprs) {
    return client().Call(kKeyringApi, "delete", 1, {{"list", ListParam(fprs)}});
  }
  bool Listed(const std::string& fpr) {
    for (const Json::Value& key : List()) {
      if (key["fingerprint"].asString() == fpr) return true;
    }
    return false;
  }

  TestKeys keys_{root_.Path("/test-gnupg")};
};

TEST_F(KeyringTest, ImportsPublicKeysAndRefusesEverythingElse) {
  EXPECT_TRUE(List().empty());
  const std::string fpr = keys_.Create("Publisher <pub@example.org>");

  CgiAnswer secret = Import(Export(fpr, true));
  EXPECT_EQ(4594, secret.Code()) << secret.body;
  EXPECT_EQ(4594, Import(InPublicArmor(Export(fpr, true))).Code());
  EXPECT_EQ(4593, Import("garbage\n").Code());
  EXPECT_TRUE(List().empty());

  // Without a key file there is nothing to import.
  EXPECT_EQ(4592, client().Call(kKeyringApi, "add", 1, {{"upload_keyring", "x"}}).Code());

  CgiAnswer ok = Import(Export(fpr, false));
  ASSERT_TRUE(ok.Success()) << ok.body;
  Json::Value items = List();
  ASSERT_EQ(1u, items.size());
  EXPECT_EQ(fpr, items[0]["fingerprint"].asString());
  EXPECT_EQ("Publisher <pub@example.org>", items[0]["uids"][0].asString());
  EXPECT_GT(items[0]["created"].asInt64(), 0);
  EXPECT_FALSE(items[0]["revoked"].asBool());
}

TEST_F(KeyringTest, AKeyWithManyLongUserIdsIsListedShortenedAndCanBeDeleted) {
  const std::string fpr = keys_.Create("Large Publisher <large@example.org>");
  // 70 more user ids of about 1.9 KB each: the whole key would not fit the
  // listing's line.
  std::string out;
  ASSERT_EQ(0, RunProgram({"sh", "-c",
                           "for i in $(seq 1 70); do gpg --homedir '" + keys_.home() +
                               "' --batch --quiet --passphrase '' --quick-add-uid " + fpr +
                               " \"Publisher $i $(printf 'x%.0s' $(seq 1 1900))\" || exit 1; done"},
                          &out))
      << out;
  ASSERT_TRUE(Import(Export(fpr, false)).Success());
  Json::Value items = List();
  ASSERT_EQ(1u, items.size());
  const Json::Value& uids = items[0]["uids"];
  ASSERT_EQ(9u, uids.size());
  for (Json::ArrayIndex i = 0; i < 8; ++i) EXPECT_LE(uids[i].asString().size(), 203u) << i;
  EXPECT_EQ("(and 63 more user ids)", uids[8].asString());
  Json::Value one(Json::arrayValue);
  one.append(fpr);
  EXPECT_TRUE(Delete(one).Success());
  EXPECT_TRUE(List().empty());
}

TEST_F(KeyringTest, DeletesInOrderAndStopsAtTheFirstFailure) {
  const std::string a = keys_.Create("A <a@example.org>");
  const std::string c = keys_.Create("C <c@example.org>");
  ASSERT_TRUE(Import(Export(a, false)).Success());
  ASSERT_TRUE(Import(Export(c, false)).Success());
  EXPECT_TRUE(Delete(Json::Value(Json::arrayValue)).Success());
  Json::Value three(Json::arrayValue);
  three.append(a);
  three.append(std::string(40, '0'));  // in no keyring
  three.append(c);
  EXPECT_EQ(4501, Delete(three).Code());
  EXPECT_FALSE(Listed(a));
  EXPECT_TRUE(Listed(c));
  EXPECT_EQ(4501, client().Call(kKeyringApi, "delete", 1, {{"list", "\"[not json\""}}).Code());
}

}  // namespace
