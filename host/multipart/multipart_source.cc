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

#include "webapi/upload_area.h"

namespace {

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

// Throws when `text` holds a NUL byte: every posted field becomes a request
// parameter, and no parameter of the web API may hold one (it would cut the
// value short wherever it becomes a C string).
void RefuseNul(const std::string& text, const char* what) {
  if (text.find('\0') != std::string::npos) {
    throw std::runtime_error(std::string("a NUL byte in ") + what);
  }
}

// The body holds the fields, at most one file part and more fields, and ends
// with the closing boundary. A body cut short, one without the closing
// boundary (whose last part would run to the end of the body and take stray
// bytes with it) and one with a second file part are refused, and nothing is
// stored for them.
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
      if (params.has("filename")) {
        if (stored_) throw std::runtime_error("a second file part");
        file_next_ = true;
        file_name_ = params.get("filename", "");
        RefuseNul(file_name_, "a file name");
        return;
      }
      std::string name = params.get("name", "");
      RefuseNul(name, "a field name");
      // These two name the stored file; a client's field must never pass
      // for them (the handler inspects and deletes that path).
      if (name == "file_tmp" || name == "file_name") {
        throw std::runtime_error("a field named like the stored file");
      }
      seen_[name] = ReadField();
    }
  }

  // The rest of the current part, a form field of at most 1 MiB.
  std::string ReadField() {
    std::string value;
    std::istream& part = reader_.stream();
    char buf[4096];
    while (part.read(buf, sizeof(buf)) || part.gcount() > 0) {
      if (value.size() + static_cast<size_t>(part.gcount()) > (1u << 20)) {
        throw std::runtime_error("a form field larger than 1 MiB");
      }
      value.append(buf, static_cast<size_t>(part.gcount()));
    }
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
