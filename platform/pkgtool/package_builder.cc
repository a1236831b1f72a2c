#include "pkgtool/package_builder.h"

#include <algorithm>
#include <cstring>
#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <functional>
#include <map>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include <archive.h>
#include <archive_entry.h>

#include "klibc/atomic_file.h"
#include "klibc/json_text.h"
#include "klibc/key_value_file.h"
#include "pkgtool/package_file.h"
#include "pkgtool/package_info.h"
#include "pkgtool/release_notes.h"
#include "pkgtool/result_codes.h"
#include "pkgtool/sha256.h"
#include "pkgtool/signature.h"

namespace {

bool Fail(std::string* error, const std::string& text) {
  *error = text;
  return false;
}

// Every path below `dir` (relative to `base`), folders before their files,
// in name order so that builds are reproducible. False with `*error` when a
// folder cannot be listed: a build that skipped it would miss files.
bool ListTree(const std::string& base, const std::string& rel, std::vector<std::string>* out,
              std::string* error) {
  std::string dir = rel.empty() ? base : base + "/" + rel;
  DIR* d = opendir(dir.c_str());
  if (!d) return Fail(error, "cannot read the folder " + dir + ": " + strerror(errno));
  std::vector<std::string> names;
  errno = 0;
  while (struct dirent* e = readdir(d)) {
    if (strcmp(e->d_name, ".") != 0 && strcmp(e->d_name, "..") != 0) names.push_back(e->d_name);
  }
  int err = errno;
  closedir(d);
  if (err != 0) return Fail(error, "cannot read the folder " + dir + ": " + strerror(err));
  std::sort(names.begin(), names.end());
  for (const std::string& name : names) {
    std::string path = rel.empty() ? name : rel + "/" + name;
    out->push_back(path);
    struct stat st;
    if (lstat((base + "/" + path).c_str(), &st) != 0)
      return Fail(error, "cannot read " + base + "/" + path + ": " + strerror(errno));
    if (S_ISDIR(st.st_mode) && !ListTree(base, path, out, error)) return false;
  }
  return true;
}

// Reads `fd` to its end in blocks, handing each to `consume`. False with
// `*error` on a read error (which is not the end of the file) or when
// `consume` refuses a block.
bool ReadAll(int fd, const std::string& what,
             const std::function<bool(const char*, size_t)>& consume, std::string* error) {
  std::vector<char> buf(1 << 20);
  for (;;) {
    ssize_t n = read(fd, buf.data(), buf.size());
    if (n < 0 && errno == EINTR) continue;
    if (n < 0) return Fail(error, "cannot read " + what + ": " + strerror(errno));
    if (n == 0) return true;
    if (!consume(buf.data(), static_cast<size_t>(n))) return false;
  }
}

// Writes the file open on `src_fd`, whose entry said `size` bytes, into the
// archive. A file that grew or shrank meanwhile fails the build: tar would
// pad or cut it silently.
bool CopyInto(struct archive* a, int src_fd, const std::string& what, int64_t size,
              std::string* error) {
  int64_t copied = 0;
  bool ok = ReadAll(
      src_fd, what,
      [&](const char* data, size_t n) {
        copied += static_cast<int64_t>(n);
        if (copied > size) return Fail(error, what + " changed while it was read");
        if (archive_write_data(a, data, n) == static_cast<la_ssize_t>(n)) return true;
        return Fail(error, "cannot write " + what + " into the archive: " + PMSArchiveError(a));
      },
      error);
  if (ok && copied != size) return Fail(error, what + " changed while it was read");
  return ok;
}

bool AddFileEntry(struct archive* a, struct archive_entry* entry, const std::string& full,
                  const struct stat& st, std::string* error) {
  int fd = open(full.c_str(), O_RDONLY | O_CLOEXEC | O_NOFOLLOW);
  if (fd < 0) return Fail(error, "cannot open " + full + ": " + strerror(errno));
  archive_entry_set_filetype(entry, AE_IFREG);
  archive_entry_set_size(entry, st.st_size);
  bool ok = archive_write_header(a, entry) == ARCHIVE_OK ||
            Fail(error, "cannot add " + full + ": " + PMSArchiveError(a));
  ok = ok && CopyInto(a, fd, full, st.st_size, error);
  close(fd);
  return ok;
}

bool AddSymlinkEntry(struct archive* a, struct archive_entry* entry, const std::string& full,
                     std::string* error) {
  char target[4096];
  ssize_t n = readlink(full.c_str(), target, sizeof(target) - 1);
  if (n < 0) return Fail(error, "cannot read the symlink " + full + ": " + strerror(errno));
  target[n] = '\0';
  archive_entry_set_filetype(entry, AE_IFLNK);
  archive_entry_set_symlink(entry, target);
  return archive_write_header(a, entry) == ARCHIVE_OK ||
         Fail(error, "cannot add " + full + ": " + PMSArchiveError(a));
}

bool AddPayloadEntry(struct archive* a, const std::string& base, const std::string& path,
                     std::string* error) {
  std::string full = base + "/" + path;
  struct stat st;
  if (lstat(full.c_str(), &st) != 0)
    return Fail(error, "cannot read " + full + ": " + strerror(errno));
  struct archive_entry* entry = archive_entry_new();
  archive_entry_set_pathname(entry, path.c_str());
  if (st.st_mode & (S_ISUID | S_ISGID))
    return Fail(error, "setuid or setgid file (never installed): package/" + path);
  archive_entry_set_perm(entry, st.st_mode & 01777);
  archive_entry_set_mtime(entry, st.st_mtime, 0);
  bool ok = false;
  if (S_ISDIR(st.st_mode)) {
    archive_entry_set_filetype(entry, AE_IFDIR);
    ok = archive_write_header(a, entry) == ARCHIVE_OK ||
         Fail(error, "cannot add " + full + ": " + PMSArchiveError(a));
  } else if (S_ISLNK(st.st_mode)) {
    ok = AddSymlinkEntry(a, entry, full, error);
  } else if (S_ISREG(st.st_mode)) {
    ok = AddFileEntry(a, entry, full, st, error);
  } else {
    ok = Fail(error, "not a file, folder or symlink: package/" + path);
  }
  archive_entry_free(entry);
  return ok;
}

bool WritePayload(const std::string& dir, const std::vector<std::string>& paths,
                  const std::string& out, int level, std::string* error) {
  struct archive* a = archive_write_new();
  if (!a) return Fail(error, "out of memory");
  archive_write_set_format_pax_restricted(a);
  archive_write_add_filter_gzip(a);
  archive_write_set_filter_option(a, "gzip", "compression-level", std::to_string(level).c_str());
  bool ok = archive_write_open_filename(a, out.c_str()) == ARCHIVE_OK ||
            Fail(error, "cannot write " + out + ": " + PMSArchiveError(a));
  for (size_t i = 0; ok && i < paths.size(); ++i) ok = AddPayloadEntry(a, dir, paths[i], error);
  if (ok && archive_write_close(a) != ARCHIVE_OK)
    ok = Fail(error, "cannot write the payload: " + PMSArchiveError(a));
  archive_write_free(a);
  return ok;
}

bool FileDigest(const std::string& path, std::string* hex, std::string* error) {
  int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return Fail(error, "cannot open " + path + ": " + strerror(errno));
  Sha256 sha;
  bool ok = ReadAll(
      fd, path,
      [&sha](const char* data, size_t n) {
        sha.Update(data, n);
        return true;
      },
      error);
  close(fd);
  if (!ok) return false;
  *hex = sha.FinishHex();
  return !hex->empty() || Fail(error, "cannot compute SHA-256 of " + path);
}

// The package's members other than the payload, by name, read from `source`.
bool CollectMembers(const std::string& source, std::map<std::string, std::string>* members,
                    std::string* error) {
  std::vector<std::string> paths;
  if (!ListTree(source, "", &paths, error)) return false;
  for (const std::string& path : paths) {
    struct stat st;
    if (lstat((source + "/" + path).c_str(), &st) != 0)
      return Fail(error, "cannot read " + path + ": " + strerror(errno));
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
  auto notes = members->find(kPMSReleaseNotesMember);
  problem = notes == members->end() ? "" : PMSCheckReleaseNotes(notes->second);
  if (!problem.empty()) return Fail(error, problem);
  for (const auto& m : *members) {
    Json::Value ui;
    if (m.first.compare(0, 15, "WIZARD_UIFILES/") == 0 && !KIVOParseJson(m.second, &ui)) {
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

bool AddPayloadMember(struct archive* a, const std::string& payload_path, std::string* error) {
  struct stat st;
  int fd = open(payload_path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return Fail(error, "cannot open " + payload_path + ": " + strerror(errno));
  struct archive_entry* entry = archive_entry_new();
  archive_entry_set_pathname(entry, "package.tgz");
  archive_entry_set_filetype(entry, AE_IFREG);
  archive_entry_set_perm(entry, 0644);
  bool ok = fstat(fd, &st) == 0 || Fail(error, "cannot read " + payload_path);
  if (ok) archive_entry_set_size(entry, st.st_size);
  ok = ok && (archive_write_header(a, entry) == ARCHIVE_OK ||
              Fail(error, "cannot write package.tgz: " + PMSArchiveError(a)));
  ok = ok && CopyInto(a, fd, payload_path, st.st_size, error);
  archive_entry_free(entry);
  close(fd);
  return ok;
}

// Writes the outer archive: INFO, MANIFEST, signature.asc, the other
// members, package.tgz last. Written beside `output` and renamed into place;
// on failure nothing is left.
bool WriteOuter(const std::string& output, const std::map<std::string, std::string>& members,
                const std::string& manifest, const std::string& signature,
                const std::string& payload_path, std::string* error) {
  std::string tmp = output + ".part";
  struct archive* a = archive_write_new();
  if (!a) return Fail(error, "out of memory");
  archive_write_set_format_pax_restricted(a);
  bool ok = archive_write_open_filename(a, tmp.c_str()) == ARCHIVE_OK &&
            AddMember(a, "INFO", members.at("INFO")) && AddMember(a, "MANIFEST", manifest) &&
            (signature.empty() || AddMember(a, "signature.asc", signature));
  for (auto it = members.begin(); ok && it != members.end(); ++it) {
    if (it->first != "INFO") ok = AddMember(a, it->first, it->second);
  }
  if (!ok) *error = "cannot write " + output + ": " + PMSArchiveError(a);
  ok = ok && AddPayloadMember(a, payload_path, error);
  if (ok && archive_write_close(a) != ARCHIVE_OK)
    ok = Fail(error, "cannot write " + output + ": " + PMSArchiveError(a));
  archive_write_free(a);
  if (ok && rename(tmp.c_str(), output.c_str()) != 0)
    ok = Fail(error, "cannot rename " + tmp + ": " + strerror(errno));
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
  if (!a) return false;
  archive_read_support_format_tar(a);
  bool ok = false;
  if (archive_read_open_filename(a, input.c_str(), 64 << 10) == ARCHIVE_OK) {
    struct archive_entry* entry;
    while (archive_read_next_header(a, &entry) == ARCHIVE_OK) {
      const char* name = archive_entry_pathname(entry);
      if (!name || strcmp(name, "package.tgz") != 0) continue;
      int fd = open(payload_path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);
      ok = fd >= 0 && archive_read_data_into_fd(a, fd) == ARCHIVE_OK;
      if (fd >= 0 && close(fd) != 0) ok = false;
      break;
    }
  }
  archive_read_free(a);
  return ok;
}

// The room the payload below `dir` takes unpacked, counted entry by entry
// as the package-file reader counts it against extractsize.
bool PayloadRoom(const std::string& dir, const std::vector<std::string>& paths, uint64_t* bytes,
                 std::string* error) {
  *bytes = 0;
  for (const std::string& path : paths) {
    struct stat st;
    if (lstat((dir + "/" + path).c_str(), &st) != 0)
      return Fail(error, "cannot read package/" + path + ": " + strerror(errno));
    bool regular = S_ISREG(st.st_mode);
    *bytes += PMSPayloadEntryBytes(regular, regular ? static_cast<uint64_t>(st.st_size) : 0);
  }
  return true;
}

// The payload's files, and INFO's extractsize when the author gave none.
bool ListPayload(const std::string& dir, std::map<std::string, std::string>* members,
                 std::vector<std::string>* paths, std::string* error) {
  struct stat st;
  if (stat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
    return Fail(error, "the package source has no package/ folder (the payload)");
  }
  uint64_t room = 0;
  if (!ListTree(dir, "", paths, error) || !PayloadRoom(dir, *paths, &room, error)) return false;
  // The installer reserves this room and holds the payload to it.
  if (!KIVOKeyValueParse((*members)["INFO"]).count("extractsize")) {
    std::string kib = std::to_string((room + 1023) / 1024);
    (*members)["INFO"] += KIVOKeyValueLine("extractsize", kib) + "\n";
  }
  return true;
}

// Reads the built file back as an installer would: a build the reader
// refuses is a failed build, not a package.
bool VerifyBuilt(const std::string& output, std::string* error) {
  PackageFileReader reader;
  std::string problem;
  int code = reader.Open(output, &problem);
  if (code == PKG_OK)
    code = reader.ReadPayload(PackageFileReader::Payload::Check, "", nullptr, &problem);
  if (code == PKG_OK) return true;
  unlink(output.c_str());
  return Fail(error, "the built package would be refused: " + problem);
}

}  // namespace

bool PMSBuildPackage(const std::string& source, const std::string& output,
                     const BuildOptions& options, std::string* error) {
  std::map<std::string, std::string> members;
  std::vector<std::string> paths;
  if (!CollectMembers(source, &members, error) ||
      !ListPayload(source + "/package", &members, &paths, error)) {
    return false;
  }
  std::string payload = output + ".payload";
  bool ok = WritePayload(source + "/package", paths, payload, options.compression_level, error) &&
            PMSWritePackage(members, payload, "", output, error);
  unlink(payload.c_str());
  return ok && VerifyBuilt(output, error);
}

bool PMSWritePackage(const std::map<std::string, std::string>& members,
                     const std::string& payload_path, const std::string& signature,
                     const std::string& output, std::string* error) {
  if (!members.count("INFO")) return Fail(error, "no INFO member");
  std::string digest;
  return FileDigest(payload_path, &digest, error) &&
         WriteOuter(output, members, MakeManifest(members, digest), signature, payload_path, error);
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
