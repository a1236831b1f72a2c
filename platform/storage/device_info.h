// What kind of appliance this is, as configured under the system root. This
// file stands in for the platform's own device facts:
//
//   /etc/kivo/device.conf   os_version="7.2-0064" arch="x86_64" kind="nas"
//
// Nothing here fails: a missing file, or a missing or empty key, gives the
// default below, the facts of the common appliance.
#pragma once

#include <string>

struct DeviceInfo {
  std::string os_version = "7.2-0064";  // compare with os_version.h
  std::string arch = "x86_64";
  std::string kind = "nas";  // "nas", or "tinbox" for the single-volume device
};

// The device facts, read afresh on every call.
DeviceInfo KIVODeviceLoad();

// True on the single-volume device kind ("tinbox" in device.conf).
bool KLIBCIsTinbox();
