// The classic web session of raw pages: a page that is not a JSON answer
// (the package center's inline-frame page) asks this object who is calling,
// and writes its own CGI header through it.
//
// The host knows the caller: for the methods it lets through to a module
// without its own sign-in check, it hands over the signed-in account (or
// none) with WebManSetCaller before the handler runs. One request is served
// per process (entry.cgi, or one kivo-webd child per request), so the caller
// is the process's own; WebManClearCaller forgets it.
#pragma once

#include <string>
#include <vector>

// Where the calling page sits; the session layer accepts any value and only
// passes it along.
enum _tag_cgi_position { CGI_POSITION_DEFAULT = 0, CGI_POSITION_WEBAPI = 1 };

// Answers whether `account` belongs to `group`. The host passes its own
// account lookup, so the module's raw pages ask the same accounts files.
using WebManGroupLookup = bool (*)(const std::string& account, const std::string& group);

// Records the signed-in caller of this request: `account` empty when nobody is
// signed in (or the session is unknown or expired). `in_group` must stay
// callable for the rest of the process; null means no account is in any group.
void WebManSetCaller(const std::string& account, WebManGroupLookup in_group);
void WebManClearCaller();

class WebMan {
 public:
  // `buffer_headers` true keeps header lines until WriteHeader (or the
  // destructor) sends them in one piece; false is not supported and behaves
  // the same.
  explicit WebMan(bool buffer_headers);
  // Ends the CGI header (buffered lines and the blank line) when WriteHeader
  // has not, so a refusal made only of header lines is a complete answer.
  ~WebMan();
  WebMan(const WebMan&) = delete;
  WebMan& operator=(const WebMan&) = delete;

  // True when a caller is signed in. `app` (an application the caller must be
  // allowed to use; null for none), `level` and `position` belong to the
  // session layer's rules; a signed-in caller passes them all.
  bool IsAuthorized(const char* app, int level, _tag_cgi_position position);
  // Loads the signed-in caller's account; false when there is none.
  bool LoadIn();
  // True when the loaded caller is a member of "administrators".
  bool IsAdmin() const;
  const std::string& User() const { return user_; }

  // Adds "name: value" to the header.
  void AddHeader(const std::string& name, const std::string& value);
  // Writes the header lines, "Content-Type: <content_type>" and the blank line
  // that ends the header on the standard output; the body follows through
  // stdio. Later calls write nothing.
  void WriteHeader(const std::string& content_type);

 private:
  void FlushHeader(const std::string& content_type);

  bool loaded_ = false;
  bool header_written_ = false;
  std::string user_;
  std::vector<std::string> headers_;
};
