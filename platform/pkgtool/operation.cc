#include "pkgtool/operation.h"

#include <ctime>
#include <fcntl.h>
#include <sstream>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/hex.h"
#include "klibc/sysroot.h"
#include "pkgtool/registry.h"

namespace {

// Tells this operation's files from every other's, even when the system
// has no random bytes to give.
std::string Nonce() {
  std::string nonce;
  return KIVORandomHex(6, &nonce) ? nonce
                                  : std::to_string(getpid()) + "-" + std::to_string(time(nullptr));
}

}  // namespace

Operation::Operation(const std::string& kind, const std::string& id) {
  std::string dir = KIVORootPath("/var/log/packages");
  // Without the folder the log cannot be opened: Log() then drops lines and
  // readers find an empty log, which is all that can be offered.
  static_cast<void>(KIVOFSMkdirP(dir.c_str()));
  std::string base = dir + "/" + kind + "-" + id + "-" + Nonce();
  log_path_ = base + ".log";
  worker_path_ = base + ".msg";
  int fd = open(log_path_.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0644);
  if (fd >= 0) close(fd);
}

Operation::~Operation() {
  unlink(worker_path_.c_str());
  unlink((worker_path_ + ".wizard.json").c_str());
}

void Operation::Log(const std::string& line) const {
  int fd = open(log_path_.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
  if (fd < 0) return;
  std::string text = line + "\n";
  ssize_t ignored = write(fd, text.data(), text.size());
  (void)ignored;
  close(fd);
}

Json::Value Operation::WorkerMessages() const {
  Json::Value messages(Json::arrayValue);
  std::string text;
  if (!KIVOReadFile(worker_path_, &text, 64 << 10)) return messages;
  std::istringstream in(text);
  for (std::string line; std::getline(in, line);) {
    if (!line.empty()) messages.append(line);
  }
  return messages;
}
