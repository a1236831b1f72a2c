#include "storage/device_info.h"

#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"

DeviceInfo KIVODeviceLoad() {
  DeviceInfo device;
  KeyValueMap conf;
  if (!KIVOKeyValueLoad(KIVORootPath("/etc/kivo/device.conf"), &conf)) return device;
  if (!conf["os_version"].empty()) device.os_version = conf["os_version"];
  if (!conf["arch"].empty()) device.arch = conf["arch"];
  if (!conf["kind"].empty()) device.kind = conf["kind"];
  return device;
}

bool KLIBCIsTinbox() { return KIVODeviceLoad().kind == "tinbox"; }
