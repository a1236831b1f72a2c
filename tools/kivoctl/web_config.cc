#include "tools/kivoctl/web_config.h"

std::string KIVOWebConfig(const WebConfigOptions& o) {
  std::string www = o.root + "/usr/kivo/www";
  return "# Web API of the system root " + o.root +
         "\n"
         "server.modules = (\"mod_access\", \"mod_alias\", \"mod_setenv\", \"mod_cgi\")\n"
         "server.bind = \"" +
         o.address +
         "\"\n"
         "server.port = " +
         std::to_string(o.port) +
         "\n"
         "server.document-root = \"" +
         www +
         "\"\n"
         "server.upload-dirs = (\"" +
         o.root +
         "/tmp\")\n"
         "server.errorlog-use-syslog = \"disable\"\n"
         "server.tag = \"kivo\"\n"
         // entry.cgi decodes the body itself; hand it over as it arrives
         // instead of buffering whole uploads in the web server.
         "server.stream-request-body = 2\n"
         // Uploads stream through; entry.cgi applies its own limit
         // ("max_upload_bytes"), so the web server only caps at 4 GiB.
         "server.max-request-size = 4194304\n"
         "alias.url = (\"/webapi/entry.cgi\" => \"" +
         o.entry_cgi +
         "\")\n"
         "$HTTP[\"url\"] == \"/webapi/entry.cgi\" {\n"
         "  cgi.assign = (\"\" => \"\")\n"
         "}\n"
         "setenv.add-environment = (\"KIVO_ROOT\" => \"" +
         o.root + "\")\n";
}
