// The platform's last-error value: every platform call that fails records a
// number and where it was set, and the caller reads it back right after the
// failing call (the module maps some numbers to API error codes).
//
// The value is per thread and lives in this one shared library, so the host,
// the module and the platform libraries loaded into one process see the
// same value.
#pragma once

// Error numbers that callers test for. The high byte is the area, as the
// appliance has always numbered them.
enum KLIBC_ERR {
  KLIBC_ERR_NONE = 0,
  KLIBC_ERR_BAD_PARAMETER = 0x0D00,
  KLIBC_ERR_OUT_OF_MEMORY = 0x0200,
  KLIBC_ERR_FILE_OPEN = 0x0900,
  KLIBC_ERR_FILE_READ = 0x0A00,
  KLIBC_ERR_FILE_WRITE = 0x0B00,
  KLIBC_ERR_NOT_FOUND = 0x0C00,
  KLIBC_ERR_EXEC = 0x1500,
  KLIBC_ERR_LOCK = 0x1600,
  KLIBC_ERR_VOLUME_NOT_FOUND = 0x0600,
  KLIBC_ERR_NO_SPACE = 0x2900,
  KLIBC_ERR_VOLUME_CRASHED = 0x8400,
  KLIBC_ERR_NO_TMP_DIR = 0xDD00,
};

// The last error number of this thread; 0 when nothing failed since the last
// KLIBCErrClear.
int KLIBCErrGet();
// Source file and line of the call that set it ("" and 0 when unset).
const char* KLIBCErrorGetFile();
int KLIBCErrorGetLine();

void KLIBCErrSetEx(int err, const char* file, int line);
void KLIBCErrClear();

#define KLIBCErrSet(err) KLIBCErrSetEx((err), __FILE__, __LINE__)
