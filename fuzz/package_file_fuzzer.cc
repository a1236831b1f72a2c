// Fuzzes the package-file reader with whole package files: the header
// members and MANIFEST (Open), then the payload, extracted into a folder of
// its own that is emptied after every input.
//
// Contracts checked besides "no crash": every refusal carries a reason,
// progress stays within [0, 1], and nothing appears next to the target
// folder (an extraction that escapes it lands in the scratch folder around
// it, where it is seen).
#include <cstddef>
#include <cstdint>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include "fuzz_support.h"
#include "pkgtool/package_file.h"
#include "pkgtool/result_codes.h"

namespace {

struct Scratch {
  std::string around;  // holds nothing but `dest` between inputs
  std::string dest;
};

const Scratch& TheScratch() {
  static const Scratch scratch = [] {
    Scratch s;
    s.around = FuzzScratchFolder("package");
    s.dest = s.around + "/payload";
    return s;
  }();
  return scratch;
}

void ReadPayload(PackageFileReader* reader, const Scratch& scratch) {
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
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const Scratch& scratch = TheScratch();
  int fd = FuzzMemoryFile(data, size);
  {
    PackageFileReader reader;
    std::string error;
    int code = reader.Open(FuzzFdPath(fd), &error);
    FuzzRequire(code == PKG_OK || !error.empty(), "package file refused without a reason");
    if (code == PKG_OK) ReadPayload(&reader, scratch);
  }
  close(fd);
  return 0;
}
