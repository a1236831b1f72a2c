#include "pkgtool/package_file.h"

#include <algorithm>
#include <cstring>
#include <errno.h>
#include <sstream>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include <archive.h>
#include <archive_entry.h>

#include "pkgtool/registry.h"
#include "pkgtool/result_codes.h"
#include "pkgtool/sha256.h"
#include "pkgtool/tree_writer.h"

namespace {

constexpr int kFormatVersion = 1;
constexpr int64_t kMaxInfoBytes = 64 << 10;
constexpr int64_t kMaxMemberBytes = 8 << 20;
constexpr size_t kMaxHeaderBytes = 32 << 20;
constexpr char kPayload[] = "package.tgz";

int Fail(std::string* error, int code, const std::string& text) {
  *error = text;
  return code;
}

// MANIFEST: a first line "KIVO-MANIFEST <format>", then "sha256 <hex> <name>".
int ParseManifest(const std::string& text, std::map<std::string, std::string>* digests,
                  std::string* error) {
  std::istringstream in(text);
  std::string line;
  int format = 0;
  if (!std::getline(in, line) || sscanf(line.c_str(), "KIVO-MANIFEST %d", &format) != 1) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "MANIFEST does not start with KIVO-MANIFEST");
  }
  if (format > kFormatVersion) {
    return Fail(error, PKG_ERR_FORMAT_VERSION,
                "package format " + std::to_string(format) + " is newer than this tool");
  }
  while (std::getline(in, line)) {
    std::istringstream fields(line);
    std::string algorithm, hex, name;
    if (!(fields >> algorithm >> hex >> name) || algorithm != "sha256" || hex.size() != 64) {
      return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "MANIFEST line not understood: " + line);
    }
    (*digests)[name] = hex;
  }
  return PKG_OK;
}

// "./a/b" -> "a/b". False for paths that are absolute, empty or climb.
bool NormalizeEntryPath(const std::string& raw, std::string* out) {
  std::string path = raw;
  while (path.compare(0, 2, "./") == 0) path.erase(0, 2);
  while (!path.empty() && path.back() == '/') path.pop_back();
  if (path.empty() || path == ".") {
    out->clear();
    return true;  // the root itself
  }
  if (path.find('\0') != std::string::npos) return false;
  *out = path;
  return PMSIsContainedRelativePath(path);
}

// A symlink at `path` pointing at `target` stays inside the tree when the
// target is relative and never climbs above the root on its way.
bool SymlinkStaysInside(const std::string& path, const std::string& target) {
  if (target.empty() || target[0] == '/') return false;
  int depth = static_cast<int>(std::count(path.begin(), path.end(), '/'));
  std::istringstream in(target);
  for (std::string part; std::getline(in, part, '/');) {
    if (part == "..") {
      if (--depth < 0) return false;
    } else if (!part.empty() && part != ".") {
      ++depth;
    }
  }
  return true;
}

// Feeds package.tgz from the outer archive to the inner one, hashing it.
struct PayloadSource {
  struct archive* outer = nullptr;
  Sha256* sha = nullptr;
  uint64_t total = 0;
  uint64_t done = 0;
  std::vector<char> buffer = std::vector<char>(256 << 10);
  const std::function<void(double)>* progress = nullptr;
  double reported = 0;
  bool failed = false;  // the package file itself ended early or could not be read
};

la_ssize_t ReadPayloadBlock(struct archive*, void* data, const void** block) {
  auto* src = static_cast<PayloadSource*>(data);
  la_ssize_t n = archive_read_data(src->outer, src->buffer.data(), src->buffer.size());
  if (n < 0) src->failed = true;
  if (n > 0) {
    src->sha->Update(src->buffer.data(), static_cast<size_t>(n));
    src->done += static_cast<uint64_t>(n);
    double fraction = src->total ? static_cast<double>(src->done) / src->total : 1.0;
    if (*src->progress && fraction - src->reported >= 0.01) {
      src->reported = fraction;
      (*src->progress)(fraction);
    }
  }
  *block = src->buffer.data();
  return n;
}

// Checks one payload entry; returns PKG_OK or 277 with the reason.
int CheckEntry(struct archive_entry* entry, const std::string& path, std::string* error) {
  mode_t type = archive_entry_filetype(entry);
  mode_t mode = archive_entry_perm(entry);
  if (archive_entry_hardlink(entry)) {
    return Fail(error, PKG_ERR_HOSTILE_MEMBER, "hard link in the payload: " + path);
  }
  if (type != AE_IFREG && type != AE_IFDIR && type != AE_IFLNK) {
    return Fail(error, PKG_ERR_HOSTILE_MEMBER,
                "device node, fifo or socket in the payload: " + path);
  }
  if (mode & (S_ISUID | S_ISGID)) {
    return Fail(error, PKG_ERR_HOSTILE_MEMBER, "setuid or setgid file in the payload: " + path);
  }
  if (type == AE_IFLNK) {
    const char* target = archive_entry_symlink(entry);
    if (!target || !SymlinkStaysInside(path, target)) {
      return Fail(error, PKG_ERR_HOSTILE_MEMBER, "symlink that leaves the package: " + path);
    }
  }
  return PKG_OK;
}

