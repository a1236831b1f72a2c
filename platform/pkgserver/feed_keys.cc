#include "pkgserver/feed_keys.h"

#include <cerrno>
#include <cstdio>
#include <syslog.h>

#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"
#include "pkgserver/openpgp_key_block.h"
#include "settings/web_utils.h"

#define FEED_KEYS_LOG(fmt, ...) syslog(LOG_ERR, "%s:%d " fmt, "feed_keys", __LINE__, ##__VA_ARGS__)

namespace KIVOPackageServer {

namespace {

constexpr char kBegin[] = "-----BEGIN PGP PUBLIC KEY BLOCK-----";
constexpr char kEnd[] = "-----END PGP PUBLIC KEY BLOCK-----";

// FNV-1a of the address: a file name that no address can turn into a path.
std::string KeyFile(const std::string& feed) {
  uint64_t h = 1469598103934665603ULL;
  for (unsigned char c : feed) h = (h ^ c) * 1099511628211ULL;
  char name[40];
  snprintf(name, sizeof(name), "/%016llx.json", static_cast<unsigned long long>(h));
  return KIVORootPath("/usr/kivo/etc/packages/feed_keys") + name;
}

std::string Trimmed(const std::string& text) {
  const char* space = " \t\r\n";
  size_t first = text.find_first_not_of(space);
  if (first == std::string::npos) return "";
  return text.substr(first, text.find_last_not_of(space) - first + 1);
}

Json::Value AcceptedKeys(const std::string& feed, const Json::Value& keys) {
  Json::Value accepted(Json::arrayValue);
  if (!keys.isArray()) return accepted;
  for (Json::ArrayIndex i = 0; i < keys.size(); ++i) {
    if (keys[i].isString() && PMSIsArmoredPublicKey(keys[i].asString())) {
      accepted.append(Trimmed(keys[i].asString()));
    } else if (keys[i].isString() &&
               PMSKeyBlockContent(keys[i].asString()) == KeyBlockContent::kSecretKey) {
      FEED_KEYS_LOG("%s: keyrings[%u] holds a secret key, refused", feed.c_str(), i);
    } else {
      FEED_KEYS_LOG("%s: keyrings[%u] is not an armored public key, refused", feed.c_str(), i);
    }
  }
  return accepted;
}

}  // namespace

bool PMSIsArmoredPublicKey(const std::string& text) {
  const std::string block = Trimmed(text);
  const size_t begin = sizeof(kBegin) - 1, end = sizeof(kEnd) - 1;
  if (block.size() <= begin + end || block.compare(0, begin, kBegin) != 0 ||
      block.compare(block.size() - end, end, kEnd) != 0) {
    return false;
  }
  // One block only: a second header could smuggle a secret key in. And the
  // packets decide, not the header's words.
  return block.find("-----BEGIN", 1) == std::string::npos &&
         block.find("-----END") == block.size() - end && block.find('\0') == std::string::npos &&
         PMSKeyBlockContent(block) == KeyBlockContent::kPublicKey;
}

bool PMSUpdatePkgServerKey(const std::string& feed, const Json::Value& keys) {
  if (feed.empty()) {
    FEED_KEYS_LOG("no feed address for its keys");
    return false;
  }
  const std::string path = KeyFile(feed);
  Json::Value accepted = AcceptedKeys(feed, keys);
  if (accepted.empty()) {
    if (remove(path.c_str()) != 0 && errno != ENOENT) {
      FEED_KEYS_LOG("cannot remove the keys of %s: %m", feed.c_str());
      return false;
    }
    return true;
  }
  Json::Value record(Json::objectValue);
  record["feed"] = feed;
  record["keys"] = accepted;
  if (!WebUtils::SaveJsonFile(path, record)) {
    FEED_KEYS_LOG("cannot write the keys of %s to %s", feed.c_str(), path.c_str());
    return false;
  }
  return true;
}

std::vector<std::string> PMSFeedKeys(const std::string& feed) {
  std::vector<std::string> keys;
  Json::Value record;
  if (feed.empty() || !WebUtils::LoadJsonFile(KeyFile(feed), record) || !record.isObject() ||
      record["feed"].asString() != feed) {
    return keys;
  }
  for (const Json::Value& key : record["keys"]) {
    if (key.isString() && PMSIsArmoredPublicKey(key.asString())) keys.push_back(key.asString());
  }
  return keys;
}

}  // namespace KIVOPackageServer
