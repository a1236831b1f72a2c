#include "multipart_source.h"

#include <cstring>
#include <errno.h>
#include <exception>
#include <fcntl.h>
#include <istream>
#include <memory>
#include <stdexcept>
#include <streambuf>
#include <string>
#include <unistd.h>
#include <vector>

#include <Poco/Net/MessageHeader.h>
#include <Poco/Net/MultipartReader.h>
#include <Poco/Net/NameValueCollection.h>

#include "host/request_deadline.h"
#include "klibc/atomic_file.h"
#include "klibc/sysroot.h"
#include "webapi/host_fields.h"
#include "webapi/upload_area.h"

namespace {

// Reads at most `limit` bytes from a descriptor, so a body shorter than its
// CONTENT_LENGTH shows as an early end and nothing after the body is read.
// Bytes not there by `deadline_ms` are an early end too.
class FdStreamBuf : public std::streambuf {
 public:
  FdStreamBuf(int fd, uint64_t limit, int64_t deadline_ms)
      : fd_(fd), left_(limit), deadline_ms_(deadline_ms), buf_(1 << 20) {}
  // The body ended before its announced length.
  bool ended_early() const { return ended_early_; }

 protected:
  int_type underflow() override {
    if (gptr() < egptr()) return traits_type::to_int_type(*gptr());
    if (left_ == 0) return traits_type::eof();
    size_t want = left_ < buf_.size() ? static_cast<size_t>(left_) : buf_.size();
    ssize_t n = ReadBeforeDeadline(fd_, buf_.data(), want, deadline_ms_);
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
  int64_t deadline_ms_;
  std::vector<char> buf_;
  bool ended_early_ = false;
};

// Throws when `text` holds a NUL byte: every posted field becomes a request
// parameter, and no parameter of the web API may hold one (it would cut the
// value short wherever it becomes a C string).
void RefuseNul(const std::string& text, const char* what) {
  if (text.find('\0') != std::string::npos) {
    throw std::runtime_error(std::string("a NUL byte in ") + what);
  }
}

// The largest file part other than the package file ("file") that the host
// keeps: such parts are small documents (a key file), read whole by the
// handler, and never worth a volume's room.
constexpr size_t kSmallFileLimit = 4u << 20;

// The package file is the part named "file": it streams to a volume when the
// handler asks for it (StoreFile). Any other file part, named N, is small
// (kSmallFileLimit): it is stored at once in the root's tmp/ and handed over
// as the fields N (the file's name as sent) and N + "_tmp" (the stored path).
// Those files are removed when the source is deleted, at the end of the
// request, whatever its outcome; a handler may remove them sooner.
//
// The body holds the fields, at most one package file part and more fields,
// and ends with the closing boundary. A body cut short, one without the
// closing boundary (whose last part would run to the end of the body and
// take stray bytes with it) and one with a second file part of one name are
// refused, and nothing is stored for them.
class MultipartSource : public UploadSource {
 public:
  MultipartSource(int fd, uint64_t length, const std::string& boundary, int64_t deadline_ms)
      : length_(length), buf_(fd, length, deadline_ms), in_(&buf_), reader_(in_, boundary) {}
  ~MultipartSource() override {
    for (const std::string& path : small_files_) unlink(path.c_str());
  }
  MultipartSource(const MultipartSource&) = delete;
  MultipartSource& operator=(const MultipartSource&) = delete;

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
      int code = KIVOCreateUploadFile(length_, &path);
      if (code != UPLOAD_OK) return code;
      file_next_ = false;
      stored_ = true;
      code = CopyPart(path);
      if (code != UPLOAD_OK) {
        unlink(path.c_str());
        return code;
      }
      seen_["file_tmp"] = path;
      seen_["file_name"] = file_name_;
      ReadUntilFile();  // the fields after the file, up to the closing boundary
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

  // Whether the part read last ended with the closing boundary.
  bool Closed() {
    if (!started_) return false;
    auto* part = dynamic_cast<Poco::Net::MultipartIOS*>(&reader_.stream());
    return part && part->lastPart();
  }

