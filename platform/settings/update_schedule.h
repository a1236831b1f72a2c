// How the appliance tells the administrator about package updates. The two
// notices are the keys "upgrade_pkg_nvx_notification" (desktop) and
// "upgrade_pkg_email_notification" (mail) of /etc/kivoinfo.conf, "yes" or
// "no"; the hour of the daily check is "notify_hour" of
// "/etc/kivo/update_notify.conf" under the system root, -1 when the system
// chooses it. The appliance's notification service reads both.
#pragma once

// Stores the notification schedule. `hour` is -1 or 0 to 23. True on
// success; false with the last error set (nothing is changed when the hour
// is out of range; each key is replaced atomically, so a failed write leaves
// the keys written before it).
[[nodiscard]] bool PMSSavaSchedule(bool desktop, bool mail, int hour);
