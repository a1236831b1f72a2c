// Where the package servers are and how long the appliance waits for them:
// the key/value file "/etc/kivo/pkgserver.conf" under the system root.
//
//   vendor_url="https://..."        the vendor's catalogue
//   company_info_url="https://..."  the vendor's company-information endpoint
//   connect_timeout="10"            seconds to connect to any server
//   catalogue_timeout="20"          seconds for a whole catalogue answer
//   catalogue_max_bytes="16777216"  largest catalogue answer accepted
//   catalogue_max_age="300"         seconds a cached catalogue is used as it is
//   download_stall_timeout="30"     seconds a download may receive nothing
//   download_retries="3"            resumed attempts after a dropped download
//   allow_private_image_addresses="no"
//                                   "yes": icons and screenshots may come from
//                                   loopback, link-local and private addresses
//                                   (server_image.h); for roots whose package
//                                   servers run on such addresses (a demo, tests)
//
// Missing keys, and values that are not positive numbers, take these
// defaults.
#pragma once

#include <cstdint>
#include <string>

#include "pkgserver/server_net.h"

struct PkgServerConfig {
  std::string vendor_url;
  std::string company_info_url;
  long connect_timeout_s = 10;
  long catalogue_timeout_s = 20;
  uint64_t catalogue_max_bytes = 16 << 20;
  long catalogue_max_age_s = 300;
  long download_stall_timeout_s = 30;
  int download_retries = 3;
  bool allow_private_image_addresses = false;

  HttpLimits CatalogueLimits() const;
  // CatalogueLimits held to `seconds` in all, connecting included (for an
  // answer a person waits on, whatever the root's timeouts say). `seconds`
  // is positive.
  HttpLimits CatalogueLimitsWithin(long seconds) const;
  // Downloads have no total bound (a large file takes long); a stall ends
  // them. `size` is the announced size (0: unknown).
  HttpLimits DownloadLimits(uint64_t size) const;
  // Images and small requests.
  HttpLimits SmallLimits(uint64_t max_bytes) const;
};

// The key of allow_private_image_addresses, which `kivoctl server-config`
// sets too.
inline constexpr char kPrivateImageAddressesKey[] = "allow_private_image_addresses";

// The configuration file's path under the system root.
std::string PMSServerConfigPath();
// The configuration (defaults for what the file does not say).
PkgServerConfig PMSLoadServerConfig();
// True when `url` is an absolute http or https address without spaces or
// control characters.
bool PMSIsServerUrl(const std::string& url);
// Percent-encodes everything but letters, digits and "-._~" (for query
// parameters and form bodies).
std::string PMSUrlEncode(const std::string& text);
