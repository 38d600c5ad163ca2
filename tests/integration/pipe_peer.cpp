// A peer for the transport tests: listens under the name given as its first
// argument (or "EchoPeer"), writes its command line and working directory to
// $NXBASE_RUNTIME_DIR/<name>.started, and answers every message with
// "ANSWER!" + the command and the same data. "QUIT" ends it; CANCEL_REQUEST
// makes it die without an answer, IS_APP_READY is never answered.
#include <unistd.h>

#include <fstream>
#include <string>

#include "nxbase/msgcat.h"
#include "nxbase/pipe.h"
#include "toolkit/application.h"

namespace {

void Echo(VELTRAEvent& event) {
    if (event.GetCommand() == "QUIT") {
        Application::Get().Quit();
        return;
    }
    if (event.GetCommand() == "CANCEL_REQUEST") ::_exit(0);
    if (event.GetCommand() == "IS_APP_READY") return;
    MyMemoryBlock data = event.GetData();
    nxbase::EncodeBlock(data);
    Pipe::Instance()->Send(event.GetSender(), kAnswerPrefix + event.GetCommand(), data);
}

}  // namespace

int main(int argc, char** argv) {
    // Started by the transport, the arguments are "-S -LNG <code>".
    std::string name = argc > 1 && argv[1][0] != '-' ? argv[1] : "EchoPeer";
    std::ofstream started(nxbase::MessagingRuntimeDirectory() + "/" + name + ".started");
    for (int i = 0; i < argc; ++i) started << (i ? " " : "") << argv[i];
    char cwd[4096];
    started << "\n" << (::getcwd(cwd, sizeof cwd) ? cwd : "?") << "\n";
    started.close();
    Pipe::CreatePipe(name)->SetReceiveFunction(Echo);
    Application::Get().Execute();
    Pipe::DeletePipe();
    return 0;
}
