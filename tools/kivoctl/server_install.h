// Installing from a package server on the command line: the download and
// quick install that `kivoctl auto-update` and `kivoctl install-server` run,
// the same the desktop's downloads run (pkgserver/download.h). The file's
// origin is the source whose catalogue lists its link, never what the
// command line says (pkgserver/catalogue.h, PMSListingOrigin).
#pragma once

#include <string>
#include <vector>

#include <json/value.h>

#include "pkgtool/package_origin.h"

// Downloads catalogue entry `entry` of package `id` (its "link", and "md5"
// and "size" when given) in the download task the desktop uses, so the
// desktop sees it and does not start a second one, and installs it onto
// `volume` ("" for the package's or the default volume), starting it when
// `run`, with what the administrator allowed (`choices`). False
// with `message`, and `code` the package tool's result (0 for a failure
// before the install), on failure.
bool KivoctlDownloadAndInstall(const std::string& id, const Json::Value& entry, bool run,
                               const std::string& volume, const PMSInstallChoices& choices,
                               std::string& message, int& code);

// `kivoctl install-server ID [--feed URL] [--volume V] [--run] [--switch-origin]`:
// installs, or upgrades to, the newest version of ID that the vendor's
// server (or the listed feed URL) offers. Exit status 0 on success, 1 on
// failure (the package tool's result in brackets), 2 on a usage error.
int KivoctlInstallServer(const std::vector<std::string>& args);
