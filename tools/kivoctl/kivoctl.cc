// kivoctl: the command-line tool for package authors and operators.
//
//   kivoctl init-root DIR
//   kivoctl [--root DIR] user-add NAME [--password PW | --password-stdin] [--group G]...
//   kivoctl [--root DIR] web-config [--mode cgi|scgi] [--port N] [--address A] [--cgi PATH]
//                                   [--webd PATH] [--max-children N] [--read-timeout S]
//   kivoctl [--root DIR] server-config [--vendor URL] [--company-info URL]
//                                      [--allow-private-image-addresses yes|no]
//   kivoctl build|sign|inspect|index|icon ...  (package authors)
//   kivoctl [--root DIR] install|uninstall|start|stop|status|list|log ...
//   kivoctl [--root DIR] rollback|revisions|drop-revision ID
//   kivoctl [--root DIR] auto-update [--dry-run] [--now TIME] [--seed N]
//   kivoctl [--root DIR] watchdog [--once]
//   kivoctl [--root DIR] confine ID
//   kivoctl --root DIR drop-groups

#include <cstdio>
#include <cstdlib>
#include <iostream>
#include <string>
#include <unistd.h>
#include <vector>

#include "accounts/accounts.h"
#include "activity/command_record.h"
#include "host/host_config.h"
#include "klibc/atomic_file.h"
#include "klibc/key_value_file.h"
#include "pkgtool/registry.h"
#include "tools/kivoctl/auto_update.h"
#include "tools/kivoctl/catalogue_index.h"
#include "tools/kivoctl/confine_command.h"
#include "tools/kivoctl/fallback_icon.h"
#include "tools/kivoctl/package_commands.h"
#include "tools/kivoctl/root_setup.h"
#include "tools/kivoctl/server_install.h"
#include "tools/kivoctl/watchdog.h"
#include "tools/kivoctl/web_config.h"

