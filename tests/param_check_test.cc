// Every checker through the real host. A refusal is code 120 with
// {"name", "reason"}; an accepted request reaches its handler, which answers
// something other than 120.

#include <gtest/gtest.h>

#include "testing/admin_api_test.h"

namespace {

class ParamCheckTest : public AdminApiTest {
 protected:
  // Expects a refusal of `param` for `reason`.
  void ExpectRefused(const std::string& api, int version, const std::string& method,
                     const Params& params, const std::string& param, const std::string& reason) {
    CgiAnswer a = client().Call(api, method, version, params);
    EXPECT_EQ(120, a.Code()) << api << " " << method << ": " << a.body;
    EXPECT_EQ(param, a.Errors()["name"].asString()) << a.body;
    EXPECT_EQ(reason, a.Errors()["reason"].asString()) << a.body;
  }

  // Expects the checker to accept, so that the handler answers.
  void ExpectAccepted(const std::string& api, int version, const std::string& method,
                      const Params& params) {
    CgiAnswer a = client().Call(api, method, version, params);
    EXPECT_TRUE(a.json.isObject()) << a.body;
    EXPECT_NE(120, a.Code()) << api << " " << method << ": " << a.body;
  }
};

constexpr char kPkg[] = "KIVO.Core.Package";
constexpr char kInst[] = "KIVO.Core.Package.Installation";

TEST_F(ParamCheckTest, AlwaysAcceptShape) {
  for (const auto& row :
       std::vector<std::pair<std::string, std::string>>{{"KIVO.Core.Package.Setting", "get"},
                                                        {"KIVO.Core.Package.Setting.Volume", "get"},
                                                        {"KIVO.Core.Package.Info", "get"},
                                                        {"KIVO.Core.Package.Feed", "list"},
                                                        {"KIVO.Core.Package.Feed.Keyring", "list"},
                                                        {kInst, "upload"},
                                                        {"KIVO.Core.Package.Server", "check"}}) {
    ExpectAccepted(row.first, 1, row.second, {{"anything", "[1,2]"}, {"id", "{}"}});
  }
  // The inline-frame page answers its page, not JSON, whatever it is sent.
  CgiAnswer page = client().Call("KIVO.Core.Package.FakeIFrame", "get", 1,
                                 {{"anything", "[1,2]"}, {"id", "{}"}});
  EXPECT_NE(std::string::npos, page.body.find("<html")) << page.body;
}

TEST_F(ParamCheckTest, TypesOnlyShape) {
  // Required arrays: missing, wrong type, an element that is not a string.
  ExpectRefused("KIVO.Core.Package.Control", 1, "stop", {}, "id", "required");
  ExpectRefused("KIVO.Core.Package.Control", 1, "stop", {{"id", "5"}}, "id", "type");
  ExpectRefused("KIVO.Core.Package.Control", 1, "stop", {{"id", "{\"a\":1}"}}, "id", "type");
  ExpectRefused("KIVO.Core.Package.Control", 1, "stop", {{"id", "[\"a\",5]"}}, "id", "type");
  ExpectAccepted("KIVO.Core.Package.Control", 1, "stop", {{"id", "[\"\"]"}});  // no condition
  ExpectAccepted("KIVO.Core.Package.Control", 1, "stop", {{"id", "pkg"}});     // a single string
  ExpectRefused("KIVO.Core.Package.Setting.Update", 1, "add", {}, "id", "required");
  ExpectRefused("KIVO.Core.Package.Setting.Update", 1, "delete", {{"id", "true"}}, "id", "type");

  // Setting set: every optional type, in reading order.
  const std::string set = "KIVO.Core.Package.Setting";
  ExpectAccepted(set, 1, "set", {});
  ExpectRefused(set, 1, "set", {{"trust_level", "\"high\""}}, "trust_level", "type");
  ExpectRefused(set, 1, "set", {{"trust_level", "1.5"}}, "trust_level", "type");
  ExpectRefused(set, 1, "set", {{"enable_email", "yes"}}, "enable_email", "type");
  ExpectRefused(set, 1, "set", {{"default_vol", "[]"}, {"enable_nvx", "1"}}, "enable_nvx", "type");
  ExpectRefused(set, 1, "set", {{"packages", "[1]"}, {"update_channel", "{}"}}, "update_channel",
                "type");  // step 2 (types) comes before step 3 (elements)
  ExpectRefused(set, 1, "set", {{"packages", "[1]"}}, "packages", "type");
  ExpectAccepted(set, 1, "set",
                 {{"packages", "[\"a\"]"},
                  {"update_channel", "beta"},
                  {"enable_email", "true"},
                  {"enable_nvx", "false"},
                  {"trust_level", "2"},
                  {"enable_autoupdate", "true"},
                  {"autoupdateall", "false"},
                  {"default_vol", "/volume1"}});
  ExpectRefused("KIVO.Core.Package.Setting.Volume", 1, "set", {{"default_vol", "{}"}},
                "default_vol", "type");

  ExpectRefused("KIVO.Core.Package.Thumb", 1, "get", {{"size", "big"}}, "size", "type");
  ExpectRefused("KIVO.Core.Package.Thumb.Server", 1, "get", {{"bls", "1"}}, "bls", "type");
  ExpectRefused("KIVO.Core.Package.Screenshot", 1, "get", {{"newlink", "[]"}}, "newlink", "type");
  ExpectRefused("KIVO.Core.Package.Screenshot.Server", 1, "get", {{"index", "x"}}, "index", "type");
  ExpectRefused("KIVO.Core.Package.Feed.Keyring", 1, "add", {}, "upload_keyring", "required");
  ExpectAccepted("KIVO.Core.Package.Feed.Keyring", 1, "add", {{"upload_keyring", ""}});
  ExpectRefused("KIVO.Core.Package.Feed.Keyring", 1, "delete", {{"list", "{}"}}, "list", "type");
  ExpectRefused("KIVO.Core.Package.Server", 1, "list", {{"blforcereload", "\"true\""}},
                "blforcereload", "type");

  // Installation check: version 2 also reads "ver"; version 1 ignores it.
  ExpectRefused(kInst, 2, "check", {{"ver", "{}"}}, "ver", "type");
  ExpectAccepted(kInst, 1, "check", {{"ver", "{}"}});
  ExpectRefused(kInst, 1, "check", {{"deppkgs", "[]"}}, "deppkgs", "type");
  ExpectRefused(kInst, 1, "check", {{"blCheckDep", "yes"}, {"size", "x"}}, "size", "type");
  ExpectAccepted(kInst, 2, "check",
                 {{"id", "[\"a\"]"},
                  {"depsers", "pgsql"},
                  {"deppkgs", "{\"b\":\"1.0\"}"},
                  {"conflictpkgs", "{}"},
                  {"install_type", ""},
                  {"size", "10"},
                  {"blCheckDep", "true"},
                  {"ver", "1.10"}});
}

TEST_F(ParamCheckTest, TypesAndConditionsShape) {
  ExpectRefused("KIVO.Core.Package.Log", 1, "get", {}, "name", "required");
  ExpectRefused("KIVO.Core.Package.Log", 1, "get", {{"name", ""}}, "name", "condition");
  ExpectRefused("KIVO.Core.Package.Log", 1, "get", {{"name", "[\"a\"]"}}, "name", "type");

  ExpectRefused(kPkg, 1, "get", {{"id", "[]"}}, "id", "condition");
  ExpectRefused(kPkg, 1, "get", {{"id", "[\"\"]"}}, "id", "condition");
  ExpectRefused(kPkg, 1, "get", {{"id", "[\"\",\"\"]"}}, "id", "condition");
  ExpectRefused(kPkg, 1, "get", {{"id", "[\"pkg\",5]"}}, "id", "type");
  ExpectRefused(kPkg, 1, "get", {{"id", "[\"pkg\"]"}, {"additional", "[\"status\",\"nope\"]"}},
                "additional", "condition");
  ExpectRefused(kPkg, 1, "get", {{"id", "[]"}, {"additional", "[\"nope\"]"}}, "id", "condition");
  ExpectAccepted(kPkg, 1, "get", {{"id", "[\"pkg\",\"\"]"}, {"additional", "[\"status\"]"}});

  ExpectRefused(kPkg, 1, "list", {{"additional", "[\"status\",\"nope\"]"}}, "additional",
                "condition");
  ExpectRefused(kPkg, 1, "list", {{"additional", "[\"STATUS\"]"}}, "additional", "condition");
  ExpectAccepted(kPkg, 1, "list", {});
  ExpectAccepted(kPkg, 1, "list",
                 {{"additional",
                   "[\"autoupdate\",\"beta\",\"description\",\"description_enu\",\"distributor\","
                   "\"distributor_url\",\"nvx_apps\",\"help_url\",\"install_reboot\","
                   "\"install_type\",\"installed_info\",\"is_uninstall_pages\",\"maintainer\","
                   "\"maintainer_url\",\"url\",\"report_beta_url\",\"silent_install\","
                   "\"silent_upgrade\",\"silent_uninstall\",\"startable\",\"status\","
                   "\"support_center\",\"support_url\",\"uninstall_pages\","
                   "\"dependent_packages\",\"start_dependent_services\","
                   "\"installing_progress\",\"ctl_uninstall\",\"log_path\"]"}});

  ExpectRefused(kPkg, 1, "feasibility_check", {{"packages", "[\"a\"]"}}, "type", "required");
  ExpectRefused(kPkg, 1, "feasibility_check", {{"type", "install_check"}}, "packages", "required");
  ExpectRefused(kPkg, 1, "feasibility_check", {{"type", "start_check"}, {"packages", "[\"a\"]"}},
                "type", "condition");
  ExpectAccepted(kPkg, 1, "feasibility_check", {{"type", "stop_check"}, {"packages", "[]"}});

  ExpectRefused("KIVO.Core.Package.Control", 1, "start", {{"id", "[\"\"]"}}, "id", "condition");
  ExpectRefused("KIVO.Core.Package.Uninstallation", 1, "uninstall", {{"id", "[]"}}, "id",
                "condition");
  ExpectRefused("KIVO.Core.Package.Uninstallation", 1, "uninstall",
                {{"id", "[\"a\"]"}, {"extra_values", "{}"}}, "extra_values", "type");

  for (const char* method : {"add", "set", "delete"}) {
    ExpectRefused("KIVO.Core.Package.Feed", 1, method, {}, "list", "required");
    ExpectRefused("KIVO.Core.Package.Feed", 1, method, {{"list", ""}}, "list", "condition");
  }
  ExpectRefused(kInst, 1, "status", {{"task_id", ""}}, "task_id", "condition");
  ExpectRefused(kInst, 1, "clean", {}, "task_id", "required");
  ExpectRefused(kInst, 1, "cancel", {{"task_id", "x"}}, "taskid", "required");
  ExpectRefused(kInst, 1, "cancel", {{"taskid", ""}}, "taskid", "condition");
  ExpectRefused(kInst, 1, "delete", {{"path", ""}}, "path", "condition");
  ExpectRefused("KIVO.Core.Package.Installation.Download", 1, "check", {{"taskid", ""}}, "taskid",
                "condition");
}

TEST_F(ParamCheckTest, InstallNamesItsSourceOneOfThreeWays) {
  ExpectRefused(kInst, 1, "install", {}, "task_id", "condition");
  ExpectRefused(kInst, 1, "install", {{"name", ""}}, "task_id", "condition");
  ExpectRefused(kInst, 1, "install", {{"task_id", ""}}, "path", "condition");
  ExpectRefused(kInst, 1, "install", {{"name", "pkg"}, {"url", "http://x/p.kpk"}}, "filesize",
                "condition");
  ExpectRefused(kInst, 1, "install", {{"task_id", "t"}, {"name", ""}}, "name", "condition");
  ExpectRefused(kInst, 1, "install", {{"task_id", "t"}, {"url", ""}}, "url", "condition");
  ExpectRefused(kInst, 1, "install", {{"task_id", "t"}, {"filesize", "big"}}, "filesize", "type");
  ExpectRefused(kInst, 1, "install", {{"task_id", "t"}, {"check_codesign", "no"}}, "check_codesign",
                "type");
  ExpectAccepted(kInst, 1, "install", {{"task_id", "@KIVOPKG_UPLOAD_1"}});
  ExpectAccepted(kInst, 1, "install", {{"path", "/volume1/p.kpk"}});
  ExpectAccepted(kInst, 1, "install",
                 {{"name", "pkg"}, {"url", "http://x/p.kpk"}, {"filesize", "100"}});
}

TEST_F(ParamCheckTest, LegacyListHasNoChecker) {
  // The same bad "additional" is refused under the current name and reaches
  // the handler under the legacy one.
  ExpectRefused(kPkg, 1, "list", {{"additional", "[\"nope\"]"}}, "additional", "condition");
  ExpectAccepted("KIVO.Package", 1, "list", {{"additional", "[\"nope\"]"}});
}

}  // namespace
