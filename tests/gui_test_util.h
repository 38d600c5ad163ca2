// Shared pieces of the GUI loop tests: a sandbox with LumaServer and the echo
// peer registered, and the calling thread's wake-ups as the kernel counts them.
#ifndef NXBASE_TESTS_GUI_TEST_UTIL_H_
#define NXBASE_TESTS_GUI_TEST_UTIL_H_

#include <signal.h>
#include <sys/wait.h>

#include <chrono>
#include <string>
#include <thread>

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
    GuiSandbox() {
        std::string server =
            sandbox.CopyProgram(NXBASE_BINARY_DIR "/tools/lumaserver", "lumaserver");
        serverExecutable = server.substr(server.rfind('/') + 1);
        std::system((server + " --register >/dev/null").c_str());
        std::string peer = sandbox.CopyProgram(NXBASE_PIPE_PEER, "guipeer");
        peerExecutable = peer.substr(peer.rfind('/') + 1);
        sandbox.Register("Software\\K-Lume\\ChromaLink\\Applications", "EchoPeer", peer);
        Application::Get().ResetQuit();
    }
    ~GuiSandbox() {
        NxSingleton::DeleteAllSingleton();
        for (const std::string& name : {serverExecutable, peerExecutable}) {
            if (pid_t pid = FindProcess(name)) ::kill(pid, SIGKILL);
        }
        auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(5);
        while ((ProcessRunning(serverExecutable) || ProcessRunning(peerExecutable)) &&
               std::chrono::steady_clock::now() < deadline) {
            std::this_thread::sleep_for(std::chrono::milliseconds(20));
        }
        while (::waitpid(-1, nullptr, WNOHANG) > 0) {
        }
    }
    std::string ServerPath() const { return sandbox.root() + "/bin/" + serverExecutable; }

    MessagingSandbox sandbox{"gui"};
    std::string serverExecutable, peerExecutable;
};

}  // namespace nxtest

#endif  // NXBASE_TESTS_GUI_TEST_UTIL_H_