namespace {

const char kUsage[] =
    "usage: kivoctl [--root DIR] COMMAND ...\n"
    "\n"
    "commands:\n"
    "  init-root DIR            create a system root (folders, accounts, settings)\n"
    "  user-add NAME [--password PW | --password-stdin] [--group GROUP]...\n"
    "                           create an account in the root, or reset its password\n"
    "                           and add it to groups (administrators may use the\n"
    "                           package center)\n"
    "  web-config [--mode cgi|scgi] [--port N] [--address A] [--cgi PATH]\n"
    "             [--webd PATH] [--max-children N] [--read-timeout SECONDS]\n"
    "                           print the lighttpd configuration that serves the\n"
    "                           root's web API (default 127.0.0.1:5000, the entry.cgi\n"
    "                           beside this program); uploads up to the root's\n"
    "                           max_upload_bytes (etc/kivo/webapi.conf)\n"
    "  server-config [--vendor URL] [--company-info URL]\n"
    "                [--allow-private-image-addresses yes|no]\n"
    "                           set the vendor's catalogue and company-information\n"
    "                           addresses (etc/kivo/pkgserver.conf), and whether\n"
    "                           package images may come from loopback and private\n"
    "                           addresses, and print them\n"
    "\n"
    "package authors:\n"
    "  build SOURCE OUT.kpk [--level N]   build a package file from a source folder\n"
    "  sign FILE.kpk --homedir GNUPGHOME --key KEY [--output OUT.kpk]\n"
    "  inspect FILE.kpk                   INFO, members and signature as JSON\n"
    "  icon SOURCE [--letter L]           draw SOURCE's PACKAGE_ICON.PNG and\n"
    "                                     PACKAGE_ICON_256.PNG: a tile in a colour its\n"
    "                                     package id chooses, bearing L (default: the\n"
    "                                     id's first character)\n"
    "  index FOLDER --base-url URL [--recommend ID]...\n"
    "                                     write FOLDER/catalogue.json (and icons/) from\n"
    "                                     its package files: a static package server\n"
    "\n"
    "operators (on the system root):\n"
    "  install FILE.kpk [--volume V] [--wizard JSON] [--run] [--no-codesign] [--no-force]\n"
    "                 [--switch-origin]   install, or upgrade an installed package\n"
    "                                     (--switch-origin: also one that came from\n"
    "                                     another source or signer, which from then\n"
    "                                     on has this file's origin;\n"
    "                 [--without-data-copy] --without-data-copy: upgrade even when\n"
    "                                     there is no room for a safety copy of the\n"
    "                                     data)\n"
    "  install-server ID [--feed URL] [--volume V] [--run] [--switch-origin]\n"
    "                 [--without-data-copy]\n"
    "                                     install, or upgrade to, the newest ID the\n"
    "                                     vendor's server (or the listed feed) offers\n"
    "  uninstall ID [--wizard JSON]       remove a package\n"
    "  start ID | stop ID | status ID     control a package\n"
    "  list                               installed packages\n"
    "  log ID                             the package's own log\n"
    "  rollback ID                        go back to the version an upgrade replaced,\n"
    "                                     with its data; the data of the version left\n"
    "                                     is kept, so a second rollback undoes it\n"
    "  revisions ID                       the kept earlier version: when it was\n"
    "                                     replaced and the room its copy takes\n"
    "  drop-revision ID                   remove the kept earlier version and its data\n"
    "  auto-update [--dry-run] [--now YYYY-MM-DDTHH:MM] [--seed N]\n"
    "                                     upgrade the packages the automatic-update\n"
    "                                     settings choose, in the maintenance window\n"
    "                                     (--dry-run: only say what; --now, --seed:\n"
    "                                     as at that local time, with that delay)\n"
    "  watchdog [--once]                  start again the packages meant to run whose\n"
    "                                     service died (etc/kivo/watchdog.conf); runs\n"
    "                                     until SIGTERM (--once: one check)\n"
    "  confine ID                         give an installed package its own account now\n"
    "                                     and print what confines it\n"
    "  drop-groups                        remove every control group of the root given\n"
    "                                     with --root, killing what runs in them: for a\n"
    "                                     root about to be removed, never the system's\n"
    "\n"
    "--root DIR selects the system root (default: $KIVO_ROOT, else /).\n";

int Fail(const std::string& message) {
  std::cerr << "kivoctl: " << message << "\n";
  return 1;
}

int InitRoot(const std::vector<std::string>& args) {
  if (args.size() != 1) return Fail("init-root takes one folder");
  std::string error;
  if (!KIVOCreateSystemRoot(args[0], &error)) return Fail(error);
  std::cout << "system root ready at " << args[0] << "\n";
  return 0;
}

int UserAdd(const std::vector<std::string>& args) {
  if (args.empty()) return Fail("user-add needs an account name");
  std::string password;
  bool have_password = false;
  std::vector<std::string> groups;
  for (size_t i = 1; i < args.size(); ++i) {
    if (args[i] == "--password" && i + 1 < args.size()) {
      password = args[++i];
      have_password = true;
    } else if (args[i] == "--password-stdin") {
      have_password = static_cast<bool>(std::getline(std::cin, password));
    } else if (args[i] == "--group" && i + 1 < args.size()) {
      groups.push_back(args[++i]);
    } else {
      return Fail("unknown option for user-add: " + args[i]);
    }
  }
  if (!have_password || password.empty()) return Fail("user-add needs a non-empty password");
  std::string error;
  if (!KIVOAccountSet(args[0], password, groups, &error)) return Fail(error);
  std::cout << "account " << args[0] << " ready\n";
  return 0;
}

// Draws a package source's icons from its id, for packages without a picture
// of their own; the id's colour keeps them apart (the sample packages).
int Icon(const std::vector<std::string>& args) {
  std::string source, letter;
  for (size_t i = 0; i < args.size(); ++i) {
    if (args[i] == "--letter" && i + 1 < args.size()) {
      letter = args[++i];
    } else if (source.empty() && args[i].rfind("--", 0) != 0) {
      source = args[i];
    } else {
      return Fail("unknown argument for icon: " + args[i]);
    }
  }
  if (source.empty()) return Fail("icon needs a package source folder");
  std::string info;
  if (!KIVOReadFile(source + "/INFO", &info, 64 * 1024))
    return Fail("cannot read " + source + "/INFO");
  std::string id = KIVOKeyValueParse(info)["package"];
  if (!PMSIsValidPackageId(id)) return Fail(source + "/INFO names no valid package id");
  if (letter.empty()) letter = id.substr(0, 1);
  if (letter.size() != 1 || !KIVOIsIconLetter(letter[0])) {
    return Fail("--letter takes one letter or digit");
  }
  const std::pair<const char*, int> kIcons[] = {{"PACKAGE_ICON.PNG", 72},
                                                {"PACKAGE_ICON_256.PNG", 256}};
  for (const auto& [name, size] : kIcons) {
    std::string path = source + "/" + name;
    if (!KIVOWriteLetterIcon(path, size, id, letter[0])) return Fail("cannot write " + path);
  }
  std::cout << "icons of " << id << " drawn in " << source << "\n";
  return 0;
}

// entry.cgi and kivo-webd are installed beside kivoctl.
std::string BesideUs(const std::string& program) {
  char exe[4096];
  ssize_t n = readlink("/proc/self/exe", exe, sizeof(exe) - 1);
  if (n <= 0) return "/usr/bin/" + program;
  std::string path(exe, static_cast<size_t>(n));
  return path.substr(0, path.rfind('/')) + "/" + program;
}

int WebConfig(const std::vector<std::string>& args) {
  WebConfigOptions options;
  const char* root = getenv("KIVO_ROOT");
  options.root = root && *root ? root : "/";
  options.mode = WebMode::kScgi;
  options.entry_cgi = BesideUs("entry.cgi");
  options.webd = BesideUs("kivo-webd");
  // lighttpd lets through the uploads the root's web API takes.
  options.max_upload_bytes = LoadUploadLimit();
  for (size_t i = 0; i < args.size(); ++i) {
    bool has_value = i + 1 < args.size();
    if (args[i] == "--mode" && has_value) {
      if (!ParseWebMode(args[++i], &options.mode)) return Fail("--mode takes cgi or scgi");
    } else if (args[i] == "--webd" && has_value) {
      options.webd = args[++i];
    } else if (args[i] == "--max-children" && has_value) {
      options.max_children = std::atoi(args[++i].c_str());
    } else if (args[i] == "--read-timeout" && has_value) {
      options.read_timeout_seconds = std::atoi(args[++i].c_str());
    } else if (args[i] == "--port" && has_value) {
      options.port = std::atoi(args[++i].c_str());
    } else if (args[i] == "--address" && has_value) {
      options.address = args[++i];
    } else if (args[i] == "--cgi" && has_value) {
      options.entry_cgi = args[++i];
    } else {
      return Fail("unknown option for web-config: " + args[i]);
    }
  }
  std::string problem = WebConfigProblem(options);
  if (!problem.empty()) return Fail(problem);
  std::cout << KIVOWebConfig(options);
  return 0;
}

}  // namespace

