// Small helpers shared by the fuzz targets: handing bytes to code that only
// reads from a path or a descriptor, a scratch folder per process, and the
// check that turns a broken contract into a crash libFuzzer keeps.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

// Stops the run with `what` on stderr when `ok` is false. libFuzzer saves
// the input that got here like any other crash.
void FuzzRequire(bool ok, const char* what);

// An anonymous in-memory file holding `data`, positioned at its start; the
// caller closes it. Reading it through /proc/self/fd/<fd> opens it again at
// offset 0, so readers that take a path need no file on disk.
int FuzzMemoryFile(const uint8_t* data, size_t size);
std::string FuzzFdPath(int fd);

// A fresh folder under $TMPDIR (or /tmp) for this process, removed when it
// exits normally (a crash leaves it for the post-mortem).
std::string FuzzScratchFolder(const char* tag);

// Removes the tree at `path` without following symlinks. False when
// anything is left.
bool FuzzRemoveTree(const std::string& path);

// The names in folder `dir` ("." and ".." left out), sorted.
std::string FuzzListFolder(const std::string& dir);

// How many files (anything but folders) the tree at `dir` holds.
int FuzzCountFiles(const std::string& dir);
