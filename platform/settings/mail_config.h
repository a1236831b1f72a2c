// The appliance's outgoing mail settings, which update notices by mail need:
// the key/value file "/etc/kivo/mail.conf" under the system root.
//
//   smtp_server="mail.example.com"   where mail goes (required)
//   smtp_port="587"
//   sender="nas@example.com"
//   recipient="admin@example.com"
//
// They stand in for the appliance's notification service, which is not part
// of the package center.
#pragma once

#include <string>

struct KIVO_MAIL {
  std::string smtp_server;  // the first field: empty means mail is not set up
  std::string smtp_port;
  std::string sender;
  std::string recipient;
};
using PKIVO_MAIL = KIVO_MAIL*;

// Reads the mail settings into a new record that the caller releases with
// KIVOMailFree. 0 on success; -1 with *mail null and the last error set when
// the file is missing or unreadable.
[[nodiscard]] int KIVOMailGet(PKIVO_MAIL* mail);
void KIVOMailFree(PKIVO_MAIL mail);