  // Reads parts into seen_ until a file part is next or the closing boundary
  // has been read. Throws on a malformed body.
  void ReadUntilFile() {
    while (!file_next_ && !Closed()) {
      // A part that ran to the end of the body ended without a boundary.
      if (in_.rdbuf()->sgetc() == std::char_traits<char>::eof()) {
        throw std::runtime_error("the body ends without its closing boundary");
      }
      Poco::Net::MessageHeader header;
      reader_.nextPart(header);
      started_ = true;
      std::string disposition;
      Poco::Net::NameValueCollection params;
      Poco::Net::MessageHeader::splitParameters(header.get("Content-Disposition", ""), disposition,
                                                params);
      std::string name = params.get("name", "");
      RefuseNul(name, "a field name");
      // A name ending in "_tmp" names a stored file, and so do these two; a
      // client's field must never pass for one (the handler reads and
      // deletes that path).
      if (IsHostField(name)) {
        throw std::runtime_error("a field named like a stored file");
      }
      if (params.has("filename") && name != "file") {
        StoreSmallFile(name, params.get("filename", ""));
        continue;
      }
      if (params.has("filename")) {
        if (stored_) throw std::runtime_error("a second file part");
        file_next_ = true;
        file_name_ = params.get("filename", "");
        RefuseNul(file_name_, "a file name");
        return;
      }
      if (seen_.isMember(name + "_tmp")) throw std::runtime_error("a field named like a file");
      seen_[name] = ReadField();
    }
  }

  // Stores the current part, a file part named `name` other than the
  // package file, in the root's tmp/ and records its two fields. Throws
  // (leaving no file) on a second part of that name, an empty or unsafe
  // name, a part over kSmallFileLimit or a file that cannot be written.
  void StoreSmallFile(const std::string& name, const std::string& file_name) {
    RefuseNul(file_name, "a file name");
    if (name.empty() || seen_.isMember(name)) throw std::runtime_error("a second part " + name);
    const std::string folder = KIVORootPath("/tmp");
    if (KIVOFSMkdirP(folder.c_str(), 01777) != 0) throw std::runtime_error("no tmp folder");
    std::string pattern = folder + "/upload-XXXXXX";
    // The part is read whole first: a part over the limit or cut short
    // leaves no file at all.
    const std::string content = ReadPart(kSmallFileLimit);
    if (buf_.ended_early()) throw std::runtime_error("the file part " + name + " is cut short");
    int fd = mkostemp(&pattern[0], O_CLOEXEC);
    if (fd < 0) throw std::runtime_error("cannot make a file in " + folder);
    close(fd);
    small_files_.push_back(pattern);
    if (!KIVOWriteFileAtomic(pattern, content, SyncToDisk::No, 0600)) {
      throw std::runtime_error("the file part " + name + " cannot be kept");
    }
    seen_[name] = file_name;
    seen_[name + "_tmp"] = pattern;
  }

  // The rest of the current part, at most `limit` bytes.
  std::string ReadPart(size_t limit) {
    std::string value;
    std::istream& part = reader_.stream();
    char buf[4096];
    while (part.read(buf, sizeof(buf)) || part.gcount() > 0) {
      if (value.size() + static_cast<size_t>(part.gcount()) > limit) {
        throw std::runtime_error("a part larger than " + std::to_string(limit) + " bytes");
      }
      value.append(buf, static_cast<size_t>(part.gcount()));
    }
    return value;
  }

  // The rest of the current part, a form field of at most 1 MiB.
  std::string ReadField() {
    std::string value = ReadPart(1u << 20);
    RefuseNul(value, "a field");
    return value;
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
  bool started_ = false;    // a part has been opened (reader_.stream() exists)
  bool file_next_ = false;  // the part opened last is the file, not read yet
  bool stored_ = false;     // the file part has been taken
  std::string file_name_;
  std::vector<std::string> small_files_;  // stored file parts other than "file"
};

}  // namespace

extern "C" UploadSource* KivoOpenMultipart(int fd, uint64_t length, const char* boundary,
                                           int64_t deadline_ms) {
  if (fd < 0 || !boundary || !*boundary) return nullptr;
  try {
    return new MultipartSource(fd, length, boundary, deadline_ms);
  } catch (const std::exception&) {
    return nullptr;
  }
}
