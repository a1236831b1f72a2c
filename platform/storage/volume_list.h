// The volume list the web desktop shows for installs, built from the volume
// configuration (volumes.h) and the volumes' space (volume_space.h).
#pragma once

#include <json/value.h>

namespace KIVO {
namespace PXS {
namespace STORAGE_WEBUTILS {

class Volume {
 public:
  // `flags` selects the volumes; every kind lists the usable ones.
  explicit Volume(int flags) : flags_(flags) {}

  // out["volumes"] = [{"volume_path", "status", "size_free_byte",
  // "size_total_byte", "is_brick"}] (the sizes as decimal strings, 0 for a
  // volume whose folder cannot be measured) and out["volume_count"]; a
  // volume that is not usable is listed only `with_unusable`. False, `out`
  // untouched, when the volume configuration file cannot be found.
  [[nodiscard]] bool VolumeListGet(Json::Value& out, bool with_unusable);

 private:
  // Every kind of listing is the same so far; the flags are kept for when
  // one differs.
  [[maybe_unused]] int flags_;
};

}  // namespace STORAGE_WEBUTILS
}  // namespace PXS
}  // namespace KIVO
