// `kivoctl index`: turns a folder of package files into a static package
// server catalogue (docs/package-server.md), so that any web server or CDN
// serving the folder is a complete package server.
#pragma once

#include <string>
#include <vector>

struct CatalogueIndexOptions {
  std::string folder;    // the package files (*.kpk); the catalogue is written here
  std::string base_url;  // where the folder is served: links are base_url + "/" + file
  std::string output = "catalogue.json";  // file name inside `folder`
  std::vector<std::string> recommend;     // package ids, in the order to show
};

// Writes <folder>/<output> (atomically) and the icons into <folder>/icons/.
// Returns false with `*error` on the first package file that cannot be read
// or any file that cannot be written. `*count` gets the number of entries.
bool KivoctlWriteCatalogue(const CatalogueIndexOptions& options, int* count, std::string* error);

// The command line: index FOLDER --base-url URL [--output NAME] [--recommend ID]...
int KivoctlIndex(const std::vector<std::string>& args);
// server-config [--vendor URL] [--company-info URL]
// [--allow-private-image-addresses yes|no]: changes pkgserver.conf of the
// root and prints the resulting settings.
int KivoctlServerConfig(const std::vector<std::string>& args);
