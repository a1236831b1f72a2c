#include "pkgtool/package_file.h"

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <errno.h>
#include <set>
#include <sstream>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include <archive.h>
#include <archive_entry.h>

#include "pkgtool/package_info.h"
#include "pkgtool/registry.h"
#include "pkgtool/release_notes.h"
#include "pkgtool/result_codes.h"
#include "pkgtool/sha256.h"
#include "pkgtool/tree_writer.h"

namespace {

constexpr int kFormatVersion = 1;
constexpr size_t kMaxInfoBytes = 64 << 10;
constexpr int64_t kMaxMemberBytes = 8 << 20;
constexpr size_t kMaxHeaderBytes = 32 << 20;
constexpr uint64_t kBlockBytes = 4096;
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
    // A second digest for one name would let two different members pass.
    if (!digests->emplace(name, hex).second) {
      return Fail(error, PKG_ERR_HOSTILE_MEMBER, "MANIFEST lists " + name + " twice");
    }
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

// INFO's extractsize in bytes. It is required: without a declaration there
// is nothing to hold the payload to. Checked as text by PMSCheckInfo.
bool DeclaredExtractBytes(const KeyValueMap& info, uint64_t* bytes) {
  auto it = info.find("extractsize");
  if (it == info.end() || it->second.empty()) return false;
  *bytes = std::strtoull(it->second.c_str(), nullptr, 10) * 1024;
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
    double fraction = src->total ? std::min(1.0, static_cast<double>(src->done) / src->total) : 1.0;
    if (*src->progress && fraction - src->reported >= 0.01) {
      src->reported = fraction;
      (*src->progress)(fraction);
    }
  }
  *block = src->buffer.data();
  return n;
}

// Checks one payload entry's kind and mode; returns PKG_OK or 277.
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
  if (type == AE_IFREG && archive_entry_size(entry) < 0) {
    return Fail(error, PKG_ERR_HOSTILE_MEMBER, "file of negative size in the payload: " + path);
  }
  if (type == AE_IFLNK) {
    const char* target = archive_entry_symlink(entry);
    if (!target || !PMSSymlinkStaysInside(path, target)) {
      return Fail(error, PKG_ERR_HOSTILE_MEMBER, "symlink that leaves the package: " + path);
    }
  }
  return PKG_OK;
}

int WriteErrorCode(int err) {
  return err == ENOSPC || err == EDQUOT ? PKG_ERR_NO_SPACE : PKG_ERR_EXTRACT;
}

// Copies the current entry's data into `fd`, honouring sparse offsets but
// never writing past the size the entry declared (and was counted with).
int CopyData(struct archive* in, int fd, const std::string& path, uint64_t declared,
             std::string* error) {
  const void* block;
  size_t size;
  la_int64_t offset;
  int r;
  while ((r = archive_read_data_block(in, &block, &size, &offset)) == ARCHIVE_OK) {
    if (offset < 0 || static_cast<uint64_t>(offset) > declared ||
        size > declared - static_cast<uint64_t>(offset)) {
      return Fail(error, PKG_ERR_HOSTILE_MEMBER, "data beyond the declared size of " + path);
    }
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
    return Fail(error, PKG_ERR_EXTRACT, "payload damaged at " + path + ": " + PMSArchiveError(in));
  }
  return PKG_OK;
}

int ExtractFile(struct archive* in, struct archive_entry* entry, const std::string& path,
                TreeWriter* writer, std::string* error) {
  int fd = -1;
  int err = writer->CreateFile(path, archive_entry_perm(entry) | 0600, &fd);
  if (err != 0)
    return Fail(error, WriteErrorCode(err), "cannot create " + path + ": " + strerror(err));
  int code = CopyData(in, fd, path, static_cast<uint64_t>(archive_entry_size(entry)), error);
  if (close(fd) != 0 && code == PKG_OK)
    code = Fail(error, WriteErrorCode(errno), "cannot write " + path + ": " + strerror(errno));
  return code;
}

