// The messaging's log keys, checked with one atomic load on the hot paths:
// a message there and back must not pay for building log lines nobody reads.
#ifndef NXBASE_SOURCE_MESSAGING_MESSAGING_LOG_H_
#define NXBASE_SOURCE_MESSAGING_MESSAGING_LOG_H_

#include "nxbase/logfile.h"

namespace nxbase::detail {

inline bool CommunicationLogged() {
    static CachedLogOption option("Communication");
    return option.Enabled();
}

inline bool ApplicationLockLogged() {
    static CachedLogOption option("ApplicationLock");
    return option.Enabled();
}

inline bool CommLogTraced() {
    static CachedLogOption option("CommLog");
    return option.Enabled();
}

}  // namespace nxbase::detail

#endif  // NXBASE_SOURCE_MESSAGING_MESSAGING_LOG_H_
