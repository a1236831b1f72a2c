// A key file posted as the multipart file part "upload_keyring", through the
// real host and over lighttpd: the host keeps it in the root's tmp/ for the
// request, hands the handler "upload_keyring" and "upload_keyring_tmp", and
// nothing of it stays, whatever the outcome.

#include <dirent.h>
#include <sys/wait.h>
#include <unistd.h>

#include <gtest/gtest.h>
#include <json/reader.h>

#include "klibc/atomic_file.h"
#include "testing/admin_api_test.h"
#include "testing/cgi_client.h"
#include "testing/gpg_keys.h"
#include "testing/package_factory.h"
#include "testing/temp_root.h"
#include "testing/web_server.h"

namespace {

constexpr char kAddQuery[] = "api=KIVO.Core.Package.Feed.Keyring&version=1&method=add";
constexpr char kBoundary[] = "----kivo-keyring-boundary-41c2";

// A multipart part: a field, or a file part when `file_name` is given.
std::string Part(const std::string& name, const std::string& content,
                 const std::string& file_name = "") {
  std::string head =
      std::string("--") + kBoundary + "\r\nContent-Disposition: form-data; name=\"" + name + "\"";
  if (!file_name.empty()) head += "; filename=\"" + file_name + "\"";
  return head + "\r\n\r\n" + content + "\r\n";
}

std::string Closing() { return std::string("--") + kBoundary + "--\r\n"; }

class KeyringUploadTest : public AdminApiTest {
 protected:
  std::string PublicKey() {
    std::string fpr = keys_.Create("Uploaded Publisher <up@test.invalid>"), out;
    EXPECT_EQ(0, RunProgram({"sh", "-c",
                             "gpg --homedir '" + keys_.home() + "' --batch --armor --export " +
                                 fpr + " 2>/dev/null"},
                            &out));
    fpr_ = fpr;
    return out;
  }
  // Posts `body` to the keyring's "add" as the desktop does.
  CgiAnswer Post(const std::string& body, bool signed_in = true) {
    CgiEnv env = {{"REQUEST_METHOD", "POST"},
                  {"QUERY_STRING", kAddQuery},
                  {"CONTENT_TYPE", std::string("multipart/form-data; boundary=") + kBoundary},
                  {"CONTENT_LENGTH", std::to_string(body.size())},
                  {"HTTP_HOST", "nas.example:5000"}};
    if (signed_in) {
      env["HTTP_COOKIE"] = "id=" + client().sid();
      env["HTTP_X_KIVO_TOKEN"] = client().token();
    }
    return RunEntryCgi(env, body);
  }
  bool Listed(const std::string& fpr) {
    CgiAnswer a = client().Call("KIVO.Core.Package.Feed.Keyring", "list", 1);
    for (const Json::Value& key : a.Data()["items"]) {
      if (key["fingerprint"].asString() == fpr) return true;
    }
    return false;
  }
  // Files in the root's tmp/ (where the host keeps a posted key file).
  std::vector<std::string> TmpFiles() {
    std::vector<std::string> names;
    if (DIR* d = opendir(root_.Path("/tmp").c_str())) {
      while (dirent* e = readdir(d)) {
        std::string n = e->d_name;
        if (n != "." && n != "..") names.push_back(n);
      }
      closedir(d);
    }
    return names;
  }