int ExtractEntry(struct archive* in, struct archive_entry* entry, const std::string& path,
                 TreeWriter* writer, std::string* error) {
  mode_t type = archive_entry_filetype(entry);
  if (type == AE_IFREG) return ExtractFile(in, entry, path, writer, error);
  // Folders stay enterable and writable for the owner: the files that
  // follow are written into them.
  int err = type == AE_IFDIR ? writer->MakeDirectory(path, archive_entry_perm(entry) | 0700)
                             : writer->MakeSymlink(path, archive_entry_symlink(entry));
  if (err != 0)
    return Fail(error, WriteErrorCode(err), "cannot create " + path + ": " + strerror(err));
  return PKG_OK;
}

// The payload's entries as they stream by: each checked, each path taken
// once, all of them counted against the room INFO declared before any of
// their data is read, and with a writer, written out.
class PayloadWalker {
 public:
  PayloadWalker(TreeWriter* writer, uint64_t limit) : writer_(writer), limit_(limit) {}

  int Walk(struct archive* in, std::string* error) {
    struct archive_entry* entry;
    int r;
    while ((r = archive_read_next_header(in, &entry)) == ARCHIVE_OK) {
      int code = Visit(in, entry, error);
      if (code != PKG_OK) return code;
    }
    if (r != ARCHIVE_EOF)
      return Fail(error, PKG_ERR_EXTRACT, "payload damaged: " + PMSArchiveError(in));
    return PKG_OK;
  }

 private:
  int Visit(struct archive* in, struct archive_entry* entry, std::string* error) {
    std::string path;
    const char* raw = archive_entry_pathname(entry);
    if (!raw || !NormalizeEntryPath(raw, &path)) {
      return Fail(error, PKG_ERR_HOSTILE_MEMBER,
                  std::string("payload path escapes the package: ") + (raw ? raw : ""));
    }
    if (path.empty()) return PKG_OK;
    int code = CheckEntry(entry, path, error);
    if (code != PKG_OK) return code;
    if (!seen_.insert(path).second)
      return Fail(error, PKG_ERR_HOSTILE_MEMBER, "the payload holds " + path + " twice");
    bool regular = archive_entry_filetype(entry) == AE_IFREG;
    uint64_t room = PMSPayloadEntryBytes(regular, regular ? archive_entry_size(entry) : 0);
    if (room > limit_ - used_) {
      return Fail(error, PKG_ERR_HOSTILE_MEMBER,
                  "the payload takes more room unpacked than its extractsize of " +
                      std::to_string(limit_ / 1024) + " KiB declares (at " + path + ")");
    }
    used_ += room;
    return writer_ ? ExtractEntry(in, entry, path, writer_, error) : PKG_OK;
  }

  TreeWriter* writer_;
  const uint64_t limit_;
  uint64_t used_ = 0;
  std::set<std::string> seen_;
};

// The package file must end with the payload: a member after it would be
// one no check has seen (a second INFO, a second payload).
int CheckNothingFollows(struct archive* outer, std::string* error) {
  struct archive_entry* entry;
  int r = archive_read_next_header(outer, &entry);
  if (r == ARCHIVE_EOF) return PKG_OK;
  if (r == ARCHIVE_OK || r == ARCHIVE_WARN) {
    const char* name = archive_entry_pathname(entry);
    return Fail(error, PKG_ERR_HOSTILE_MEMBER,
                std::string("a member follows package.tgz: ") + (name ? name : ""));
  }
  return Fail(error, PKG_ERR_NOT_PACKAGE_FILE,
              "damaged archive after package.tgz: " + PMSArchiveError(outer));
}

}  // namespace

std::string PMSArchiveError(struct archive* a) {
  const char* text = a ? archive_error_string(a) : nullptr;
  if (text && *text) return text;
  int err = a ? archive_errno(a) : 0;
  return err > 0 ? strerror(err) : "the archive ends early or is damaged";
}

