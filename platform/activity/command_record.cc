#include "activity/command_record.h"

#include <cstdlib>
#include <pwd.h>
#include <unistd.h>

#include "pkgtool/registry.h"

namespace KivoActivity {

namespace {

// The recorded commands and the operation each is: the names the web API's
// calls are recorded under, so that one filter finds both.
constexpr struct {
  const char* command;
  const char* operation;
} kCommands[] = {
    {"install", "Installation.install"},
    {"upgrade", "Installation.install"},
    {"install-server", "Installation.install"},
    {"uninstall", "Uninstallation.uninstall"},
    {"start", "Control.start"},
    {"stop", "Control.stop"},
    {"rollback", "Revision.rollback"},
    {"drop-revision", "Revision.drop"},
    {"auto-update", "auto-update"},
};

const char* OperationOf(const std::string& command, const std::vector<std::string>& args) {
  for (const std::string& a : args) {
    if (command == "auto-update" && a == "--dry-run") return nullptr;
  }
  for (const auto& c : kCommands) {
    if (command == c.command) return c.operation;
  }
  return nullptr;
}

// The user behind the command: the one sudo ran it for, else the caller.
std::string UnixUser() {
  const char* sudo_user = getenv("SUDO_USER");
  if (getuid() == 0 && sudo_user && *sudo_user) return std::string(sudo_user).substr(0, 64);
  struct passwd pw, *found = nullptr;
  char buf[4096];
  if (getpwuid_r(getuid(), &pw, buf, sizeof(buf), &found) == 0 && found) return found->pw_name;
  return "uid " + std::to_string(getuid());
}

// The first word that is no option is the package (or, for install, the
// file); a feed's address is kept without credentials.
Operation TargetOf(const std::string& command, const std::vector<std::string>& args) {
  Operation op;
  for (size_t i = 0; i < args.size(); ++i) {
    if (args[i] == "--feed" && i + 1 < args.size()) {
      op.target["feed"] = WithoutCredentials(args[++i]).substr(0, 1024);
    } else if (args[i].rfind("--", 0) == 0) {
      // Options that take a value: the value names no package.
      if (args[i] == "--volume" || args[i] == "--wizard" || args[i] == "--now" ||
          args[i] == "--seed")
        ++i;
    } else if (!op.target.isMember("id") && !op.target.isMember("file")) {
      bool is_file = command == "install" || command == "upgrade";
      const std::string& word = args[i];
      if (is_file) {
        op.target["file"] = word.substr(word.rfind('/') + 1).substr(0, 256);
      } else if (PMSIsValidPackageId(word)) {
        op.target["id"] = word;
        op.packages.push_back(word);
      }
    }
  }
  return op;
}

}  // namespace

CommandRecord::CommandRecord(const std::string& command, const std::vector<std::string>& args)
    : pid_(getpid()) {
  const char* operation = OperationOf(command, args);
  if (!operation) return;
  Operation op = TargetOf(command, args);
  op.name = operation;
  id_ = log_.Begin({UnixUser(), kOriginKivoctl, ""}, op);
}

void CommandRecord::Finish(int exit_status) {
  if (id_ == 0 || getpid() != pid_) return;
  Outcome outcome{exit_status,
                  exit_status == 0 ? "success" : "exit status " + std::to_string(exit_status)};
  // A failure to record is in syslog already; the command's outcome stands.
  static_cast<void>(log_.Finish(id_, outcome));
  id_ = 0;
}

}  // namespace KivoActivity
