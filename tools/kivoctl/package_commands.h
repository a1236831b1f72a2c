// kivoctl's commands for package authors (build, sign, inspect) and for
// operators of a system root (install, upgrade, uninstall, start, stop,
// status, list, log, rollback, revisions, drop-revision). Each returns the
// process exit status: 0 on success, 1 on failure (the package tool's result
// code is printed in brackets: exit statuses cannot hold codes above 255), 2
// on a usage error.
#pragma once

#include <string>
#include <vector>

int KivoctlBuild(const std::vector<std::string>& args);
int KivoctlSign(const std::vector<std::string>& args);
int KivoctlInspect(const std::vector<std::string>& args);
int KivoctlInstall(const std::vector<std::string>& args);
int KivoctlUninstall(const std::vector<std::string>& args);
int KivoctlStartStop(const std::vector<std::string>& args, bool start);
int KivoctlStatus(const std::vector<std::string>& args);
int KivoctlList(const std::vector<std::string>& args);
int KivoctlLog(const std::vector<std::string>& args);
// rollback ID, revisions ID, drop-revision ID: the kept earlier versions
// of a package (platform/pkgtool/revisions.h).
int KivoctlRollback(const std::vector<std::string>& args);
int KivoctlRevisions(const std::vector<std::string>& args);
int KivoctlDropRevision(const std::vector<std::string>& args);
