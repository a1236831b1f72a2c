// Generated payloads for benchmarks: files of mixed sizes, half random
// bytes (incompressible, like media) and half text.
#pragma once

#include <cstdint>
#include <string>

// Writes about `total` bytes of files below `dir`; returns the bytes written.
uint64_t GeneratePayload(const std::string& dir, uint64_t total);
