// Feeds the post office a sequence of received events from several senders,
// as the transports deliver them: protocol messages with any CONNECT level,
// LOCK and UNLOCK in any order, answers awaited or not, unknown names and
// DISCONNECTs that no CONNECT stands for. Each event is: one byte sender
// (0..3 named, others ""), one byte command (below 135 a message, 135..199
// an answer, others an unknown name), one byte data length, the data. After
// each event the connection count must equal the sum of the peers' counts
// and never be negative; every event ends up handled, queued or dropped.
// The post office is the server (its DISCONNECT rules are the strictest)
// and lives across inputs, as in a long session; it is made afresh when
// commands of peers that wait behind a lock pile up.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "messaging_fuzz_env.h"
#include "nxbase/msgcat.h"
#include "nxbase/pipe.h"
#include "nxbase/postoffice.h"

namespace {

void Require(bool condition) {
    if (!condition) std::abort();
}

const char* const kSenders[] = {"Alpha", "Beta", "Gamma", "LumaServer"};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    nxfuzz::PrepareMessagingEnvironment("nxbase-pofuzz");
    // The server reads no registry, so it needs no installed LumaServer.
    static PostOffice* office = nullptr;
    if (office == nullptr || office->GetQueueSize() > 256) {
        NxSingleton::DeleteAllSingleton();
        office = PostOffice::CreatePostOffice("LumaServer");
    }
    std::size_t at = 0;
    while (size - at >= 3) {
        std::uint8_t who = data[at], what = data[at + 1];
        std::size_t length = data[at + 2];
        at += 3;
        length = std::min(length, size - at);
        MyMemoryBlock block(static_cast<long>(length));
        block.Put(data + at, static_cast<long>(length));
        at += length;
        std::string sender = who < 4 ? kSenders[who] : "";
        std::string command =
            what < ANZAHL_BOTSCHAFTEN ? nxbase::MessageName(what)
            : what < 200 ? nxbase::CommandTextOfNumber(kAnswerOffset + what - ANZAHL_BOTSCHAFTEN)
                         : "NO_SUCH_MESSAGE";
        // Channel numbers that are not open: answers fail at once, as to a
        // peer that has gone.
        VELTRAEvent event(sender, command, std::move(block), 1000 + who);
        office->CommunicationReceiveFunction(event);
        int sum = 0;
        for (const char* name : kSenders) sum += office->GetConnectionCount(name);
        sum += office->GetConnectionCount("");
        Require(office->GetConnectionCount() == sum);
        Require(office->GetConnectionCount() >= 0);
    }
    office->BotschaftenHandler();
    // What the events left for the loop (the handler's tick, cancelled
    // timers of a replaced office) runs now, as the loop would run it.
    Application::Get().Reschedule();
    Application::Get().ResetQuit();
    return 0;
}
