#include "host/host_config.h"

#include <cstdlib>

#include "klibc/key_value_file.h"
#include "klibc/sysroot.h"

namespace {

long long ReadNumber(const KeyValueMap& conf, const char* key, long long def) {
  auto it = conf.find(key);
  if (it == conf.end()) return def;
  long long v = std::strtoll(it->second.c_str(), nullptr, 10);
  return v > 0 ? v : def;
}

}  // namespace

HostConfig LoadHostConfig() {
  HostConfig config;
  KeyValueMap conf;
  if (!KIVOKeyValueLoad(KIVORootPath("/etc/kivo/webapi.conf"), &conf)) return config;
  config.session.idle_timeout =
      ReadNumber(conf, "session_idle_timeout", config.session.idle_timeout);
  config.session.max_age = ReadNumber(conf, "session_max_age", config.session.max_age);
  config.session.max_per_account =
      ReadNumber(conf, "session_max_per_account", config.session.max_per_account);
  LoginLimits& login = config.login;
  login.free_failures = ReadNumber(conf, "login_free_failures", login.free_failures);
  login.backoff_base = ReadNumber(conf, "login_backoff_base", login.backoff_base);
  login.backoff_max = ReadNumber(conf, "login_backoff_max", login.backoff_max);
  config.max_upload_bytes = static_cast<uint64_t>(
      ReadNumber(conf, "max_upload_bytes", static_cast<long long>(config.max_upload_bytes)));
  return config;
}
