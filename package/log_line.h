// Log lines of the module: error level, "<source>:<line> <message>", where
// <source> is the base name of the source file without its extension
// ("misc", "install", ...), so an operator can find the line that wrote it.
#pragma once

#include <string>
#include <syslog.h>

namespace KIVO_PACKAGE {

// "package/misc.cc" -> "misc".
std::string LogSourceName(const char* file);

}  // namespace KIVO_PACKAGE

#define PKG_LOG_ERR(fmt, ...)                                                            \
  syslog(LOG_ERR, "%s:%d " fmt, KIVO_PACKAGE::LogSourceName(__FILE__).c_str(), __LINE__, \
         ##__VA_ARGS__)