int WriteErrorCode(int err) {
  return err == ENOSPC || err == EDQUOT ? PKG_ERR_NO_SPACE : PKG_ERR_EXTRACT;
}

// Copies the current entry's data into `fd`, honouring sparse offsets.
int CopyData(struct archive* in, int fd, const std::string& path, std::string* error) {
  const void* block;
  size_t size;
  la_int64_t offset;
  int r;
  while ((r = archive_read_data_block(in, &block, &size, &offset)) == ARCHIVE_OK) {
    const char* p = static_cast<const char*>(block);
    while (size > 0) {
      ssize_t n = pwrite(fd, p, size, offset);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0)
        return Fail(error, WriteErrorCode(errno), "cannot write " + path + ": " + strerror(errno));
      p += n;
      size -= static_cast<size_t>(n);
      offset += n;
    }
  }
  if (r != ARCHIVE_EOF) {
    return Fail(error, PKG_ERR_EXTRACT,
                "payload damaged at " + path + ": " + archive_error_string(in));
  }
  return PKG_OK;
}

int ExtractEntry(struct archive* in, struct archive_entry* entry, const std::string& path,
                 TreeWriter* writer, std::string* error) {
  mode_t type = archive_entry_filetype(entry);
  mode_t mode = archive_entry_perm(entry);
  int err = 0;
  if (type == AE_IFDIR) {
    err = writer->MakeDirectory(path, mode | 0700);
  } else if (type == AE_IFLNK) {
    err = writer->MakeSymlink(path, archive_entry_symlink(entry));
  } else {
    int fd = -1;
    err = writer->CreateFile(path, mode | 0600, &fd);
    if (err == 0) {
      int code = CopyData(in, fd, path, error);
      if (close(fd) != 0 && code == PKG_OK)
        code = Fail(error, WriteErrorCode(errno), "cannot write " + path);
      return code;
    }
  }
  if (err != 0)
    return Fail(error, WriteErrorCode(err), "cannot create " + path + ": " + strerror(err));
  return PKG_OK;
}

}  // namespace

std::string PMSSha256Hex(const std::string& data) {
  Sha256 sha;
  sha.Update(data.data(), data.size());
  return sha.FinishHex();
}

bool PMSIsPackageMemberName(const std::string& name) {
  static const char* const kFixed[] = {"INFO",    "MANIFEST",         "signature.asc",
                                       "LICENSE", "PACKAGE_ICON.PNG", "PACKAGE_ICON_256.PNG"};
  for (const char* f : kFixed) {
    if (name == f) return true;
  }
  static const char* const kScripts[] = {"preinst",          "postinst",   "preuninst",
                                         "postuninst",       "preupgrade", "postupgrade",
                                         "start-stop-status"};
  for (const char* s : kScripts) {
    if (name == std::string("scripts/") + s) return true;
  }
  for (const char* op : {"install", "upgrade", "uninstall"}) {
    std::string base = std::string("WIZARD_UIFILES/") + op + "_uifile";
    if (name == base) return true;
    if (name.compare(0, base.size() + 1, base + "_") == 0 && name.size() == base.size() + 4) {
      return true;  // a three-letter language: install_uifile_ger
    }
  }
  return false;
}

PackageFileReader::PackageFileReader() = default;

PackageFileReader::~PackageFileReader() {
  if (outer_) archive_read_free(outer_);
}

int PackageFileReader::ReadMember(const std::string& name, int64_t size, std::string* error) {
  int64_t limit = name == "INFO" ? kMaxInfoBytes : kMaxMemberBytes;
  if (size < 0 || size > limit) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE,
                name + " is larger than " + std::to_string(limit >> 10) + " KiB");
  }
  std::string data(static_cast<size_t>(size), '\0');
  if (size > 0 && archive_read_data(outer_, &data[0], data.size()) != size) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "cannot read " + name);
  }
  if (name == "MANIFEST") {
    header_.manifest = data;
    return ParseManifest(data, &header_.digests, error);
  }
  if (name == "signature.asc") {
    header_.signature = data;
    return PKG_OK;
  }
  size_t total = 0;
  for (const auto& m : header_.members) total += m.second.size();
  if (total + data.size() > kMaxHeaderBytes) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "the package's members are larger than 32 MiB");
  }
  header_.members[name] = std::move(data);
  return PKG_OK;
}

