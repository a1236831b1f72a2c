// `kivoctl watchdog [--once]`: the service that starts again the packages
// whose service died. Every check (each interval_seconds of the root's
// etc/kivo/watchdog.conf) looks at each installed package meant to run
// (its record's "enabled" marker) that the watchdog has not given up on;
// one whose service is dead is started again under the package tool's
// lock, taken in one try: a package whose operation is under way (an
// install, upgrade, rollback, uninstall, start or stop) is left for the next
// check. Under the lock the record is read again, so a package the
// administrator stopped meanwhile stays stopped. Restarts follow the
// growing delay of watchdog_record.h; after max_restarts within an hour the
// package is marked crashed with the reason and the last lines of its log.
// Each restart and each giving up is an entry of the activity log (origin
// "watchdog"), and a line on stdout.
//
// The settings file is read again before every check; one that breaks a
// rule keeps the settings in force (and says so on stderr), and at start
// the watchdog refuses to run with it (exit 1, [331]). SIGTERM and SIGINT
// end it between checks; SIGHUP makes it check at once. --once makes one
// check and exits 0.
#pragma once

#include <string>
#include <vector>

int KivoctlWatchdog(const std::vector<std::string>& args);
