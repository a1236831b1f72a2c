#include "tools/kivoctl/web_config.h"

#include <sys/un.h>

#include "host/cgi_request.h"

namespace {

// Paths go into quoted configuration strings, and kivo-webd's into a command
// line the web server splits at spaces.
bool Plain(const std::string& path) {
  return !path.empty() && path[0] == '/' &&
         path.find_first_of(" \t\r\n\"\\$'") == std::string::npos;
}

std::string Quoted(const std::string& text) { return "\"" + text + "\""; }

std::string Environment(const WebConfigOptions& o) {
  std::string env = "(\"KIVO_ROOT\" => " + Quoted(o.root);
  if (!o.module_dir.empty()) env += ", \"KIVO_MODULE_DIR\" => " + Quoted(o.module_dir);
  return env + ")";
}

std::string CgiSection(const WebConfigOptions& o) {
  return "alias.url = (\"/webapi/entry.cgi\" => " + Quoted(o.entry_cgi) +
         ")\n"
         "$HTTP[\"url\"] == \"/webapi/entry.cgi\" {\n"
         "  cgi.assign = (\"\" => \"\")\n"
         "}\n";
}

std::string ScgiSection(const WebConfigOptions& o) {
  std::string command = o.webd + " --max-children " + std::to_string(o.max_children) +
                        " --read-timeout " + std::to_string(o.read_timeout_seconds);
  return "$HTTP[\"url\"] == \"/webapi/entry.cgi\" {\n"
         "  scgi.server = (\"\" => ((\n"
         "    \"socket\" => " +
         Quoted(WebdSocketPath(o)) +
         ",\n"
         "    \"bin-path\" => " +
         Quoted(command) +
         ",\n"
         // kivo-webd forks per request itself; one of it is enough.
         "    \"max-procs\" => 1,\n"
         "    \"check-local\" => \"disable\",\n"
         "    \"bin-environment\" => " +
         Environment(o) +
         "\n"
         "  )))\n"
         "}\n";
}

// The page's text (its script is most of what a first visit loads) goes
// gzip-compressed to browsers that accept it, with "Vary: Accept-Encoding" so
// that caches keep the two forms apart. Compressed as it is sent: the
// assets are small and browsers keep them for a year. The web API's answers
// are left alone (a download's progress must not wait in a compressor), and
// so are package files and images, which are compressed already.
std::string CompressionSection() {
  return "deflate.mimetypes = (\"text/html\", \"text/javascript\", \"text/css\", "
         "\"image/svg+xml\")\n"
         "deflate.allowed-encodings = (\"gzip\")\n"
         "$HTTP[\"url\"] =~ \"^/webapi/\" {\n"
         "  deflate.mimetypes = ()\n"
         "}\n";
}

// The package center page (index.html and its hashed assets/) lies in the
// document root beside the feeds. Its policy allows only the page's own
// scripts, styles and images and calls to this server: an injected script or
// style has nowhere to come from and nowhere to send anything. The assets'
// names change with their content, so browsers may keep them for a year;
// index.html is asked again each time, so a new page is seen at once.
std::string PageSection() {
  const std::string policy =
      "\"Content-Security-Policy\" => \"default-src 'self'; script-src 'self'; "
      "style-src 'self'; img-src 'self' data:; connect-src 'self'; frame-src 'self'; "
      "object-src 'none'; base-uri 'none'; form-action 'self'; frame-ancestors 'self'\", "
      "\"X-Content-Type-Options\" => \"nosniff\", "
      "\"Referrer-Policy\" => \"same-origin\"";
  return "index-file.names = (\"index.html\")\n"
         "mimetype.assign = (\".html\" => \"text/html; charset=utf-8\", "
         "\".js\" => \"text/javascript; charset=utf-8\", "
         "\".css\" => \"text/css; charset=utf-8\", "
         "\".json\" => \"application/json; charset=utf-8\", "
         "\".txt\" => \"text/plain; charset=utf-8\", "
         "\".asc\" => \"text/plain; charset=utf-8\", "
         "\".svg\" => \"image/svg+xml\", \".png\" => \"image/png\", "
         "\".ico\" => \"image/x-icon\", \"\" => \"application/octet-stream\")\n"
         "$HTTP[\"url\"] =~ \"^/assets/\" {\n"
         "  setenv.set-response-header = (" +
         policy +
         ", \"Cache-Control\" => \"public, max-age=31536000, immutable\")\n"
         "}\n"
         "else $HTTP[\"url\"] !~ \"^/webapi/\" {\n"
         "  setenv.set-response-header = (" +
         policy +
         ", \"Cache-Control\" => \"no-cache\")\n"
         "}\n" +
         CompressionSection();
}

// lighttpd's request size limits are in KiB.
std::string KiB(uint64_t bytes) { return std::to_string((bytes + 1023) / 1024); }

// How lighttpd takes request bodies. It reads each body whole before it
// starts entry.cgi or hands the request to kivo-webd, so that no request
// process ever waits for a slow client: lighttpd holds such a client at the
// cost of a connection, and drops it after read_timeout_seconds without a
// byte. Only uploads stream through as they arrive (a package file is not
// written twice); kivo-webd and the request code bound those by their
// deadline. Each kind has the limit the web API applies to it, so that
// lighttpd never holds more than the API would take.
std::string BodySection(const WebConfigOptions& o) {
  return "server.stream-request-body = 0\n"
         "server.max-request-size = " +
         KiB(kMaxBodyBytes) +
         "\n"
         "$REQUEST_HEADER[\"Content-Type\"] =~ \"(?i)^multipart/form-data\" {\n"
         "  server.stream-request-body = 2\n"
         "  server.max-request-size = " +
         KiB(o.max_upload_bytes) +
         "\n"
         "}\n"
         "server.max-read-idle = " +
         std::to_string(o.read_timeout_seconds) + "\n";
}

}  // namespace

