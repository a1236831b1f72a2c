// The feasibility library: may an install, uninstall or stop of some
// packages go ahead? Blocking ("hard") and advisory ("soft") reasons are
// asked for separately; docs/feasibility.md lists the rules.
#pragma once

#include "klibc/string_list.h"

enum KIVO_FEASIBILITY_TYPE {
  KIVO_FEASIBILITY_INSTALL = 0x0E,
  KIVO_FEASIBILITY_UNINSTALL = 0x0F,
  KIVO_FEASIBILITY_STOP = 0x10,
};

enum KIVO_FEASIBILITY_CHECK_TYPE {
  KIVO_FEASIBILITY_HARD = 1,
  KIVO_FEASIBILITY_SOFT = 2,
};

// Checks `packages` (ids joined with ",") for `type`. Returns 0 when the
// operation may go ahead, the number of reasons appended to *reasons when
// not, or -1 (last error set) when the check itself cannot be made: an
// unknown type or check type, an invalid package id, no reasons list, or a
// registry that cannot be read.
int KIVOFeasibilityCheck(int type, int check_type, PKLIBSZLIST* reasons, const char* packages,
                         int flags);
