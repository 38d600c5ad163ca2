// The path of a D-Bus poke: arbitrary bytes as the poke's data (sender, ":",
// encoded block) and item, taken apart as the DDE transport does and handed
// to the post office. The sender must be the text before the first colon,
// the block must decode without reading outside the data, and the post
// office must take any item and block.
//
// The first byte is the item's length. The event is delivered as coming from
// the running peer "Peer" (this program started again with
// $NXBASE_FUZZ_PEER set), so that answers go to a real socket: an answer to a
// peer that does not exist waits out five send retries of 1 ms each, which
// would hold the target to a few hundred inputs a second.
#include <signal.h>
#include <spawn.h>
#include <sys/prctl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <string>

#include "messaging_fuzz_env.h"
#include "nxbase/dde.h"
#include "nxbase/msgcat.h"
#include "nxbase/pipe.h"
#include "nxbase/postoffice.h"
#include "toolkit/application.h"

namespace {

constexpr const char* kPeer = "Peer";

void Require(bool condition) {
    if (!condition) std::abort();
}

pid_t gPeer = -1;

void StopPeer() {
    if (gPeer <= 0) return;
    ::kill(gPeer, SIGTERM);
    ::waitpid(gPeer, nullptr, 0);
    gPeer = -1;
}

// Runs as the peer: takes whatever comes and answers nothing.
[[noreturn]] void RunPeer() {
    ::prctl(PR_SET_PDEATHSIG, SIGKILL);
    ::signal(SIGTERM, [](int) { Application::Get().Quit(); });
    Pipe::CreatePipe(kPeer)->SetReceiveFunction([](VELTRAEvent&) {});
    Application::Get().Execute();
    std::_Exit(0);
}

void StartPeer() {
    ::setenv("NXBASE_FUZZ_PEER", "1", 1);
    char* const arguments[] = {const_cast<char*>("dde_poke_fuzz_peer"), nullptr};
    if (::posix_spawn(&gPeer, "/proc/self/exe", nullptr, nullptr, arguments, environ) != 0)
        gPeer = -1;
    ::unsetenv("NXBASE_FUZZ_PEER");
    std::atexit(StopPeer);
    for (int i = 0; i < 500 && !nxbase::IsApplicationRunning(kPeer); ++i) ::usleep(10000);
}

PostOffice* Office() {
    static PostOffice* office = PostOffice::CreatePostOffice("LumaServer");
    return office;
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
    if (std::getenv("NXBASE_FUZZ_PEER") != nullptr) RunPeer();
    nxfuzz::PrepareMessagingEnvironment("nxbase-ddefuzz");
    StartPeer();
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    if (size < 1) return 0;
    std::size_t itemLength = std::min<std::size_t>(data[0], size - 1);
    std::string item(reinterpret_cast<const char*>(data) + 1, itemLength);
    std::string poke(reinterpret_cast<const char*>(data) + 1 + itemLength, size - 1 - itemLength);
    std::string sender;
    MyMemoryBlock block;
    nxbase::SplitPoke(poke, sender, block);
    std::size_t colon = poke.find(':');
    Require(sender == (colon == std::string::npos ? std::string() : poke.substr(0, colon)));
    std::string encoded = colon == std::string::npos ? poke : poke.substr(colon + 1);
    Require(std::string(block.GetDatenZeiger(), static_cast<std::size_t>(block.Len())) ==
            nxbase::DecodeBytes(encoded.data(), encoded.size()));
    VELTRAEvent event(kPeer, item, std::move(block));
    Office()->CommunicationReceiveFunction(event);
    return 0;
}
