// The volume calls the package center makes, with the platform's calling
// convention: each answers an int that is negative on failure, and every
// failure is one the caller must handle. They answer from the volume
// configuration (volumes.h); a "real path" is one under the system root
// ("<root>/volume1/@appstore/x"), as the package registry stores it.
#pragma once

#include <cstdint>
#include <string>

// The volume part of the real path `path` ("<root>/volume1/x" -> "/volume1")
// into `volume`. 0 on success; -1, `volume` untouched, when the path lies on
// no configured volume.
[[nodiscard]] int VolumePathParseEx(const std::string& path, std::string& volume);

// 1 when the volume holding the real path `path` serves as a cluster file
// system brick, 0 when not, -1 when the path lies on no configured volume.
[[nodiscard]] int KIVOVolumeIsUsedByGlusterFs(const std::string& path);

// The mount facts of a volume path ("/volume1").
struct KIVOMountVolInfo {
  int available = 0;        // 1 when the volume is usable and its folder measurable
  uint64_t free_bytes = 0;  // free space (volume_space.h); 0 when unmeasured
};
// 0 and `info` filled, or -1 when `path` is not exactly a configured volume.
[[nodiscard]] int KIVOMountVolInfoGet(const char* path, KIVOMountVolInfo* info);

// The temporary folder of the shared folder that holds the real path
// `path` ("<root>/volume1/<share>/x"): the volume's "@tmp" folder, where
// uploads and downloads are kept, as a real path. Written to `buf`
// (NUL-terminated); the length, or -1 when `path` lies on no configured
// volume or `buf` is too small.
[[nodiscard]] int KIVOShareTmpPathGet(const char* path, char* buf, int size);
