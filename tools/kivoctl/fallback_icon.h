// Icons drawn here rather than kept as binary files, at any size, on a
// transparent ground:
// - the package center's own icon, shown for a package that has none: a
//   parcel with a band across its lid;
// - a package's icon made from its id: a tile in a colour the id chooses,
//   bearing one letter, so that packages without a drawn icon of their own
//   (the samples) still tell apart at a glance.
#pragma once

#include <string>

// Writes the package center's icon as a `size` x `size` pixel PNG to `path`,
// atomically. False when it cannot be encoded or written.
[[nodiscard]] bool KIVOWriteFallbackIcon(const std::string& path, int size);

// True for a letter a package icon can bear: A-Z, a-z (drawn as capitals)
// and 0-9.
bool KIVOIsIconLetter(char letter);

// Writes the icon of the package `id` bearing `letter` as a `size` x `size`
// pixel PNG to `path`, atomically. The same id always gives the same colour.
// False when the letter is not one KIVOIsIconLetter takes, or when the image
// cannot be encoded or written.
[[nodiscard]] bool KIVOWriteLetterIcon(const std::string& path, int size, const std::string& id,
                                       char letter);
