// What kivo-webd loads once, before it forks its first child, so that a
// child finds the code of a request already mapped and bound.
#pragma once

#include <string>
#include <vector>

// Loads (dlopen, every symbol bound now) each web API module of
// `module_dir` and the libraries the request code loads on first use: the
// package-file library, the multipart reader, the transfer library, libcrypt
// and libsqlite3. Libraries only: no database connection, no lock, no file of
// the system root is opened, and none of their functions is called, so a
// child starts from the same state as a fresh entry.cgi. A later dlopen of
// the same file in a child returns the loaded copy.
// Returns what could not be loaded, one "<file>: <reason>" each; a request
// that needs one of them loads it itself (and fails as entry.cgi would).
std::vector<std::string> PreloadRequestLibraries(const std::string& module_dir);
