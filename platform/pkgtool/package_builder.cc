#include "pkgtool/package_builder.h"

#include <algorithm>
#include <cstring>
#include <dirent.h>
#include <fcntl.h>
#include <map>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include <archive.h>
#include <archive_entry.h>

#include "klibc/atomic_file.h"
#include "klibc/key_value_file.h"
#include "pkgtool/package_file.h"
#include "pkgtool/package_info.h"
#include "pkgtool/sha256.h"
#include "pkgtool/signature.h"
#include "webapi/webapi_util.h"

namespace {

bool Fail(std::string* error, const std::string& text) {
  *error = text;
  return false;
}

// Every path below `dir` (relative to `base`), folders before their files,
// in name order so that builds are reproducible.
void ListTree(const std::string& base, const std::string& rel, std::vector<std::string>* out) {
  std::string dir = rel.empty() ? base : base + "/" + rel;
  DIR* d = opendir(dir.c_str());
  if (!d) return;
  std::vector<std::string> names;
  while (struct dirent* e = readdir(d)) {
    if (strcmp(e->d_name, ".") != 0 && strcmp(e->d_name, "..") != 0) names.push_back(e->d_name);
  }
  closedir(d);
  std::sort(names.begin(), names.end());
  for (const std::string& name : names) {
    std::string path = rel.empty() ? name : rel + "/" + name;
    out->push_back(path);
    struct stat st;
    if (lstat((base + "/" + path).c_str(), &st) == 0 && S_ISDIR(st.st_mode))
      ListTree(base, path, out);
  }
}

// Writes one file's bytes (from `src_fd`) into the archive, hashing them.
bool CopyInto(struct archive* a, int src_fd, Sha256* sha) {
  std::vector<char> buf(1 << 20);
  for (ssize_t n; (n = read(src_fd, buf.data(), buf.size())) > 0;) {
    if (sha) sha->Update(buf.data(), static_cast<size_t>(n));
    if (archive_write_data(a, buf.data(), static_cast<size_t>(n)) != n) return false;
  }
  return true;
}

bool AddPayloadEntry(struct archive* a, const std::string& base, const std::string& path,
                     std::string* error) {
  std::string full = base + "/" + path;
  struct stat st;
  if (lstat(full.c_str(), &st) != 0) return Fail(error, "cannot read " + full);
  struct archive_entry* entry = archive_entry_new();
  archive_entry_set_pathname(entry, path.c_str());
  archive_entry_set_perm(entry, st.st_mode & 0777);
  archive_entry_set_mtime(entry, st.st_mtime, 0);
  bool ok = true;
  if (S_ISDIR(st.st_mode)) {
    archive_entry_set_filetype(entry, AE_IFDIR);
    ok = archive_write_header(a, entry) == ARCHIVE_OK;
  } else if (S_ISLNK(st.st_mode)) {
    char target[4096];
    ssize_t n = readlink(full.c_str(), target, sizeof(target) - 1);
    target[n > 0 ? n : 0] = '\0';
    archive_entry_set_filetype(entry, AE_IFLNK);
    archive_entry_set_symlink(entry, target);
    ok = archive_write_header(a, entry) == ARCHIVE_OK;
  } else if (S_ISREG(st.st_mode)) {
    archive_entry_set_filetype(entry, AE_IFREG);
    archive_entry_set_size(entry, st.st_size);
    int fd = open(full.c_str(), O_RDONLY | O_CLOEXEC);
    ok = fd >= 0 && archive_write_header(a, entry) == ARCHIVE_OK && CopyInto(a, fd, nullptr);
    if (fd >= 0) close(fd);
  } else {
    ok = Fail(error, "not a file, folder or symlink: package/" + path);
  }
  archive_entry_free(entry);
  if (!ok && error->empty()) *error = "cannot add package/" + path + ": " + archive_error_string(a);
  return ok;
}

bool WritePayload(const std::string& dir, const std::string& out, int level, std::string* error) {
  struct archive* a = archive_write_new();
  archive_write_set_format_pax_restricted(a);
  archive_write_add_filter_gzip(a);
  archive_write_set_filter_option(a, "gzip", "compression-level", std::to_string(level).c_str());
  bool ok = archive_write_open_filename(a, out.c_str()) == ARCHIVE_OK;
  std::vector<std::string> paths;
  ListTree(dir, "", &paths);
  for (size_t i = 0; ok && i < paths.size(); ++i) ok = AddPayloadEntry(a, dir, paths[i], error);
  ok = archive_write_close(a) == ARCHIVE_OK && ok;
  if (!ok && error->empty())
    *error = std::string("cannot write the payload: ") + archive_error_string(a);
  archive_write_free(a);
  return ok;
}

std::string FileDigest(const std::string& path) {
  Sha256 sha;
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  std::vector<char> buf(1 << 20);
  for (ssize_t n; fd >= 0 && (n = read(fd, buf.data(), buf.size())) > 0;) sha.Update(buf.data(), n);
  if (fd >= 0) close(fd);
  return sha.FinishHex();
}

// The package's members other than the payload, by name, read from `source`.
bool CollectMembers(const std::string& source, std::map<std::string, std::string>* members,
                    std::string* error) {
  std::vector<std::string> paths;
  ListTree(source, "", &paths);
  for (const std::string& path : paths) {
    struct stat st;
    lstat((source + "/" + path).c_str(), &st);
    if (path == "package" || path.compare(0, 8, "package/") == 0 || S_ISDIR(st.st_mode)) continue;
    if (!PMSIsPackageMemberName(path))
      return Fail(error, "unexpected file in the package source: " + path);
    std::string data;
    if (!KIVOReadFile(source + "/" + path, &data)) return Fail(error, "cannot read " + path);
    (*members)[path] = data;
  }
  if (!members->count("INFO")) return Fail(error, "the package source has no INFO file");
  std::string problem = PMSCheckInfo(KIVOKeyValueParse((*members)["INFO"]));
  if (!problem.empty()) return Fail(error, "INFO: " + problem);
  for (const auto& m : *members) {
    Json::Value ui;
    if (m.first.compare(0, 15, "WIZARD_UIFILES/") == 0 && !WebAPIUtil::ParseJson(m.second, ui)) {
      return Fail(error, m.first + " is not valid JSON");
    }
  }
  return true;
}

bool AddMember(struct archive* a, const std::string& name, const std::string& data) {
  struct archive_entry* entry = archive_entry_new();
  archive_entry_set_pathname(entry, name.c_str());
  archive_entry_set_filetype(entry, AE_IFREG);
  archive_entry_set_perm(entry, name.compare(0, 8, "scripts/") == 0 ? 0755 : 0644);
  archive_entry_set_size(entry, static_cast<la_int64_t>(data.size()));
  bool ok = archive_write_header(a, entry) == ARCHIVE_OK &&
            (data.empty() || archive_write_data(a, data.data(), data.size()) ==
                                 static_cast<la_ssize_t>(data.size()));
  archive_entry_free(entry);
  return ok;
}

bool AddPayloadMember(struct archive* a, const std::string& payload_path) {
  struct stat st;
  int fd = open(payload_path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0 || fstat(fd, &st) != 0) return false;
  struct archive_entry* entry = archive_entry_new();
  archive_entry_set_pathname(entry, "package.tgz");
  archive_entry_set_filetype(entry, AE_IFREG);
  archive_entry_set_perm(entry, 0644);
  archive_entry_set_size(entry, st.st_size);
  bool ok = archive_write_header(a, entry) == ARCHIVE_OK && CopyInto(a, fd, nullptr);
  archive_entry_free(entry);
  close(fd);
  return ok;
}

// Writes the outer archive: INFO, MANIFEST, signature.asc, the other
// members, package.tgz last. Written beside `output` and renamed into place.
bool WriteOuter(const std::string& output, const std::map<std::string, std::string>& members,
                const std::string& manifest, const std::string& signature,
                const std::string& payload_path, std::string* error) {
  std::string tmp = output + ".part";
  struct archive* a = archive_write_new();
  archive_write_set_format_pax_restricted(a);
  bool ok = archive_write_open_filename(a, tmp.c_str()) == ARCHIVE_OK &&
            AddMember(a, "INFO", members.at("INFO")) && AddMember(a, "MANIFEST", manifest) &&
            (signature.empty() || AddMember(a, "signature.asc", signature));
  for (auto it = members.begin(); ok && it != members.end(); ++it) {
    if (it->first != "INFO") ok = AddMember(a, it->first, it->second);
  }
  ok = ok && AddPayloadMember(a, payload_path) && archive_write_close(a) == ARCHIVE_OK;
  if (!ok) *error = std::string("cannot write ") + output + ": " + archive_error_string(a);
  archive_write_free(a);
  if (ok && rename(tmp.c_str(), output.c_str()) != 0) ok = Fail(error, "cannot rename " + tmp);
  if (!ok) unlink(tmp.c_str());
  return ok;
}

std::string MakeManifest(const std::map<std::string, std::string>& members,
                         const std::string& payload_digest) {
  std::string manifest = "KIVO-MANIFEST 1\n";
  for (const auto& m : members)
    manifest += "sha256 " + PMSSha256Hex(m.second) + " " + m.first + "\n";
  return manifest + "sha256 " + payload_digest + " package.tgz\n";
}

// Pulls the raw payload of a package file out into `payload_path`.
bool ExtractRawPayload(const std::string& input, const std::string& payload_path) {
  struct archive* a = archive_read_new();
  archive_read_support_format_tar(a);
  bool ok = false;
  if (archive_read_open_filename(a, input.c_str(), 64 << 10) == ARCHIVE_OK) {
    struct archive_entry* entry;
    while (archive_read_next_header(a, &entry) == ARCHIVE_OK) {
      if (strcmp(archive_entry_pathname(entry), "package.tgz") != 0) continue;
      int fd = open(payload_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
      ok = fd >= 0 && archive_read_data_into_fd(a, fd) == ARCHIVE_OK;
      if (fd >= 0) close(fd);
      break;
    }
  }
  archive_read_free(a);
  return ok;
}

// Bytes of the regular files below `dir`.
uint64_t TreeBytes(const std::string& dir) {
  std::vector<std::string> paths;
  ListTree(dir, "", &paths);
  uint64_t total = 0;
  for (const std::string& path : paths) {
    struct stat st;
    if (lstat((dir + "/" + path).c_str(), &st) == 0 && S_ISREG(st.st_mode)) total += st.st_size;
  }
  return total;
}

}  // namespace

bool PMSBuildPackage(const std::string& source, const std::string& output,
                     const BuildOptions& options, std::string* error) {
  std::map<std::string, std::string> members;
  if (!CollectMembers(source, &members, error)) return false;
  struct stat st;
  if (stat((source + "/package").c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    return Fail(error, "the package source has no package/ folder (the payload)");
  }
  // The installer needs to know the room the payload takes unpacked.
  if (!KIVOKeyValueParse(members["INFO"]).count("extractsize")) {
    uint64_t kib = (TreeBytes(source + "/package") + 1023) / 1024;
    members["INFO"] += KIVOKeyValueLine("extractsize", std::to_string(kib)) + "\n";
  }
  std::string payload = output + ".payload";
  bool ok = WritePayload(source + "/package", payload, options.compression_level, error) &&
            PMSWritePackage(members, payload, "", output, error);
  unlink(payload.c_str());
  return ok;
}

bool PMSWritePackage(const std::map<std::string, std::string>& members,
                     const std::string& payload_path, const std::string& signature,
                     const std::string& output, std::string* error) {
  if (!members.count("INFO")) return Fail(error, "no INFO member");
  return WriteOuter(output, members, MakeManifest(members, FileDigest(payload_path)), signature,
                    payload_path, error);
}

bool PMSAttachSignature(const std::string& input, const std::string& output,
                        const std::string& signature, std::string* error) {
  PackageFileReader reader;
  if (reader.Open(input, error) != 0) return false;
  std::string payload = output + ".payload";
  bool ok = ExtractRawPayload(input, payload) || Fail(error, "cannot read the payload of " + input);
  ok = ok && WriteOuter(output, reader.header().members, reader.header().manifest, signature,
                        payload, error);
  unlink(payload.c_str());
  return ok;
}

bool PMSSignPackage(const std::string& input, const std::string& output,
                    const std::string& gnupg_home, const std::string& key, std::string* error) {
  PackageFileReader reader;
  if (reader.Open(input, error) != 0) return false;
  std::string signature;
  return PMSSignData(gnupg_home, key, reader.header().manifest, &signature, error) &&
         PMSAttachSignature(input, output, signature, error);
}
