#include "tools/kivoctl/package_commands.h"

#include <algorithm>
#include <cstdlib>
#include <iostream>
#include <unistd.h>

#include "klibc/json_text.h"
#include "pkgtool/package_builder.h"
#include "pkgtool/package_file.h"
#include "pkgtool/package_manager.h"
#include "pkgtool/package_state.h"
#include "pkgtool/revisions.h"
#include "pkgtool/signature.h"

namespace {

int Fail(const std::string& message) {
  std::cerr << "kivoctl: " << message << "\n";
  return 1;
}

// The value following option `name`, or `def`.
std::string Option(const std::vector<std::string>& args, const std::string& name,
                   const std::string& def = "") {
  for (size_t i = 0; i + 1 < args.size(); ++i) {
    if (args[i] == name) return args[i + 1];
  }
  return def;
}

bool Flag(const std::vector<std::string>& args, const std::string& name) {
  for (const std::string& a : args) {
    if (a == name) return true;
  }
  return false;
}

// Positional arguments: those that are not options or option values.
std::vector<std::string> Positional(const std::vector<std::string>& args,
                                    const std::vector<std::string>& with_value) {
  std::vector<std::string> out;
  for (size_t i = 0; i < args.size(); ++i) {
    if (std::find(with_value.begin(), with_value.end(), args[i]) != with_value.end()) {
      ++i;
    } else if (args[i].compare(0, 2, "--") != 0) {
      out.push_back(args[i]);
    }
  }
  return out;
}

void PrintJson(const Json::Value& value) { std::cout << KIVOWriteJson(value, "  ") << "\n"; }

// Says why the package tool's last call failed: "WHAT: words (DETAIL) [code]",
// without the parentheses when `detail` is empty.
int FailWithResult(PackageManager& pm, const std::string& what, const std::string& detail = "") {
  return Fail(what + ": " + PMSResultText(pm.getResult()) +
              (detail.empty() ? "" : " (" + detail + ")") + " [" + std::to_string(pm.getResult()) +
              "]");
}

// Prints and deletes an operation's log, prints its worker messages.
int Report(PackageManager& pm, bool ok, const std::string& what) {
  std::string log = PMSReadPackageLog(pm.getLogFilePath());
  if (!log.empty()) std::cerr << log;
  if (!pm.getLogFilePath().empty()) unlink(pm.getLogFilePath().c_str());
  for (const Json::Value& m : pm.getJsonParam("worker_msg")) std::cout << m.asString() << "\n";
  if (ok) return 0;
  return FailWithResult(pm, what, pm.getMapParam("deppkg"));
}

// "running" or "stopped"; "broken" when its installed files are gone.
std::string RunState(PackageManager& pm, const PackageInfo& info) {
  bool running = false;
  if (pm.getServiceStatus(info, running, true)) return running ? "running" : "stopped";
  return pm.getResult() == PKG_ERR_BROKEN ? "broken" : PMSResultText(pm.getResult());
}

int Usage(const std::string& usage) {
  std::cerr << "kivoctl: usage: " << usage << "\n";
  return 2;
}

}  // namespace

int KivoctlBuild(const std::vector<std::string>& args) {
  std::vector<std::string> pos = Positional(args, {"--level"});
  if (pos.size() != 2) return Usage("kivoctl build SOURCE-FOLDER OUTPUT.kpk [--level 1-9]");
  BuildOptions options;
  options.compression_level = std::atoi(Option(args, "--level", "6").c_str());
  if (options.compression_level < 1 || options.compression_level > 9)
    return Fail("--level takes 1 to 9");
  std::string error;
  if (!PMSBuildPackage(pos[0], pos[1], options, &error)) return Fail(pos[0] + ": " + error);
  std::cout << "built " << pos[1] << "\n";
  return 0;
}

int KivoctlSign(const std::vector<std::string>& args) {
  std::vector<std::string> pos = Positional(args, {"--homedir", "--key", "--output"});
  std::string home = Option(args, "--homedir"), key = Option(args, "--key");
  if (pos.size() != 1 || home.empty() || key.empty()) {
    return Usage("kivoctl sign FILE.kpk --homedir GNUPGHOME --key KEY [--output OUT.kpk]");
  }
  std::string error;
  std::string output = Option(args, "--output", pos[0]);
  if (!PMSSignPackage(pos[0], output, home, key, &error)) return Fail(error);
  std::cout << "signed " << output << "\n";
  return 0;
}

int KivoctlInspect(const std::vector<std::string>& args) {
  if (args.size() != 1) return Usage("kivoctl inspect FILE.kpk");
  PackageFileReader reader;
  std::string error;
  int code = reader.Open(args[0], &error);
  if (code != PKG_OK) return Fail(args[0] + ": " + error + " [" + std::to_string(code) + "]");
  Json::Value out(Json::objectValue);
  for (const auto& kv : reader.header().info) out["info"][kv.first] = kv.second;
  out["members"] = Json::Value(Json::arrayValue);
  for (const auto& d : reader.header().digests) out["members"].append(d.first);
  std::string signer, sig_error;
  int outcome =
      PMSCheckSignature(reader.header().manifest, reader.header().signature, &signer, &sig_error);
  out["signature"]["result"] = outcome;
  out["signature"]["text"] = PMSResultText(outcome);
  if (!signer.empty()) out["signature"]["key"] = signer;
  code = reader.ReadPayload(PackageFileReader::Payload::Check, "", nullptr, &error);
  out["payload"] = code == PKG_OK ? "intact" : error;
  PrintJson(out);
  if (code != PKG_OK) return Fail(args[0] + ": " + error + " [" + std::to_string(code) + "]");
  return 0;
}

