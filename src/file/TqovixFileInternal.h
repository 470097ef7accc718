// What the file layer's sources share and nothing else sees: the fault seam's answer and
// the one test for a path not given.
#pragma once

#include "file/CTqovixFile.h"

namespace TqovixFileInternal {

// The installed seam's errno for `operation`, 0 without a seam or when it lets the call run.
int InjectedFault(eTqovixFileOperation operation);

inline bool IsEmptyPath(const char* path) { return path == nullptr || path[0] == '\0'; }

}  // namespace TqovixFileInternal
