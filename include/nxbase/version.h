// The library's version, "major.minor.patch", as built.
#ifndef NXBASE_VERSION_H_
#define NXBASE_VERSION_H_

#include "nxbase/export.h"

namespace nxbase {
NXBASE_EXPORT const char* Version();
}  // namespace nxbase

#endif  // NXBASE_VERSION_H_