int KivoctlInstall(const std::vector<std::string>& args) {
  std::vector<std::string> pos = Positional(args, {"--volume", "--wizard"});
  if (pos.size() != 1) {
    return Usage(
        "kivoctl install FILE.kpk [--volume /volumeN] [--wizard JSON] [--run] "
        "[--no-codesign] [--no-force] [--switch-origin] [--without-data-copy]");
  }
  std::string message;
  PKG_ERRCODE code = PKG_OK;
  Json::Value details;
  const char* user = getenv("USER");
  // A file named on the command line has a file's origin; replacing a
  // package that came from elsewhere takes --switch-origin.
  PMSInstallSource source;
  if (Flag(args, "--switch-origin")) source.choices.change = PMSOriginChange::kAllow;
  source.choices.without_data_copy = Flag(args, "--without-data-copy");
  bool ok = InstallPackageFileImpl(user ? user : "root", pos[0], Option(args, "--volume"), 0,
                                   Option(args, "--wizard"), Flag(args, "--run"), "enu", message,
                                   code, details, !Flag(args, "--no-force"),
                                   !Flag(args, "--no-codesign"), &source);
  if (!message.empty()) std::cerr << message << (message.back() == '\n' ? "" : "\n");
  for (const Json::Value& m : details["workerMessage"]) std::cout << m.asString() << "\n";
  if (!ok) return Fail(pos[0] + ": " + PMSResultText(code) + " [" + std::to_string(code) + "]");
  std::cout << "installed " << pos[0] << "\n";
  return 0;
}

int KivoctlUninstall(const std::vector<std::string>& args) {
  std::vector<std::string> pos = Positional(args, {"--wizard"});
  if (pos.size() != 1) return Usage("kivoctl uninstall ID [--wizard JSON]");
  Json::Value wizard;
  std::string text = Option(args, "--wizard");
  if (!text.empty() && !KIVOParseJson(text, &wizard)) return Fail("--wizard is not JSON");
  PackageManager pm;
  if (!pm.init()) return Fail("the package registry cannot be read");
  return Report(pm, pm.uninstall(pos[0], &wizard, "enu", PKG_OP_UNINSTALL, false, "root"),
                "uninstall " + pos[0]);
}

int KivoctlStartStop(const std::vector<std::string>& args, bool start) {
  if (args.size() != 1) return Usage(std::string("kivoctl ") + (start ? "start" : "stop") + " ID");
  PackageManager pm;
  if (!pm.init()) return Fail("the package registry cannot be read");
  bool ok = pm.serviceControl(start ? PKG_OP_START : PKG_OP_STOP, args[0], start, "enu", "root",
                              nullptr, true, true);
  return Report(pm, ok, std::string(start ? "start " : "stop ") + args[0]);
}

int KivoctlStatus(const std::vector<std::string>& args) {
  if (args.size() != 1) return Usage("kivoctl status ID");
  PackageManager pm;
  PackageInfo info;
  if (!pm.init() || !pm.getPackageInfo(args[0], info)) {
    return FailWithResult(pm, args[0]);
  }
  std::cout << args[0] << " " << info.getVersion() << " " << RunState(pm, info) << "\n";
  return 0;
}

int KivoctlList(const std::vector<std::string>& args) {
  PackageManager pm;
  if (!pm.init()) return Fail("the package registry cannot be read");
  for (const std::string& id : pm.enumPackages()) {
    PackageInfo info;
    // A package removed since the listing is not listed.
    if (!pm.getPackageInfo(id, info)) continue;
    std::cout << id << " " << info.getVersion() << " " << RunState(pm, info) << "\n";
  }
  return 0;
}

int KivoctlLog(const std::vector<std::string>& args) {
  if (args.size() != 1) return Usage("kivoctl log ID");
  PackageManager pm;
  if (!pm.init()) return Fail("the package registry cannot be read");
  std::string path = pm.getPackageLog(args[0]);
  if (pm.getResult() == PKG_ERR_NOT_INSTALLED) return Fail(args[0] + " is not installed");
  std::cout << (path.empty() ? "" : PMSReadPackageLog(path));
  return 0;
}

int KivoctlRollback(const std::vector<std::string>& args) {
  if (args.size() != 1) return Usage("kivoctl rollback ID");
  PackageManager pm;
  if (!pm.init()) return Fail("the package registry cannot be read");
  const char* user = getenv("USER");
  return Report(pm, pm.rollback(args[0], user ? user : "root"), "rollback " + args[0]);
}

int KivoctlRevisions(const std::vector<std::string>& args) {
  if (args.size() != 1) return Usage("kivoctl revisions ID");
  PackageManager pm;
  PackageInfo info;
  if (!pm.init() || !pm.getPackageInfo(args[0], info)) {
    return FailWithResult(pm, args[0]);
  }
  const std::vector<PMSRevision> revisions = PMSListRevisions(args[0]);
  if (revisions.empty()) std::cout << "no earlier version of " << args[0] << " is kept\n";
  for (const PMSRevision& r : revisions) {
    std::cout << args[0] << " " << r.version << " replaced " << PMSReplacedText(r.replaced)
              << ", takes " << PMSRevisionBytes(r) << " bytes\n";
  }
  return 0;
}

int KivoctlDropRevision(const std::vector<std::string>& args) {
  if (args.size() != 1) return Usage("kivoctl drop-revision ID");
  PackageManager pm;
  if (!pm.init()) return Fail("the package registry cannot be read");
  return Report(pm, pm.dropRevisions(args[0]), "drop-revision " + args[0]);
}
