// Fuzzes the host's streaming multipart reader: the input is the body of a
// request whose boundary is always "kivo-fuzz-boundary", read as entry.cgi
// reads it (the fields first, then the file part stored on a volume of a
// scratch system root).
//
// Contracts checked (webapi/api_upload.h): a stored file is where "file_tmp"
// says, on the volume; a failure leaves no file behind.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <string>
#include <sys/stat.h>
#include <unistd.h>

#include <json/value.h>

#include "fuzz_support.h"
#include "klibc/atomic_file.h"
#include "multipart/multipart_source.h"

namespace {

constexpr char kBoundary[] = "kivo-fuzz-boundary";

// A system root with one usable volume, made once per process; returns
// the volume's folder.
std::string Volume() {
  static const std::string volume = [] {
    std::string root = FuzzScratchFolder("multipart");
    setenv("KIVO_ROOT", root.c_str(), 1);
    FuzzRequire(KIVOFSMkdirP((root + "/etc/kivo").c_str()) == 0, "cannot make etc/kivo");
    FuzzRequire(KIVOFSMkdirP((root + "/volume1").c_str()) == 0, "cannot make volume1");
    FuzzRequire(
        KIVOWriteFileAtomic(root + "/etc/kivo/volumes.json",
                            R"([{"path": "/volume1", "status": "normal"}])", SyncToDisk::No),
        "cannot write volumes.json");
    return root + "/volume1";
  }();
  return volume;
}

void CheckStored(const Json::Value& fields, const std::string& volume) {
  FuzzRequire(fields["file_tmp"].isString() && fields["file_name"].isString(),
              "a stored file without file_tmp and file_name");
  std::string path = fields["file_tmp"].asString();
  FuzzRequire(path.compare(0, volume.size() + 1, volume + "/") == 0,
              "the stored file is not on the volume");
  struct stat st;
  FuzzRequire(lstat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode), "the stored file is missing");
  FuzzRequire(unlink(path.c_str()) == 0, "cannot remove the stored file");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  const std::string& volume = Volume();
  int fd = FuzzMemoryFile(data, size);
  // A memory file is always readable: the deadline never cuts it short.
  std::unique_ptr<UploadSource> source(KivoOpenMultipart(fd, size, kBoundary, INT64_MAX));
  FuzzRequire(source != nullptr, "the reader refused valid arguments");
  Json::Value fields(Json::objectValue);
  if (source->ReadFields(fields) == UPLOAD_OK) {
    if (source->StoreFile(fields) == UPLOAD_OK) CheckStored(fields, volume);
  }
  source.reset();
  close(fd);
  FuzzRequire(FuzzCountFiles(volume) == 0, "a failed upload left its file behind");
  return 0;
}
