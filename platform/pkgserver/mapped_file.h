// A file's content mapped read-only into memory.
//
// A megabyte read into fresh memory costs a page fault per 4 KiB page as it
// is filled, and faults are dear in a virtual machine; a mapping populated
// at once takes the page cache's pages as they are. The file must not shrink
// while it is mapped (reading beyond its new end kills the process): map
// only files that are replaced by rename, never rewritten in place, as every
// file under the root is.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

class MappedFile {
 public:
  MappedFile() = default;
  ~MappedFile();
  MappedFile(const MappedFile&) = delete;
  MappedFile& operator=(const MappedFile&) = delete;

  // Maps the regular file `path` (at most `limit` bytes of it). False, with
  // nothing mapped, when it cannot be opened or mapped, is not a regular file
  // or is empty.
  [[nodiscard]] bool Open(const std::string& path, size_t limit);
  // The content; empty when nothing is mapped. Valid while this lives.
  std::string_view text() const { return {static_cast<const char*>(data_), size_}; }

 private:
  void* data_ = nullptr;
  size_t size_ = 0;
};
