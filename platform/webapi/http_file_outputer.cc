#include "webapi/http_file_outputer.h"

#include <cstdio>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

namespace {

bool WriteAll(const char* data, size_t size) {
  while (size > 0) {
    ssize_t n = write(STDOUT_FILENO, data, size);
    if (n < 0) return false;
    data += n;
    size -= static_cast<size_t>(n);
  }
  return true;
}

// Copies `length` bytes of `fd` to the standard output in blocks.
bool Stream(int fd, off_t length) {
  char block[65536];
  while (length > 0) {
    ssize_t n = read(fd, block, sizeof(block));
    if (n <= 0) return false;
    if (!WriteAll(block, static_cast<size_t>(n))) return false;
    length -= n;
  }
  return true;
}

}  // namespace

bool HTTPFileOutputer::Output(const std::string& path, const std::string& content_type) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  struct stat st;
  if (fstat(fd, &st) != 0 || !S_ISREG(st.st_mode)) {
    close(fd);
    return false;
  }
  // Header lines printed through stdio by the caller must go out before
  // anything written to the descriptor directly.
  fflush(stdout);
  std::string head = "Content-Type: " + content_type +
                     "\r\nContent-Length: " + std::to_string(st.st_size) + "\r\n\r\n";
  bool ok = WriteAll(head.data(), head.size()) && Stream(fd, st.st_size);
  close(fd);
  return ok;
}
