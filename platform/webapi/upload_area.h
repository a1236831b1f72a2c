// The upload area: where posted package files wait for their install,
// "<volume>/@tmp/upload" on the first usable volume with room. The multipart
// reader stores uploads there, and the installation check asks the same
// question, so that "check" cannot call the appliance ready while "upload"
// would fail.
#pragma once

#include <cstdint>
#include <string>

// Creates a new empty file for an upload of `size` bytes in the upload area
// of the first usable volume with more than `size` bytes free, and sets
// `*path` to it; the caller owns (and removes) the file. Uploads older than a
// day are swept from that folder first. Returns UPLOAD_OK, or
// UPLOAD_NO_VOLUME (no usable volume), UPLOAD_TOO_LARGE (no usable volume
// has room) or UPLOAD_NO_TMP_DIR (the folder or the file cannot be made),
// with nothing created.
int KIVOCreateUploadFile(uint64_t size, std::string* path);
