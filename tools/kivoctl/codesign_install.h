// Installs the code-signing script ("/usr/kivo/bin/codesign.php", run by the
// package center's keyring methods through php-cli) into a system root.
#pragma once

#include <string>

// Writes the script into `dir`/usr/kivo/bin, replacing an older copy
// atomically. False with *error set when it cannot be written.
[[nodiscard]] bool KIVOInstallCodesignScript(const std::string& dir, std::string* error);
