// Raw file answers of the classic CGI model: a method that answers with a
// file (an icon, a screenshot) writes the CGI header and the file's bytes on
// the standard output itself, bypassing the JSON answer.
#pragma once

#include <string>

class HTTPFileOutputer {
 public:
  // Writes "Content-Type: <content_type>", "Content-Length: <size>" and the
  // blank line that ends the CGI header, then the file, streamed in blocks
  // (never read whole into memory). Header lines the caller printed before
  // (a Cache-Control line) stay part of the same header. Returns false,
  // having written nothing, when the file cannot be opened or is not a
  // regular file; true once the whole file is written. A file that shrinks
  // while it is sent ends the body early (the length is then wrong, and the
  // client sees a short answer rather than bytes of another file).
  static bool Output(const std::string& path, const std::string& content_type);
};
