// Creating a system root: every folder and configuration file the platform
// reads, with sane defaults. Used by `kivoctl init-root`, the demo and tests.
#pragma once

#include <string>

// Creates (or completes) the system root at `dir`: existing files are kept,
// missing ones are created. Returns false with `*error` set on failure.
bool KIVOCreateSystemRoot(const std::string& dir, std::string* error);
