#include "pkgserver/mapped_file.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

MappedFile::~MappedFile() {
  if (data_) munmap(data_, size_);
}

bool MappedFile::Open(const std::string& path, size_t limit) {
  if (data_) return false;
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  struct stat st;
  size_t size = 0;
  if (fstat(fd, &st) == 0 && S_ISREG(st.st_mode) && st.st_size > 0) {
    size = static_cast<size_t>(st.st_size) < limit ? static_cast<size_t>(st.st_size) : limit;
  }
  void* data =
      size ? mmap(nullptr, size, PROT_READ, MAP_PRIVATE | MAP_POPULATE, fd, 0) : MAP_FAILED;
  close(fd);
  if (data == MAP_FAILED) return false;
  data_ = data;
  size_ = size;
  return true;
}
