#include "settings/update_schedule.h"

#include <string>

#include "klibc/key_value_file.h"
#include "klibc/last_error.h"
#include "klibc/sysroot.h"

bool PMSSavaSchedule(bool desktop, bool mail, int hour) {
  if (hour < -1 || hour > 23) {
    KLIBCErrSet(KLIBC_ERR_BAD_PARAMETER);
    return false;
  }
  return KLIBCINFOSetKeyValue("upgrade_pkg_nvx_notification", desktop ? "yes" : "no") == 0 &&
         KLIBCINFOSetKeyValue("upgrade_pkg_email_notification", mail ? "yes" : "no") == 0 &&
         KIVOKeyValueSet(KIVORootPath("/etc/kivo/update_notify.conf"), "notify_hour",
                         std::to_string(hour));
}
