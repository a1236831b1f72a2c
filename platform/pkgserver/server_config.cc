#include "pkgserver/server_config.h"

#include <algorithm>
#include <cctype>
#include <cstdlib>

#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"

namespace {

// A positive number from `map`, else `fallback`.
long long Positive(const KeyValueMap& map, const char* key, long long fallback) {
  auto it = map.find(key);
  if (it == map.end()) return fallback;
  char* end = nullptr;
  long long value = std::strtoll(it->second.c_str(), &end, 10);
  return end && *end == '\0' && value > 0 ? value : fallback;
}

}  // namespace

HttpLimits PkgServerConfig::CatalogueLimits() const {
  HttpLimits limits;
  limits.connect_timeout_s = connect_timeout_s;
  limits.total_timeout_s = catalogue_timeout_s;
  limits.stall_timeout_s = catalogue_timeout_s;
  limits.max_bytes = catalogue_max_bytes;
  return limits;
}

HttpLimits PkgServerConfig::CatalogueLimitsWithin(long seconds) const {
  HttpLimits limits = CatalogueLimits();
  limits.connect_timeout_s = std::min(limits.connect_timeout_s, seconds);
  // A total of 0 means no bound: the cap is the bound then.
  limits.total_timeout_s =
      limits.total_timeout_s > 0 ? std::min(limits.total_timeout_s, seconds) : seconds;
  limits.stall_timeout_s = std::min(limits.stall_timeout_s, seconds);
  return limits;
}

HttpLimits PkgServerConfig::DownloadLimits(uint64_t size) const {
  HttpLimits limits;
  limits.connect_timeout_s = connect_timeout_s;
  limits.total_timeout_s = 0;
  limits.stall_timeout_s = download_stall_timeout_s;
  limits.max_bytes = size;
  return limits;
}

HttpLimits PkgServerConfig::SmallLimits(uint64_t max_bytes) const {
  HttpLimits limits = CatalogueLimits();
  limits.max_bytes = max_bytes;
  return limits;
}

std::string PMSServerConfigPath() { return KIVORootPath("/etc/kivo/pkgserver.conf"); }

PkgServerConfig PMSLoadServerConfig() {
  KeyValueMap map;
  PkgServerConfig config;
  if (!KIVOKeyValueLoad(PMSServerConfigPath(), &map)) return config;
  config.vendor_url = map["vendor_url"];
  config.company_info_url = map["company_info_url"];
  config.connect_timeout_s = Positive(map, "connect_timeout", config.connect_timeout_s);
  config.catalogue_timeout_s = Positive(map, "catalogue_timeout", config.catalogue_timeout_s);
  config.catalogue_max_bytes = static_cast<uint64_t>(
      Positive(map, "catalogue_max_bytes", static_cast<long long>(config.catalogue_max_bytes)));
  config.catalogue_max_age_s = Positive(map, "catalogue_max_age", config.catalogue_max_age_s);
  config.download_stall_timeout_s =
      Positive(map, "download_stall_timeout", config.download_stall_timeout_s);
  config.download_retries =
      static_cast<int>(Positive(map, "download_retries", config.download_retries));
  config.allow_private_image_addresses = map[kPrivateImageAddressesKey] == "yes";
  return config;
}

bool PMSIsServerUrl(const std::string& url) {
  if (url.rfind("http://", 0) != 0 && url.rfind("https://", 0) != 0) return false;
  if (url.size() > 2048) return false;
  for (unsigned char c : url) {
    if (c <= ' ' || c == 0x7f) return false;
  }
  return url.find("://") + 3 < url.size();
}

std::string PMSUrlEncode(const std::string& text) {
  static const char kHex[] = "0123456789ABCDEF";
  std::string out;
  for (unsigned char c : text) {
    if (isalnum(c) || c == '-' || c == '.' || c == '_' || c == '~') {
      out += static_cast<char>(c);
    } else {
      out += '%';
      out += kHex[c >> 4];
      out += kHex[c & 15];
    }
  }
  return out;
}
