#include "storage/service_state.h"

#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"

bool KIVOServiceRunning(const std::string& name) {
  KeyValueMap conf;
  return KIVOKeyValueLoad(KIVORootPath("/etc/kivo/services.conf"), &conf) &&
         conf[name] == "running";
}