// Runs `command` with `args`; its exit status.
int RunCommand(const std::string& command, const std::vector<std::string>& args);

int main(int argc, char** argv) {
  std::vector<std::string> args(argv + 1, argv + argc);
  if (args.size() >= 2 && args[0] == "--root") {
    setenv("KIVO_ROOT", args[1].c_str(), 1);
    args.erase(args.begin(), args.begin() + 2);
  }
  if (args.empty() || args[0] == "-h" || args[0] == "--help") {
    std::cout << kUsage;
    return args.empty() ? 2 : 0;
  }
  std::string command = args[0];
  args.erase(args.begin());
  // Changing commands are on record before they start: one killed half way
  // is left unfinished in the activity log.
  KivoActivity::CommandRecord record(command, args);
  int status = RunCommand(command, args);
  record.Finish(status);
  return status;
}

int RunCommand(const std::string& command, const std::vector<std::string>& args) {
  if (command == "init-root") return InitRoot(args);
  if (command == "user-add") return UserAdd(args);
  if (command == "web-config") return WebConfig(args);
  if (command == "server-config") return KivoctlServerConfig(args);
  if (command == "index") return KivoctlIndex(args);
  if (command == "build") return KivoctlBuild(args);
  if (command == "sign") return KivoctlSign(args);
  if (command == "inspect") return KivoctlInspect(args);
  if (command == "icon") return Icon(args);
  if (command == "install" || command == "upgrade") return KivoctlInstall(args);
  if (command == "uninstall") return KivoctlUninstall(args);
  if (command == "start") return KivoctlStartStop(args, true);
  if (command == "stop") return KivoctlStartStop(args, false);
  if (command == "status") return KivoctlStatus(args);
  if (command == "list") return KivoctlList(args);
  if (command == "log") return KivoctlLog(args);
  if (command == "rollback") return KivoctlRollback(args);
  if (command == "revisions") return KivoctlRevisions(args);
  if (command == "drop-revision") return KivoctlDropRevision(args);
  if (command == "auto-update") return KivoctlAutoUpdate(args);
  if (command == "install-server") return KivoctlInstallServer(args);
  if (command == "watchdog") return KivoctlWatchdog(args);
  if (command == "confine") return KivoctlConfine(args);
  if (command == "drop-groups") return KivoctlDropGroups(args);
  std::cerr << kUsage;
  return Fail("unknown command: " + command);
}
