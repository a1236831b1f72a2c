#include "multipart_source.h"

#include <cstring>
#include <ctime>
#include <dirent.h>
#include <errno.h>
#include <exception>
#include <fcntl.h>
#include <istream>
#include <memory>
#include <streambuf>
#include <string>
#include <sys/stat.h>
#include <unistd.h>
#include <vector>

#include <Poco/Net/MessageHeader.h>
#include <Poco/Net/MultipartReader.h>
#include <Poco/Net/NameValueCollection.h>

#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"
#include "storage/storage_config.h"

namespace {

constexpr time_t kAbandonedAfterSeconds = 24 * 3600;

// Reads at most `limit` bytes from a descriptor, so a body shorter than its
// CONTENT_LENGTH shows as an early end and nothing after the body is read.
class FdStreamBuf : public std::streambuf {
 public:
  FdStreamBuf(int fd, uint64_t limit) : fd_(fd), left_(limit), buf_(1 << 20) {}
  // The body ended before its announced length.
  bool ended_early() const { return ended_early_; }

 protected:
  int_type underflow() override {
    if (gptr() < egptr()) return traits_type::to_int_type(*gptr());
    if (left_ == 0) return traits_type::eof();
    size_t want = left_ < buf_.size() ? static_cast<size_t>(left_) : buf_.size();
    ssize_t n;
    do {
      n = read(fd_, buf_.data(), want);
    } while (n < 0 && errno == EINTR);
    if (n <= 0) {
      ended_early_ = true;
      return traits_type::eof();
    }
    left_ -= static_cast<uint64_t>(n);
    setg(buf_.data(), buf_.data(), buf_.data() + n);
    return traits_type::to_int_type(*gptr());
  }

 private:
  int fd_;
  uint64_t left_;
  std::vector<char> buf_;
  bool ended_early_ = false;
};

class MultipartSource : public UploadSource {
 public:
  MultipartSource(int fd, uint64_t length, const std::string& boundary)
      : length_(length), buf_(fd, length), in_(&buf_), reader_(in_, boundary) {}

  int ReadFields(Json::Value& fields) override {
    try {
      ReadUntilFile();
      CopySeen(fields);
      return UPLOAD_OK;
    } catch (const std::exception&) {
      return UPLOAD_FAILED;
    }
  }

  int StoreFile(Json::Value& fields) override {
    std::string path;
    try {
      ReadUntilFile();
      if (!file_next_) return UPLOAD_NO_FILE;
      int code = OpenTarget(&path);
      if (code != UPLOAD_OK) return code;
      file_next_ = false;
      code = CopyPart(path);
      if (code != UPLOAD_OK) {
        unlink(path.c_str());
        return code;
      }
      seen_["file_tmp"] = path;
      seen_["file_name"] = file_name_;
      ReadUntilFile();  // the fields after the file
      CopySeen(fields);
      return UPLOAD_OK;
    } catch (const std::exception&) {
      if (!path.empty()) unlink(path.c_str());
      return UPLOAD_FAILED;
    }
  }

 private:
  // Every field read so far goes to `fields`: the host reads the fields
  // before the file first, and a handler asks for them again.
  void CopySeen(Json::Value& fields) {
    for (const std::string& name : seen_.getMemberNames()) fields[name] = seen_[name];
  }

  // Reads parts into seen_ until a file part is next (or the body ends).
  void ReadUntilFile() {
    while (!file_next_ && reader_.hasNextPart()) {
      Poco::Net::MessageHeader header;
      reader_.nextPart(header);
      std::string disposition;
      Poco::Net::NameValueCollection params;
      Poco::Net::MessageHeader::splitParameters(header.get("Content-Disposition", ""), disposition,
                                                params);
      if (params.has("filename")) {
        file_next_ = true;
        file_field_ = params.get("name", "file");
        file_name_ = params.get("filename", "");
        return;
      }
      std::string value;
      std::istream& part = reader_.stream();
      char buf[4096];
      while (part.read(buf, sizeof(buf)) || part.gcount() > 0) {
        if (value.size() + static_cast<size_t>(part.gcount()) > (1u << 20)) {
          throw std::runtime_error("a form field larger than 1 MiB");
        }
        value.append(buf, static_cast<size_t>(part.gcount()));
      }
      seen_[params.get("name", "")] = value;
    }
  }

  // A new file on the first volume with room for the whole body.
  int OpenTarget(std::string* path) {
    std::vector<VolumeConfig> volumes = KIVOVolumesLoad();
    bool any_usable = false;
    for (const VolumeConfig& v : volumes) {
      if (!v.usable()) continue;
      any_usable = true;
      int64_t free_bytes = KIVOVolumeFreeBytes(v);
      if (free_bytes < 0 || static_cast<uint64_t>(free_bytes) <= length_) continue;
      std::string dir = KIVORootPath(v.path + "/@tmp/upload");
      if (KIVOFSMkdirP(dir.c_str(), 0700) != 0) return UPLOAD_NO_TMP_DIR;
      // Uploads whose install never came: after a day nobody will ask for
      // them any more, so they are swept here and cannot fill the volume.
      KIVORemoveFilesOlderThan(dir, "upload-", kAbandonedAfterSeconds);
      std::string pattern = dir + "/upload-XXXXXX";
      int fd = mkostemp(&pattern[0], O_CLOEXEC);
      if (fd < 0) return UPLOAD_NO_TMP_DIR;
      close(fd);
      *path = pattern;
      return UPLOAD_OK;
    }
    return any_usable ? UPLOAD_TOO_LARGE : UPLOAD_NO_VOLUME;
  }

  int CopyPart(const std::string& path) {
    int fd = open(path.c_str(), O_WRONLY | O_TRUNC | O_CLOEXEC);
    if (fd < 0) return UPLOAD_NO_TMP_DIR;
    std::istream& part = reader_.stream();
    std::vector<char> buf(1 << 20);
    int code = UPLOAD_OK;
    while (code == UPLOAD_OK && (part.read(buf.data(), buf.size()) || part.gcount() > 0)) {
      const char* p = buf.data();
      size_t left = static_cast<size_t>(part.gcount());
      while (left > 0) {
        ssize_t n = write(fd, p, left);
        if (n < 0 && errno == EINTR) continue;
        if (n <= 0) {
          code = errno == ENOSPC || errno == EDQUOT ? UPLOAD_NO_SPACE : UPLOAD_FAILED;
          break;
        }
        p += n;
        left -= static_cast<size_t>(n);
      }
    }
    if (close(fd) != 0 && code == UPLOAD_OK) code = UPLOAD_NO_SPACE;
    // A file part cut short (the body ended early) is not an upload.
    if (code == UPLOAD_OK && buf_.ended_early()) code = UPLOAD_FAILED;
    return code;
  }

  uint64_t length_;
  FdStreamBuf buf_;
  std::istream in_;
  Poco::Net::MultipartReader reader_;
  Json::Value seen_{Json::objectValue};
  bool file_next_ = false;
  std::string file_field_;
  std::string file_name_;
};

}  // namespace

extern "C" UploadSource* KivoOpenMultipart(int fd, uint64_t length, const char* boundary) {
  if (fd < 0 || !boundary || !*boundary) return nullptr;
  try {
    return new MultipartSource(fd, length, boundary);
  } catch (const std::exception&) {
    return nullptr;
  }
}
