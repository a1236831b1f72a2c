#include "webapi/upload_area.h"

#include <ctime>
#include <fcntl.h>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"
#include "storage/volume_space.h"
#include "storage/volumes.h"
#include "webapi/api_upload.h"

namespace {

constexpr time_t kAbandonedAfterSeconds = 24 * 3600;

}  // namespace

int KIVOCreateUploadFile(uint64_t size, std::string* path) {
  bool any_usable = false;
  for (const VolumeConfig& v : KIVOVolumesLoad()) {
    if (!v.usable()) continue;
    any_usable = true;
    int64_t free_bytes = KIVOVolumeFreeBytes(v);
    if (free_bytes < 0 || static_cast<uint64_t>(free_bytes) <= size) continue;
    std::string dir = KIVORootPath(v.path + "/@tmp/upload");
    if (KIVOFSMkdirP(dir.c_str(), 0700) != 0) return UPLOAD_NO_TMP_DIR;
    // Uploads whose install never came: after a day nobody will ask for
    // them any more, so they are swept here and cannot fill the volume.
    KIVORemoveFilesOlderThan(dir, "upload-", kAbandonedAfterSeconds);
    std::string pattern = dir + "/upload-XXXXXX";
    int fd = mkostemp(&pattern[0], O_CLOEXEC);
    if (fd < 0) return UPLOAD_NO_TMP_DIR;
    close(fd);
    *path = pattern;
    return UPLOAD_OK;
  }
  return any_usable ? UPLOAD_TOO_LARGE : UPLOAD_NO_VOLUME;
}
