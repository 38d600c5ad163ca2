// A peer for the transport tests: listens under the name given as its first
// argument (or "EchoPeer"), writes its command line and working directory to
// $NXBASE_RUNTIME_DIR/<name>.started, and answers every message with
// "ANSWER!" + the command and the same data, on the connection the command
// came in on (or by DDE). "QUIT" ends it; CANCEL_REQUEST makes it die without
// an answer, IS_APP_READY is never answered. Data that
// begins with "LATE" and a 4-byte little-endian count of milliseconds is
// answered that much later; answers always leave in the order their
// commands came, as a post office's handlers answer.
#include <signal.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <algorithm>
#include <boost/asio/steady_timer.hpp>
#include <chrono>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <fstream>
#include <string>

#include "nxbase/msgcat.h"
#include "nxbase/pipe.h"
#include "toolkit/application.h"

namespace {

struct PendingAnswer {
    std::chrono::steady_clock::time_point due;
    std::uint64_t channel;  // answers go back on the connection the command came in on
    std::string peer;       // or by DDE, which has none (0)
    std::string command;
    MyMemoryBlock data;
};
std::deque<PendingAnswer> gPending;
std::chrono::steady_clock::time_point gLastDue;

void SendDueAnswers() {
    static boost::asio::steady_timer timer(Application::Get().GetContext());
    auto now = std::chrono::steady_clock::now();
    while (!gPending.empty() && gPending.front().due <= now) {
        PendingAnswer& answer = gPending.front();
        const std::string command = kAnswerPrefix + answer.command;
        if (answer.channel != 0) {
            Pipe::Instance()->SendOnChannel(answer.channel, command, answer.data);
        } else {
            Pipe::Instance()->AnswerByDde(answer.peer, command, answer.data);
        }
        gPending.pop_front();
    }
    if (gPending.empty()) return;
    timer.expires_at(gPending.front().due);
    timer.async_wait([](const boost::system::error_code& error) {
        if (!error) SendDueAnswers();
    });
}

std::chrono::milliseconds Lateness(const MyMemoryBlock& data) {
    const char* bytes = data.GetDatenZeiger();
    if (data.Len() < 8 || std::memcmp(bytes, "LATE", 4) != 0) return {};
    unsigned char ms[4];
    std::memcpy(ms, bytes + 4, 4);
    return std::chrono::milliseconds(ms[0] | ms[1] << 8 | ms[2] << 16 | ms[3] << 24);
}

void Echo(VELTRAEvent& event) {
    if (event.GetCommand() == "QUIT") {
        Application::Get().Quit();
        return;
    }
    if (event.GetCommand() == "CANCEL_REQUEST") ::_exit(0);
    if (event.GetCommand() == "IS_APP_READY") return;
    MyMemoryBlock data = event.GetData();
    auto due = std::max(std::chrono::steady_clock::now() + Lateness(data), gLastDue);
    gLastDue = due;
    nxbase::EncodeBlock(data);
    bool idle = gPending.empty();
    gPending.push_back(
        {due, event.GetChannel(), event.GetSender(), event.GetCommand(), std::move(data)});
    if (idle) SendDueAnswers();
}

}  // namespace

int main(int argc, char** argv) {
    // Started by the transport, the arguments are "-S -LNG <code>": the name
    // is "EchoPeer", or the file's own with $NXBASE_PEER_NAMED_AFTER_FILE.
    // A test that may crash asks its peers to go with it: orphans would keep
    // the test runner waiting on their output.
    if (std::getenv("NXBASE_PEER_DIES_WITH_PARENT")) ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    std::string name = argc > 1 && argv[1][0] != '-' ? argv[1] : "EchoPeer";
    if (argc > 1 && argv[1][0] == '-' && std::getenv("NXBASE_PEER_NAMED_AFTER_FILE")) {
        name = argv[0];
        name = name.substr(name.rfind('/') + 1);
    }
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
