// Fuzzes the package-file reader with whole package files: the header
// members and MANIFEST (Open), then the payload, extracted into a folder of
// its own that is emptied after every input.
//
// A hostile author writes MANIFEST for whatever members they ship, so an
// input whose members do not match their digests is also resealed: its
// members are read back and written again by the project's builder, which
// computes MANIFEST, and that file is read too. So mutated INFO files and
// payloads get past the digest check and reach the code behind it.
//
// Contracts checked besides "no crash": every refusal carries a reason,
// progress stays within [0, 1], and nothing appears next to the target
// folder (an extraction that escapes it lands in the scratch folder around
// it, where it is seen).
#include <cstddef>
#include <cstdint>
#include <map>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include <archive.h>
#include <archive_entry.h>

#include "fuzz_support.h"
#include "klibc/atomic_file.h"
#include "pkgtool/package_builder.h"
#include "pkgtool/package_file.h"
#include "pkgtool/result_codes.h"

namespace {

constexpr size_t kMaxResealBytes = 8 << 20;

struct Scratch {
  std::string around;  // holds nothing but `dest` between inputs
  std::string dest;
  std::string reseal;  // the resealed package file and its payload
};

const Scratch& TheScratch() {
  static const Scratch scratch = [] {
    Scratch s;
    s.around = FuzzScratchFolder("package");
    s.dest = s.around + "/payload";
    s.reseal = FuzzScratchFolder("reseal");
    return s;
  }();
  return scratch;
}

bool ReadEntryData(struct archive* a, int64_t size, std::string* data) {
  if (size < 0 || static_cast<size_t>(size) > kMaxResealBytes) return false;
  data->assign(static_cast<size_t>(size), '\0');
  return size == 0 || archive_read_data(a, &(*data)[0], data->size()) == size;
}

// Writes the members of the package file at `input` again, with a MANIFEST
// that matches them, to `output`. False when `input` is no tar archive with
// a payload.
bool Reseal(const std::string& input, const Scratch& scratch, const std::string& output) {
  std::map<std::string, std::string> members;
  std::string signature, payload;
  bool has_payload = false;
  struct archive* a = archive_read_new();
  archive_read_support_format_tar(a);
  bool ok = archive_read_open_filename(a, input.c_str(), 64 << 10) == ARCHIVE_OK;
  struct archive_entry* entry;
  while (ok && archive_read_next_header(a, &entry) == ARCHIVE_OK) {
    const char* raw = archive_entry_pathname(entry);
    std::string name = raw ? raw : "", data;
    if (archive_entry_filetype(entry) != AE_IFREG) continue;
    ok = ReadEntryData(a, archive_entry_size(entry), &data);
    if (name == "package.tgz") {
      payload = std::move(data);
      has_payload = true;
    } else if (name == "signature.asc") {
      signature = std::move(data);
    } else if (name != "MANIFEST") {
      members[name] = std::move(data);
    }
  }
  archive_read_free(a);
  if (!ok || !has_payload) return false;
  std::string payload_path = scratch.reseal + "/package.tgz", error;
  return KIVOWriteFileAtomic(payload_path, payload, SyncToDisk::No) &&
         PMSWritePackage(members, payload_path, signature, output, &error);
}

int ReadPayload(PackageFileReader* reader, const Scratch& scratch) {
  FuzzRequire(mkdir(scratch.dest.c_str(), 0700) == 0, "cannot make the payload folder");
  std::string error;
  double last = 0;
  auto progress = [&last](double fraction) {
    FuzzRequire(fraction >= last && fraction <= 1.0, "progress went back or past 1");
    last = fraction;
  };
  int code =
      reader->ReadPayload(PackageFileReader::Payload::Extract, scratch.dest, progress, &error);
  FuzzRequire(code == PKG_OK || !error.empty(), "payload refused without a reason");
  FuzzRequire(FuzzListFolder(scratch.around) == "payload", "the payload wrote outside its folder");
  FuzzRequire(FuzzRemoveTree(scratch.dest), "cannot remove the extracted payload");
  return code;
}

// Reads the package file at `path` as an install does; returns the result.
int ReadPackage(const std::string& path, const Scratch& scratch) {
  PackageFileReader reader;
  std::string error;
  int code = reader.Open(path, &error);
  FuzzRequire(code == PKG_OK || !error.empty(), "package file refused without a reason");
  return code == PKG_OK ? ReadPayload(&reader, scratch) : code;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const Scratch& scratch = TheScratch();
  int fd = FuzzMemoryFile(data, size);
  std::string input = FuzzFdPath(fd);
  if (ReadPackage(input, scratch) == PKG_ERR_BAD_SIGNATURE) {
    std::string resealed = scratch.reseal + "/resealed.kpk";
    if (Reseal(input, scratch, resealed)) ReadPackage(resealed, scratch);
  }
  close(fd);
  return 0;
}
