// The package center's own icon, shown for a package that has none. It is
// drawn here rather than kept as a binary file: a parcel with a band across
// its lid on a transparent ground, at any size.
#pragma once

#include <string>

// Writes the icon as a `size` x `size` pixel PNG to `path`, atomically.
// False when it cannot be encoded or written.
[[nodiscard]] bool KIVOWriteFallbackIcon(const std::string& path, int size);
