#include "pkgtool/operation.h"

#include <ctime>
#include <fcntl.h>
#include <sstream>
#include <sys/random.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"

namespace {

std::string Nonce() {
  unsigned char bytes[6] = {0};
  getrandom(bytes, sizeof(bytes), 0);
  static const char kHex[] = "0123456789abcdef";
  std::string s;
  for (unsigned char b : bytes) {
    s += kHex[b >> 4];
    s += kHex[b & 15];
  }
  return s;
}

}  // namespace

Operation::Operation(const std::string& kind, const std::string& id) {
  std::string dir = KIVORootPath("/var/log/packages");
  KIVOFSMkdirP(dir.c_str());
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
