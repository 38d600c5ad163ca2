// Shared pieces of the GUI loop tests: a sandbox with LumaServer and the echo
// peer registered, and the calling thread's wake-ups as the kernel counts them.
#ifndef NXBASE_TESTS_GUI_TEST_UTIL_H_
#define NXBASE_TESTS_GUI_TEST_UTIL_H_

#include <string>

#include "messaging_test_util.h"
#include "nxbase/pipe.h"
#include "nxbase/postoffice.h"

namespace nxtest {

// Voluntary context switches of the calling thread: one per sleep that ended.
inline long ThreadWakeUps() {
    return ProcStatusField("/proc/thread-self/status", "voluntary_ctxt_switches");
}

// LumaServer (a copy of lumaserver, registered) and the echo peer "EchoPeer".
class GuiSandbox {
  public:
    GuiSandbox() { Application::Get().ResetQuit(); }
    ~GuiSandbox() { NxSingleton::DeleteAllSingleton(); }

    MessagingSandbox sandbox{"gui"};
    const std::string server = sandbox.AddServer(),
                      peer = sandbox.AddPeer("EchoPeer", NXBASE_PIPE_PEER, "guipeer");
};

}  // namespace nxtest

#endif  // NXBASE_TESTS_GUI_TEST_UTIL_H_
