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
//
// Commands 240..245 send an asynchronous request to Alpha (connected through
// a real socket) for one of three messages, with a time-out of 0 ms when the
// first data byte is odd; 246..251 let the loop run. A small model keeps the
// requests per message in the order sent: each answer from Alpha belongs to
// the oldest, whether given up or not; an answered call-back must carry the
// data of the answer the model gave it, and none is called twice.
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <map>
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
const int kAsked[] = {GET_APP_VERSION, GET_DEVICE_NAME, GET_SERIE_NR};

// Alpha's end of a real channel to the office, whose bytes are read and
// dropped so that the office's writes never pile up.
int gAlpha = -1;

void DrainAlpha() {
    char bytes[65536];
    while (gAlpha >= 0 && ::recv(gAlpha, bytes, sizeof bytes, MSG_DONTWAIT) > 0) {
    }
}

bool ConnectAlpha() {
    if (gAlpha >= 0) ::close(gAlpha);
    gAlpha = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::string path = nxbase::RequestSocketPath("LumaServer");
    std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
    if (::connect(gAlpha, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) return false;
    std::string request = nxbase::EncodeFrame("Alpha_1");
    if (::send(gAlpha, request.data(), request.size(), MSG_NOSIGNAL) < 0) return false;
    for (int i = 0; i < 1000 && !Pipe::Instance()->HasChannel("Alpha"); ++i)
        Application::Get().RunOneFor(std::chrono::milliseconds(1));
    DrainAlpha();
    return Pipe::Instance()->HasChannel("Alpha");
}

// The requests to Alpha as the office must see them.
struct Model {
    std::map<int, std::deque<long>> outstanding;  // by answer number, in the order sent
    std::map<long, std::string> expected;         // the answer each request was given
    std::map<long, int> calls;
    long next = 0;
};
Model* gModel = nullptr;

std::string Bytes(const MyMemoryBlock& block) {
    return std::string(block.GetDatenZeiger(), static_cast<std::size_t>(block.Len()));
}

void SendToAlpha(PostOffice& office, int message, bool giveUpAtOnce) {
    Model& model = *gModel;
    long id = model.next++;
    model.calls[id] = 0;
    Model* owner = gModel;
    office.SendAndReceiveAsync(
        "Alpha", message, MyMemoryBlock(0),
        [owner, id](AnswerResult& result) {
            if (owner != gModel) return;  // an office made afresh meanwhile
            Require(++gModel->calls[id] == 1);
            if (result.answered) Require(Bytes(result.data) == gModel->expected.at(id));
        },
        std::chrono::milliseconds(giveUpAtOnce ? 0 : 60000));
    // Sent now, so that the model knows the order on the wire.
    Application::Get().Reschedule();
    Require(Pipe::Instance()->HasChannel("Alpha"));
    model.outstanding[kAnswerOffset + message].push_back(id);
}

void CheckCounts(PostOffice& office) {
    for (int message : kAsked) {
        Require(office.GetOutstandingCount("Alpha", message) ==
                gModel->outstanding[kAnswerOffset + message].size());
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    nxfuzz::PrepareMessagingEnvironment("nxbase-pofuzz");
    // The server reads no registry, so it needs no installed LumaServer.
    static PostOffice* office = nullptr;
    if (office == nullptr || office->GetQueueSize() > 256 ||
        !Pipe::Instance()->HasChannel("Alpha")) {
        NxSingleton::DeleteAllSingleton();
        office = PostOffice::CreatePostOffice("LumaServer");
        delete gModel;
        gModel = new Model;
        Require(ConnectAlpha());
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
        if (what >= 240 && what < 246) {
            SendToAlpha(*office, kAsked[(what - 240) % 3],
                        length > 0 && (block.GetDatenZeiger()[0] & 1));
            CheckCounts(*office);
            continue;
        }
        if (what >= 246 && what < 252) {
            Application::Get().Reschedule();
            DrainAlpha();
            continue;
        }
        std::string sender = who < 4 ? kSenders[who] : "";
        if (who == 0 && what >= ANZAHL_BOTSCHAFTEN && what < 200) {
            // An answer from Alpha: the model's oldest request gets it.
            auto& queue = gModel->outstanding[kAnswerOffset + what - ANZAHL_BOTSCHAFTEN];
            if (!queue.empty()) {
                gModel->expected[queue.front()] = Bytes(block);
                queue.pop_front();
            }
        }
        std::string command =
            what < ANZAHL_BOTSCHAFTEN ? nxbase::MessageName(what)
            : what < 200 ? nxbase::CommandTextOfNumber(kAnswerOffset + what - ANZAHL_BOTSCHAFTEN)
                         : "NO_SUCH_MESSAGE";
        // Channel numbers that are not open: answers fail at once, as to a
        // peer that has gone.
        // Alpha's answers come on its channel, as a peer answers.
        std::uint64_t channel = who == 0 && what >= ANZAHL_BOTSCHAFTEN
                                    ? Pipe::Instance()->ChannelId("Alpha")
                                    : 1000 + who;
        VELTRAEvent event(sender, command, std::move(block), channel);
        office->CommunicationReceiveFunction(event);
        int sum = 0;
        for (const char* name : kSenders) sum += office->GetConnectionCount(name);
        sum += office->GetConnectionCount("");
        Require(office->GetConnectionCount() == sum);
        Require(office->GetConnectionCount() >= 0);
        CheckCounts(*office);
    }
    office->BotschaftenHandler();
    // What the events left for the loop (the handler's tick, cancelled
    // timers of a replaced office) runs now, as the loop would run it.
    Application::Get().Reschedule();
    Application::Get().ResetQuit();
    DrainAlpha();
    return 0;
}
