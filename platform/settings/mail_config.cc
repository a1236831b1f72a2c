#include "settings/mail_config.h"

#include "klibc/key_value_file.h"
#include "klibc/last_error.h"
#include "klibc/sysroot.h"

int KIVOMailGet(PKIVO_MAIL* mail) {
  if (mail == nullptr) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return -1;
  }
  *mail = nullptr;
  KeyValueMap values;
  if (!KIVOKeyValueLoad(KIVORootPath("/etc/kivo/mail.conf"), &values)) return -1;
  *mail = new KIVO_MAIL{values["smtp_server"], values["smtp_port"], values["sender"],
                        values["recipient"]};
  return 0;
}

void KIVOMailFree(PKIVO_MAIL mail) { delete mail; }