uint64_t PMSPayloadEntryBytes(bool regular_file, uint64_t size) {
  if (!regular_file || size == 0) return kBlockBytes;
  // Rounded up without overflowing near UINT64_MAX.
  return (size / kBlockBytes + (size % kBlockBytes != 0)) * kBlockBytes;
}

std::string PMSSha256Hex(const std::string& data) {
  Sha256 sha;
  sha.Update(data.data(), data.size());
  return sha.FinishHex();
}

bool PMSIsPackageMemberName(const std::string& name) {
  static const char* const kFixed[] = {"INFO",
                                       "MANIFEST",
                                       "signature.asc",
                                       "LICENSE",
                                       "PACKAGE_ICON.PNG",
                                       "PACKAGE_ICON_256.PNG",
                                       kPMSReleaseNotesMember};
  for (const char* f : kFixed) {
    if (name == f) return true;
  }
  // Screenshots SCREENSHOT_1.PNG to SCREENSHOT_8.PNG, shown by the package
  // center beside the description.
  if (name.size() == 16 && name.compare(0, 11, "SCREENSHOT_") == 0 && name[11] >= '1' &&
      name[11] <= '8' && name.compare(12, 4, ".PNG") == 0) {
    return true;
  }
  static const char* const kScripts[] = {"preinst",           "postinst",   "preuninst",
                                         "postuninst",        "preupgrade", "postupgrade",
                                         "start-stop-status", "health"};
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
  // INFO's own, smaller limit is applied after the digests, so that an INFO
  // changed after signing is a bad signature like any other member.
  if (size < 0 || size > kMaxMemberBytes) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE,
                name + " is larger than " + std::to_string(kMaxMemberBytes >> 10) + " KiB");
  }
  std::string data(static_cast<size_t>(size), '\0');
  if (size > 0 && archive_read_data(outer_, &data[0], data.size()) != size) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE,
                "cannot read " + name + ": " + PMSArchiveError(outer_));
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

int PackageFileReader::ReadHeaderMembers(std::string* error) {
  std::set<std::string> seen;
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
    // Two members of one name: whichever a reader keeps, the other is one
    // nobody checked.
    if (!seen.insert(name).second)
      return Fail(error, PKG_ERR_HOSTILE_MEMBER, "the package holds " + name + " twice");
    if (name == kPayload) {
      header_.payload_size = static_cast<uint64_t>(std::max<int64_t>(0, archive_entry_size(entry)));
      at_payload_ = true;
      return PKG_OK;
    }
    if (!PMSIsPackageMemberName(name)) {
      return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "unexpected member: " + name);
    }
    int code = ReadMember(name, archive_entry_size(entry), error);
    if (code != PKG_OK) return code;
  }
  if (r != ARCHIVE_EOF) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "damaged archive: " + PMSArchiveError(outer_));
  }
  return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "no package.tgz member");
}

int PackageFileReader::VerifyManifest(std::string* error) const {
  for (const auto& m : header_.members) {
    std::string digest = PMSSha256Hex(m.second);
    if (digest.empty()) return Fail(error, PKG_ERR_INTERNAL, "cannot compute SHA-256");
    auto it = header_.digests.find(m.first);
    if (it == header_.digests.end() || it->second != digest) {
      return Fail(error, PKG_ERR_BAD_SIGNATURE, m.first + " does not match MANIFEST");
    }
  }
  if (header_.digests.size() != header_.members.size() + 1 || !header_.digests.count(kPayload)) {
    return Fail(error, PKG_ERR_BAD_SIGNATURE, "MANIFEST lists members the package does not hold");
  }
  return PKG_OK;
}

