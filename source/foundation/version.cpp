#include "nxbase/version.h"

namespace nxbase {
const char* Version() {
    return NXBASE_VERSION_STRING;
}
}  // namespace nxbase
