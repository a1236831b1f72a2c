#include "tools/kivoctl/catalogue_index.h"

#include <algorithm>
#include <dirent.h>
#include <fcntl.h>
#include <iostream>
#include <memory>
#include <unistd.h>

#include "klibc/atomic_file.h"
#include "klibc/hex.h"
#include "klibc/json_text.h"
#include "klibc/key_value_file.h"
#include "pkgserver/server_config.h"
#include "pkgtool/dependency.h"
#include "pkgtool/package_file.h"
#include "pkgtool/registry.h"
#include "pkgtool/release_notes.h"
#include "pkgtool/root_request.h"

#include <openssl/evp.h>

namespace {

struct FileDigests {
  std::string md5, sha256;
  uint64_t size = 0;
};

bool Digest(const std::string& path, FileDigests* out) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  std::unique_ptr<EVP_MD_CTX, decltype(&EVP_MD_CTX_free)> md5(EVP_MD_CTX_new(), EVP_MD_CTX_free),
      sha(EVP_MD_CTX_new(), EVP_MD_CTX_free);
  bool ok = md5 && sha && EVP_DigestInit_ex(md5.get(), EVP_md5(), nullptr) &&
            EVP_DigestInit_ex(sha.get(), EVP_sha256(), nullptr);
  std::vector<char> buf(1 << 20);
  ssize_t n = 0;
  while (ok && (n = read(fd, buf.data(), buf.size())) > 0) {
    ok = EVP_DigestUpdate(md5.get(), buf.data(), n) && EVP_DigestUpdate(sha.get(), buf.data(), n);
    out->size += static_cast<uint64_t>(n);
  }
  close(fd);
  unsigned char d[EVP_MAX_MD_SIZE];
  unsigned len = 0;
  if (!ok || n < 0 || !EVP_DigestFinal_ex(md5.get(), d, &len)) return false;
  out->md5 = KIVOHex(d, len);
  if (!EVP_DigestFinal_ex(sha.get(), d, &len)) return false;
  out->sha256 = KIVOHex(d, len);
  return true;
}

std::vector<std::string> PackageFiles(const std::string& folder) {
  std::vector<std::string> names;
  DIR* dir = opendir(folder.c_str());
  if (!dir) return names;
  while (dirent* e = readdir(dir)) {
    std::string name = e->d_name;
    if (name.size() > 4 && name.compare(name.size() - 4, 4, ".kpk") == 0) names.push_back(name);
  }
  closedir(dir);
  std::sort(names.begin(), names.end());
  return names;
}

// The INFO keys a catalogue entry carries as they stand (and their
// "_<lang>" variants for the texts). The last three say what the package
// will be allowed to do, which the page shows before anything is
// downloaded.
const char* const kPassedKeys[] = {
    "maintainer",   "maintainer_url",       "distributor",    "distributor_url", "helpurl",
    "support_url",  "report_url",           "os_min_ver",     "os_max_ver",      "arch",
    "install_type", "install_dep_services", kPMSRunAsRootKey, "memory_limit_mb", "process_limit"};

void CopyTexts(const KeyValueMap& info, Json::Value& entry) {
  for (const auto& [key, value] : info) {
    if (key.rfind("displayname", 0) == 0) entry["dname" + key.substr(11)] = value;
    if (key.rfind("description", 0) == 0) entry["desc" + key.substr(11)] = value;
  }
  if (!entry.isMember("dname")) entry["dname"] = info.at("package");
}

bool WriteIcons(const PackageFileHeader& h, const CatalogueIndexOptions& o, const std::string& stem,
                Json::Value& entry, std::string* error) {
  const std::pair<const char*, const char*> kIcons[] = {{"PACKAGE_ICON.PNG", "icon"},
                                                        {"PACKAGE_ICON_256.PNG", "icon_256"}};
  for (const auto& [member, key] : kIcons) {
    auto it = h.members.find(member);
    if (it == h.members.end()) continue;
    std::string file = stem + (std::string(key) == "icon" ? ".png" : "_256.png");
    if (KIVOFSMkdirP((o.folder + "/icons").c_str()) != 0 ||
        !KIVOWriteFileAtomic(o.folder + "/icons/" + file, it->second, SyncToDisk::No)) {
      return (*error = "cannot write " + o.folder + "/icons/" + file), false;
    }
    entry[key] = o.base_url + "/icons/" + PMSUrlEncode(file);
  }
  return true;
}