int PackageFileReader::ReadInfo(std::string* error) {
  auto info = header_.members.find("INFO");
  if (info == header_.members.end()) return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "no INFO member");
  if (info->second.size() > kMaxInfoBytes)
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "INFO is larger than 64 KiB");
  header_.info = KIVOKeyValueParse(info->second);
  // Every field that becomes a path, a name in the registry or a value in
  // a script's environment is judged here, before any caller uses it.
  std::string field;
  std::string problem = PMSCheckInfo(header_.info, &field);
  if (!problem.empty()) {
    return Fail(error, field == "package" ? PKG_ERR_BAD_ID : PKG_ERR_NOT_PACKAGE_FILE,
                "INFO: " + problem);
  }
  if (!DeclaredExtractBytes(header_.info, &header_.extract_limit)) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE,
                "INFO: extractsize: required, the KiB the payload takes unpacked");
  }
  return PKG_OK;
}

int PackageFileReader::Open(const std::string& path, std::string* error) {
  if (outer_) return Fail(error, PKG_ERR_INTERNAL, "package file opened twice");
  outer_ = archive_read_new();
  if (!outer_) return Fail(error, PKG_ERR_INTERNAL, "out of memory");
  archive_read_support_format_tar(outer_);
  if (archive_read_open_filename(outer_, path.c_str(), 64 << 10) != ARCHIVE_OK) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "cannot open: " + PMSArchiveError(outer_));
  }
  int code = ReadHeaderMembers(error);
  if (code != PKG_OK) return code;
  if (header_.manifest.empty()) return Fail(error, PKG_ERR_NOT_PACKAGE_FILE, "no MANIFEST member");
  if ((code = VerifyManifest(error)) != PKG_OK) {
    // Still describe the file whose members were changed after signing, so
    // that it is answered like any other bad signature (a warning with the
    // package's description, then a refused install). INFO keeps its rules:
    // one that breaks them is left empty.
    std::string ignored;
    if (code == PKG_ERR_BAD_SIGNATURE && ReadInfo(&ignored) != PKG_OK) header_.info.clear();
    if (code == PKG_ERR_BAD_SIGNATURE && CheckReleaseNotes(&ignored) != PKG_OK)
      header_.members.erase(kPMSReleaseNotesMember);
    at_payload_ = false;
    return code;
  }
  if ((code = ReadInfo(error)) != PKG_OK) return code;
  return CheckReleaseNotes(error);
}

int PackageFileReader::CheckReleaseNotes(std::string* error) const {
  auto notes = header_.members.find(kPMSReleaseNotesMember);
  const std::string problem =
      notes == header_.members.end() ? "" : PMSCheckReleaseNotes(notes->second);
  return problem.empty() ? PKG_OK : Fail(error, PKG_ERR_NOT_PACKAGE_FILE, problem);
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
  if (!in) return Fail(error, PKG_ERR_INTERNAL, "out of memory");
  archive_read_support_filter_gzip(in);
  archive_read_support_format_tar(in);
  int code = PKG_OK;
  if (archive_read_open(in, &src, nullptr, ReadPayloadBlock, nullptr) != ARCHIVE_OK) {
    code = Fail(error, PKG_ERR_EXTRACT, "payload is not a tar.gz: " + PMSArchiveError(in));
  } else {
    code = PayloadWalker(writer.get(), header_.extract_limit).Walk(in, error);
  }
  archive_read_free(in);
  // The digest covers every byte of package.tgz, also any after the tar's
  // end, and it decides first: a payload that is not the one MANIFEST names
  // has been tampered with, whatever else is wrong with it.
  const void* rest;
  while (ReadPayloadBlock(nullptr, &src, &rest) > 0) {
  }
  if (src.failed) {
    return Fail(error, PKG_ERR_NOT_PACKAGE_FILE,
                "the package file is truncated or damaged: " + PMSArchiveError(outer_));
  }
  std::string digest = sha.FinishHex();
  if (digest.empty()) return Fail(error, PKG_ERR_INTERNAL, "cannot compute SHA-256");
  if (digest != header_.digests[kPayload]) {
    return Fail(error, PKG_ERR_BAD_SIGNATURE, "package.tgz does not match MANIFEST");
  }
  if (code != PKG_OK) return code;
  if ((code = CheckNothingFollows(outer_, error)) != PKG_OK) return code;
  if (progress) progress(1.0);
  return PKG_OK;
}