bool ParseWebMode(const std::string& text, WebMode* mode) {
  if (text == "cgi") return (*mode = WebMode::kCgi), true;
  if (text == "scgi") return (*mode = WebMode::kScgi), true;
  return false;
}

std::string WebdSocketPath(const WebConfigOptions& o) {
  std::string root = o.root == "/" ? "" : o.root;
  return root + "/run/kivo/webd-" + std::to_string(o.port) + ".sock";
}

std::string WebConfigProblem(const WebConfigOptions& o) {
  if (!Plain(o.root)) return "the root must be an absolute path without spaces or quotes";
  if (!o.module_dir.empty() && !Plain(o.module_dir))
    return "the modules folder must be an absolute path without spaces or quotes";
  if (o.port <= 0 || o.port > 65535) return "the port must be 1 to 65535";
  if (o.read_timeout_seconds < 1 || o.read_timeout_seconds > 86400)
    return "the read time limit must be 1 to 86400 seconds";
  // lighttpd keeps its limit in KiB in 32 bits.
  if (o.max_upload_bytes < 1 || (o.max_upload_bytes + 1023) / 1024 > 0xffffffffULL)
    return "the upload limit must be 1 byte to 4 TiB";
  if (o.mode == WebMode::kCgi)
    return Plain(o.entry_cgi) ? "" : "entry.cgi must be an absolute path without spaces or quotes";
  if (!Plain(o.webd)) return "kivo-webd must be an absolute path without spaces or quotes";
  if (o.max_children < 1 || o.max_children > 4096) return "max children must be 1 to 4096";
  // The web server adds "-0" to the socket's name.
  if (WebdSocketPath(o).size() + 2 >= sizeof(sockaddr_un::sun_path))
    return "the root's path is too long for kivo-webd's socket";
  return "";
}

std::string KIVOWebConfig(const WebConfigOptions& o) {
  std::string www = o.root + "/usr/kivo/www";
  const char* module = o.mode == WebMode::kScgi ? "mod_scgi" : "mod_cgi";
  return "# Web API of the system root " + o.root +
         "\n"
         "server.modules = (\"mod_access\", \"mod_alias\", \"mod_setenv\", \"mod_deflate\", \"" +
         module +
         "\")\n"
         "server.bind = " +
         Quoted(o.address) +
         "\n"
         "server.port = " +
         std::to_string(o.port) +
         "\n"
         "server.document-root = " +
         Quoted(www) +
         "\n"
         "server.upload-dirs = (" +
         Quoted(o.root + "/tmp") +
         ")\n"
         "server.errorlog-use-syslog = \"disable\"\n"
         "server.tag = \"kivo\"\n" +
         BodySection(o) + (o.mode == WebMode::kScgi ? ScgiSection(o) : CgiSection(o)) +
         PageSection() +
         // Every request's environment, in both modes (SCGI carries it in
         // the request's head).
         "setenv.add-environment = " + Environment(o) + "\n";
}