// Screenshots go to screenshots/<package>-<version>/screenshot_<n>.png,
// beside the catalogue (the package center fetches images only from a
// catalogue's server); the entry lists their addresses in order.
bool WriteScreenshots(const PackageFileHeader& h, const CatalogueIndexOptions& o,
                      const std::string& stem, Json::Value& entry, std::string* error) {
  const std::string folder = o.folder + "/screenshots/" + stem;
  Json::Value urls(Json::arrayValue);
  for (int n = 1; n <= 8; ++n) {
    auto it = h.members.find("SCREENSHOT_" + std::to_string(n) + ".PNG");
    if (it == h.members.end()) continue;
    std::string file = "screenshot_" + std::to_string(n) + ".png";
    if (KIVOFSMkdirP(folder.c_str()) != 0 ||
        !KIVOWriteFileAtomic(folder + "/" + file, it->second, SyncToDisk::No)) {
      return (*error = "cannot write " + folder + "/" + file), false;
    }
    urls.append(o.base_url + "/screenshots/" + PMSUrlEncode(stem) + "/" + file);
  }
  if (!urls.empty()) entry["screenshots"] = urls;
  return true;
}

bool MakeEntry(const CatalogueIndexOptions& o, const std::string& name, Json::Value& entry,
               std::string* error) {
  const std::string path = o.folder + "/" + name;
  PackageFileReader reader;
  std::string why;
  if (reader.Open(path, &why) != 0) return (*error = path + ": " + why), false;
  const KeyValueMap& info = reader.header().info;
  FileDigests digests;
  if (!Digest(path, &digests)) return (*error = "cannot read " + path), false;
  entry["package"] = info.at("package");
  entry["version"] = info.at("version");
  CopyTexts(info, entry);
  for (const char* key : kPassedKeys) {
    auto it = info.find(key);
    if (it != info.end() && !it->second.empty()) entry[key] = it->second;
  }
  auto beta = info.find("beta");
  std::string b = beta == info.end() ? "" : beta->second;
  entry["beta"] = b == "yes" || b == "true" || b == "1";
  entry["link"] = o.base_url + "/" + PMSUrlEncode(name);
  entry["md5"] = digests.md5;
  entry["sha256"] = digests.sha256;
  entry["size"] = static_cast<Json::UInt64>(digests.size);
  entry["type"] = 0;
  auto deps = info.find("install_dep_packages");
  entry["deppkgs"] = deps == info.end() ? "" : deps->second;
  auto conflicts = info.find("install_conflict_packages");
  entry["conflictpkgs"] = conflicts == info.end() ? "" : conflicts->second;
  // The release notes, checked by the reader: the page shows them as text.
  auto notes = reader.header().members.find(kPMSReleaseNotesMember);
  if (notes != reader.header().members.end() && !notes->second.empty())
    entry["changelog"] = notes->second;
  const std::string stem = info.at("package") + "-" + info.at("version");
  return WriteIcons(reader.header(), o, stem, entry, error) &&
         WriteScreenshots(reader.header(), o, stem, entry, error);
}

}  // namespace

