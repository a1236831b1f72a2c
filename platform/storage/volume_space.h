// The space of a configured volume: the real statvfs figures of its folder
// under the system root, capped at the volume's "cap_bytes" when that is
// above 0, so that a full volume can be produced on purpose.
//
// Each answer is a byte count, or -1 when the folder cannot be measured
// (missing, or not readable); the caller decides what an unmeasured volume
// means for it.
#pragma once

#include <cstdint>

#include "storage/volumes.h"

// Bytes an unprivileged writer may still use on the volume, or -1.
[[nodiscard]] int64_t KIVOVolumeFreeBytes(const VolumeConfig& volume);

// The size of the volume, or -1.
[[nodiscard]] int64_t KIVOVolumeTotalBytes(const VolumeConfig& volume);
