// The multipart/form-data reader of the host: an UploadSource over the CGI
// body on a file descriptor, streaming the file part to a temporary file on
// a volume with room for it. Built as its own library (it brings Poco's
// MIME reader) that entry.cgi opens only for multipart requests.
#pragma once

#include <cstdint>

#include "webapi/api_upload.h"

extern "C" {
// Opens a reader of `length` bytes of body on `fd` with `boundary`; bytes
// that have not come by `deadline_ms` (MonotonicMs(), host/request_deadline.h)
// count as missing, as if the body ended there. The caller deletes it. Null
// on bad arguments.
using KivoOpenMultipartFn = UploadSource* (*)(int fd, uint64_t length, const char* boundary,
                                              int64_t deadline_ms);
UploadSource* KivoOpenMultipart(int fd, uint64_t length, const char* boundary, int64_t deadline_ms);
}