  TestKeys keys_{root_.Path("/test-gnupg")};
  std::string fpr_;
};

TEST_F(KeyringUploadTest, PostedKeyFileIsImportedOrRefusedAndNeverStays) {
  const std::string key = PublicKey();
  // A public key: imported, and its stored copy gone.
  CgiAnswer ok = Post(Part("upload_keyring", key, "publisher.asc") + Closing());
  ASSERT_TRUE(ok.Success()) << ok.body;
  EXPECT_TRUE(Listed(fpr_));
  EXPECT_TRUE(TmpFiles().empty());

  // Garbage: refused by the script, nothing stays.
  CgiAnswer junk = Post(Part("upload_keyring", "not a key at all\n", "junk.asc") + Closing());
  EXPECT_EQ(4593, junk.Code()) << junk.body;
  EXPECT_TRUE(TmpFiles().empty());

  // Refused before the handler: no session, a body cut short after the
  // file, a client field posing as the stored path, a part over the limit.
  EXPECT_EQ(119, Post(Part("upload_keyring", key, "k.asc") + Closing(), false).Code());
  EXPECT_TRUE(TmpFiles().empty());
  CgiAnswer cut = Post(Part("upload_keyring", key, "k.asc") + Part("x", "1"));
  EXPECT_FALSE(cut.Success()) << cut.body;
  EXPECT_TRUE(TmpFiles().empty());
  const std::string outside = root_.Path("/outside.asc");
  ASSERT_TRUE(KIVOWriteFileAtomic(outside, key));
  CgiAnswer forged =
      Post(Part("upload_keyring", "k.asc") + Part("upload_keyring_tmp", outside) + Closing());
  EXPECT_FALSE(forged.Success()) << forged.body;
  EXPECT_EQ(0, access(outside.c_str(), F_OK));  // neither read nor deleted
  CgiAnswer huge = Post(Part("upload_keyring", std::string(5 << 20, 'k'), "huge.asc") + Closing());
  EXPECT_FALSE(huge.Success()) << huge.body;
  EXPECT_TRUE(TmpFiles().empty());

  // The package upload's part "file" still streams to a volume's upload area.
  std::string up_body = Part("file", "not a package", "x.kpk") + Closing();
  CgiEnv env = {{"REQUEST_METHOD", "POST"},
                {"QUERY_STRING", "api=KIVO.Core.Package.Installation&version=1&method=upload"},
                {"CONTENT_TYPE", std::string("multipart/form-data; boundary=") + kBoundary},
                {"CONTENT_LENGTH", std::to_string(up_body.size())},
                {"HTTP_COOKIE", "id=" + client().sid()},
                {"HTTP_X_KIVO_TOKEN", client().token()},
                {"HTTP_HOST", "nas.example:5000"}};
  EXPECT_EQ(4521, RunEntryCgi(env, up_body).Code());
  EXPECT_TRUE(TmpFiles().empty());
}

TEST_F(KeyringUploadTest, AStoredFileNamedByTheClientIsRefusedOnEveryRoute) {
  // A file the client names as if the host had stored it for the request:
  // the handlers read and delete such a path, so it must never get there.
  const std::string victim = root_.Path("/tmp/victim");
  ASSERT_TRUE(KIVOWriteFileAtomic(victim, "precious\n"));
  const std::string stored = "upload_keyring_tmp=" + victim;
  const std::string form =
      "api=KIVO.Core.Package.Feed.Keyring&version=1&method=add"
      "&upload_keyring=k.asc&" +
      stored;
  CgiEnv signed_in = {{"HTTP_COOKIE", "id=" + client().sid()},
                      {"HTTP_X_KIVO_TOKEN", client().token()},
                      {"HTTP_HOST", "nas.example:5000"}};
  auto post = [&](const std::string& query, const std::string& body) {
    CgiEnv env = signed_in;
    env["REQUEST_METHOD"] = "POST";
    env["QUERY_STRING"] = query;
    env["CONTENT_TYPE"] = "application/x-www-form-urlencoded";
    env["CONTENT_LENGTH"] = std::to_string(body.size());
    return RunEntryCgi(env, body);
  };
  const struct {
    const char* route;
    CgiAnswer answer;
  } refused[] = {
      {"urlencoded body", post("", form)},
      {"query string", post(form, "")},
      {"query string of a GET",
       [&] {
         CgiEnv env = signed_in;
         env["REQUEST_METHOD"] = "GET";
         env["QUERY_STRING"] = form;
         return RunEntryCgi(env);
       }()},
      {"the package file's path", post("",
                                       "api=KIVO.Core.Package.Installation&version=1"
                                       "&method=install&file_tmp=" +
                                           victim)},
      {"the package file's name", post("",
                                       "api=KIVO.Core.Package.Installation&version=1"
                                       "&method=upload&file_name=x.kpk")},
      {"multipart field",
       Post(Part("upload_keyring", "k.asc") + Part("upload_keyring_tmp", victim) + Closing())},
  };
  for (const auto& r : refused) {
    EXPECT_EQ(101, r.answer.Code()) << r.route << ": " << r.answer.body;
    // The multipart reader refuses the whole body as malformed.
    EXPECT_NE(std::string::npos, r.answer.body.find(r.route == std::string("multipart field")
                                                        ? "malformed multipart body"
                                                        : "set by the appliance only"))
        << r.route << ": " << r.answer.body;
    EXPECT_EQ(0, access(victim.c_str(), F_OK)) << r.route;
  }
}

// Runs curl with `args`; the parsed JSON body.
Json::Value Curl(const std::vector<std::string>& args) {
  std::vector<std::string> argv = {"curl", "-s"};
  argv.insert(argv.end(), args.begin(), args.end());
  std::string out;
  EXPECT_EQ(0, RunProgram(argv, &out));
  Json::Value json;
  Json::CharReaderBuilder builder;
  std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  reader->parse(out.data(), out.data() + out.size(), &json, nullptr);
  return json;
}

TEST_F(KeyringUploadTest, CurlPostsTheKeyFileThroughLighttpd) {
  const std::string key_file = root_.Path("/publisher.asc");
  ASSERT_TRUE(KIVOWriteFileAtomic(key_file, PublicKey()));
  WebServer server(root_.dir());
  ASSERT_TRUE(server.running());
  const std::string url = server.EntryURL(), jar = root_.Path("/cookies");
  Json::Value login =
      Curl({"-c", jar, "--data",
            "api=KIVO.API.Auth&version=1&method=login&account=admin&passwd=secret", url});
  const std::string header = "X-KIVO-Token: " + login["data"]["token"].asString();
  Json::Value added =
      Curl({"-b", jar, "-H", header, "-F", "upload_keyring=@" + key_file, url + "?" + kAddQuery});
  EXPECT_TRUE(added["success"].asBool()) << added.toStyledString();
  Json::Value list = Curl(
      {"-b", jar, "-H", header, url + "?api=KIVO.Core.Package.Feed.Keyring&version=1&method=list"});
  ASSERT_EQ(1u, list["data"]["items"].size()) << list.toStyledString();
  EXPECT_EQ(fpr_, list["data"]["items"][0]["fingerprint"].asString());
  EXPECT_TRUE(TmpFiles().empty());
}

}  // namespace
