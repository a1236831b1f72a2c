#include "storage/volume_space.h"

#include <sys/statvfs.h>

#include "klibc/sysroot.h"

namespace {

enum class Figure { Free, Total };

int64_t CappedBytes(const VolumeConfig& volume, Figure figure) {
  struct statvfs st;
  if (statvfs(KIVORootPath(volume.path).c_str(), &st) != 0) return -1;
  uint64_t blocks = figure == Figure::Free ? st.f_bavail : st.f_blocks;
  uint64_t bytes = blocks * st.f_frsize;
  if (volume.cap_bytes > 0 && volume.cap_bytes < bytes) bytes = volume.cap_bytes;
  return static_cast<int64_t>(bytes);
}

}  // namespace

int64_t KIVOVolumeFreeBytes(const VolumeConfig& volume) {
  return CappedBytes(volume, Figure::Free);
}

int64_t KIVOVolumeTotalBytes(const VolumeConfig& volume) {
  return CappedBytes(volume, Figure::Total);
}