int PackageFileReader::Open(const std::string& path, std::string* error) {
  outer_ = archive_read_new();
  archive_read_support_format_tar(outer_);
  if (archive_read_open_filename(outer_, path.c_str(), 64 << 10) != ARCHIVE_OK) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE,
                std::string("cannot open: ") + archive_error_string(outer_));
  }
  struct archive_entry* entry;
  int r;
  while ((r = archive_read_next_header(outer_, &entry)) == ARCHIVE_OK) {
    std::string name;
    const char* raw = archive_entry_pathname(entry);
    if (!raw || !NormalizeEntryPath(raw, &name)) {
      return Fail(error, PKG_ERR_HOSTILE_MEMBER,
                  std::string("member escapes the package: ") + (raw ? raw : ""));
    }
    mode_t type = archive_entry_filetype(entry);
    if (type == AE_IFDIR && (name == "scripts" || name == "WIZARD_UIFILES")) continue;
    if (type != AE_IFREG || archive_entry_hardlink(entry)) {
      return Fail(error, PKG_ERR_HOSTILE_MEMBER, "member is not a plain file: " + name);
    }
    if (name == kPayload) {
      header_.payload_size = static_cast<uint64_t>(archive_entry_size(entry));
      at_payload_ = true;
      break;
    }
    if (!PMSIsPackageMemberName(name)) {
      return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "unexpected member: " + name);
    }
    int code = ReadMember(name, archive_entry_size(entry), error);
    if (code != PKG_OK) return code;
  }
  if (r != ARCHIVE_OK && r != ARCHIVE_EOF) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE,
                std::string("damaged archive: ") + archive_error_string(outer_));
  }
  if (!header_.members.count("INFO"))
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "no INFO member");
  if (header_.manifest.empty()) return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "no MANIFEST member");
  if (!at_payload_) return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "no package.tgz member");
  for (const auto& m : header_.members) {
    auto it = header_.digests.find(m.first);
    if (it == header_.digests.end() || it->second != PMSSha256Hex(m.second)) {
      return Fail(error, PKG_ERR_BAD_SIGNATURE, m.first + " does not match MANIFEST");
    }
  }
  if (header_.digests.size() != header_.members.size() + 1 || !header_.digests.count(kPayload)) {
    return Fail(error, PKG_ERR_BAD_SIGNATURE, "MANIFEST lists members the package does not hold");
  }
  header_.info = KIVOKeyValueParse(header_.members["INFO"]);
  return PKG_OK;
}

int PackageFileReader::ReadPayload(Payload mode, const std::string& dest,
                                   const std::function<void(double)>& progress,
                                   std::string* error) {
  if (!at_payload_) return Fail(error, PKG_ERR_INTERNAL, "payload read before Open or twice");
  at_payload_ = false;
  Sha256 sha;
  PayloadSource src;
  src.outer = outer_;
  src.sha = &sha;
  src.total = header_.payload_size;
  src.progress = &progress;
  std::unique_ptr<TreeWriter> writer;
  if (mode == Payload::Extract) {
    writer.reset(new TreeWriter(dest));
    if (!writer->ok()) return Fail(error, PKG_ERR_EXTRACT, "cannot open " + dest);
  }
  struct archive* in = archive_read_new();
  archive_read_support_filter_gzip(in);
  archive_read_support_format_tar(in);
  int code = PKG_OK;
  if (archive_read_open(in, &src, nullptr, ReadPayloadBlock, nullptr) != ARCHIVE_OK) {
    code = Fail(error, PKG_ERR_EXTRACT,
                std::string("payload is not a tar.gz: ") + archive_error_string(in));
  }
  struct archive_entry* entry;
  int r = ARCHIVE_OK;
  while (code == PKG_OK && (r = archive_read_next_header(in, &entry)) == ARCHIVE_OK) {
    std::string path;
    const char* raw = archive_entry_pathname(entry);
    if (!raw || !NormalizeEntryPath(raw, &path)) {
      code = Fail(error, PKG_ERR_HOSTILE_MEMBER,
                  std::string("payload path escapes the package: ") + (raw ? raw : ""));
      break;
    }
    if (path.empty()) continue;
    code = CheckEntry(entry, path, error);
    if (code == PKG_OK && writer) code = ExtractEntry(in, entry, path, writer.get(), error);
  }
  if (code == PKG_OK && r != ARCHIVE_EOF) {
    code =
        Fail(error, PKG_ERR_EXTRACT, std::string("payload damaged: ") + archive_error_string(in));
  }
  archive_read_free(in);
  // The digest covers every byte of package.tgz, also any after the tar's
  // end, and it decides first: a payload that is not the one MANIFEST names
  // has been tampered with, whatever else is wrong with it.
  const void* rest;
  while (ReadPayloadBlock(nullptr, &src, &rest) > 0) {
  }
  if (src.failed)
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "the package file is truncated or damaged");
  if (sha.FinishHex() != header_.digests[kPayload]) {
    return Fail(error, PKG_ERR_BAD_SIGNATURE, "package.tgz does not match MANIFEST");
  }
  if (code != PKG_OK) return code;
  if (progress) progress(1.0);
  return PKG_OK;
}