bool KivoctlWriteCatalogue(const CatalogueIndexOptions& o, int* count, std::string* error) {
  Json::Value catalogue(Json::objectValue);
  catalogue["packages"] = Json::Value(Json::arrayValue);
  catalogue["recommend"] = Json::Value(Json::arrayValue);
  catalogue["keyrings"] = Json::Value(Json::arrayValue);
  for (const std::string& name : PackageFiles(o.folder)) {
    Json::Value entry(Json::objectValue);
    if (!MakeEntry(o, name, entry, error)) return false;
    catalogue["packages"].append(entry);
  }
  for (const std::string& id : o.recommend) catalogue["recommend"].append(id);
  const std::string out = o.folder + "/" + o.output;
  if (!KIVOWriteFileAtomic(out, KIVOWriteJson(catalogue, " ") + "\n", SyncToDisk::No, 0644))
    return (*error = "cannot write " + out), false;
  *count = static_cast<int>(catalogue["packages"].size());
  return true;
}

int KivoctlIndex(const std::vector<std::string>& args) {
  CatalogueIndexOptions o;
  for (size_t i = 0; i < args.size(); ++i) {
    bool value = i + 1 < args.size();
    if (args[i] == "--base-url" && value) {
      o.base_url = args[++i];
    } else if (args[i] == "--output" && value) {
      o.output = args[++i];
    } else if (args[i] == "--recommend" && value) {
      o.recommend.push_back(args[++i]);
    } else if (o.folder.empty() && args[i].rfind("--", 0) != 0) {
      o.folder = args[i];
    } else {
      std::cerr << "kivoctl: unknown option for index: " << args[i] << "\n";
      return 2;
    }
  }
  while (o.base_url.size() > 1 && o.base_url.back() == '/') o.base_url.pop_back();
  if (o.folder.empty() || !PMSIsServerUrl(o.base_url)) {
    std::cerr << "kivoctl: index needs FOLDER and --base-url http(s)://...\n";
    return 2;
  }
  if (o.output.empty() || o.output.find('/') != std::string::npos || o.output[0] == '.') {
    std::cerr << "kivoctl: --output takes a plain file name\n";
    return 2;
  }
  for (const std::string& id : o.recommend) {
    if (!PMSIsValidPackageId(id)) {
      std::cerr << "kivoctl: not a package id: " << id << "\n";
      return 2;
    }
  }
  int count = 0;
  std::string error;
  if (!KivoctlWriteCatalogue(o, &count, &error)) {
    std::cerr << "kivoctl: " << error << "\n";
    return 1;
  }
  std::cout << count << " packages in " << o.folder << "/" << o.output << "\n";
  return 0;
}

int KivoctlServerConfig(const std::vector<std::string>& args) {
  constexpr char kPrivateImages[] = "--allow-private-image-addresses";
  const std::pair<const char*, const char*> kOptions[] = {
      {"--vendor", "vendor_url"},
      {"--company-info", "company_info_url"},
      {kPrivateImages, kPrivateImageAddressesKey}};
  for (size_t i = 0; i < args.size(); i += 2) {
    const char* key = nullptr;
    for (const auto& [option, name] : kOptions) {
      if (args[i] == option) key = name;
    }
    if (!key || i + 1 >= args.size()) {
      std::cerr << "kivoctl: unknown option for server-config: " << args[i] << "\n";
      return 2;
    }
    if (args[i] == kPrivateImages) {
      if (args[i + 1] != "yes" && args[i + 1] != "no") {
        std::cerr << "kivoctl: " << kPrivateImages << " takes yes or no\n";
        return 2;
      }
    } else if (!PMSIsServerUrl(args[i + 1])) {
      std::cerr << "kivoctl: not an http or https address: " << args[i + 1] << "\n";
      return 2;
    }
    if (!KIVOKeyValueSet(PMSServerConfigPath(), key, args[i + 1])) {
      std::cerr << "kivoctl: cannot write " << PMSServerConfigPath() << "\n";
      return 1;
    }
  }
  PkgServerConfig config = PMSLoadServerConfig();
  std::cout << "vendor_url=" << config.vendor_url << "\n"
            << "company_info_url=" << config.company_info_url << "\n"
            << kPrivateImageAddressesKey << "="
            << (config.allow_private_image_addresses ? "yes" : "no") << "\n";
  return 0;
}
