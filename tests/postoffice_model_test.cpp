// A seeded random walk through the post office's requests: blocking and
// asynchronous sends to three real peer processes, answers on time and late,
// waits given up by time-out and by keep-waiting functions, peers killed and
// started again by the next send, the session bus killed and started again,
// and the post office closed and made anew, between steps or from a handler
// while a send waits. Every request carries its own id, which
// its peer echoes, so that the model is simple: an answer handed to a
// request must carry that request's id, every asynchronous request is called
// back exactly once, and a blocking wait that was not given up and whose
// peer was not killed is answered. $NXBASE_MODEL_SEED repeats a run,
// $NXBASE_MODEL_STEPS sets its length.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <map>
#include <random>
#include <set>
#include <string>
#include <vector>

#include "messaging_test_util.h"
#include "nxbase/dde.h"
#include "nxbase/pipe.h"
#include "nxbase/postoffice.h"
#include "test_util.h"

namespace {

using namespace std::chrono_literals;
using nxtest::RunUntil;

constexpr int kPeers = 3;
constexpr int kMessages[] = {GET_APP_VERSION, GET_DEVICE_NAME, GET_SERIE_NR};

unsigned long EnvNumber(const char* name, unsigned long fallback) {
    const char* text = std::getenv(name);
    return text && *text ? std::strtoul(text, nullptr, 10) : fallback;
}

// The request's data: the peer answers `lateMs` late with the same bytes.
MyMemoryBlock Request(int lateMs, long id) {
    MyMemoryBlock block;
    const unsigned char late[8] = {'L', 'A', 'T', 'E', static_cast<unsigned char>(lateMs), 0, 0, 0};
    block.Put(late, 8);
    block << static_cast<int>(id);
    return block;
}

long IdOf(MyMemoryBlock& answer) {
    char late[8];
    int id = -1;
    answer.Get(late, 8);
    answer >> id;
    return answer.ReadPastEnd() ? -1 : id;
}

// Kills every process running `name` (one may be starting beside the one
// that serves); false when none ran.
bool KillEvery(const std::string& name) {
    int killed = 0;
    for (int round = 0; round < 100; ++round) {
        pid_t pid = nxtest::FindProcess(name);
        if (pid == 0) break;
        killed += ::kill(pid, SIGKILL) == 0;
        ::usleep(100);
    }
    return killed > 0;
}

class PostOfficeModelTest : public ::testing::Test {
  protected:
    void SetUp() override {
        sandbox.Env("NXBASE_PEER_NAMED_AFTER_FILE", "1");
        sandbox.Env("NXBASE_PEER_DIES_WITH_PARENT", "1");
        sandbox.RegisterAbsentServer();
        for (int p = 0; p < kPeers; ++p) {
            std::string path = sandbox.CopyProgram(NXBASE_PIPE_PEER, "model" + std::to_string(p));
            peers.push_back(path.substr(path.rfind('/') + 1));
            sandbox.Register("Software\\K-Lume\\ChromaLink\\Applications", peers.back().c_str(),
                             path);
        }
        haveBus = sandbox.StartBus();
        Application::Get().ResetQuit();
    }
    void TearDown() override {
        NxSingleton::DeleteAllSingleton();
        for (const std::string& peer : peers) KillEvery(peer);
        sandbox.StopBus();
        while (::waitpid(-1, nullptr, 0) > 0) {
        }
    }

    nxtest::MessagingSandbox sandbox{"model"};
    std::vector<std::string> peers;
    bool haveBus = false;
};

TEST_F(PostOfficeModelTest, EveryAnswerReachesTheRequestItBelongsTo) {
    const unsigned long seed = EnvNumber("NXBASE_MODEL_SEED", std::random_device{}());
    const long steps =
        static_cast<long>(EnvNumber("NXBASE_MODEL_STEPS", nxtest::kSanitized ? 20000 : 100000));
    SCOPED_TRACE("NXBASE_MODEL_SEED=" + std::to_string(seed));
    // At once, so that a run that hangs and is killed still names its seed.
    std::printf("NXBASE_MODEL_SEED=%lu\n", seed);
    std::fflush(stdout);
    std::mt19937_64 random(seed);
    auto chance = [&](double p) { return std::uniform_real_distribution<>(0, 1)(random) < p; };
    auto below = [&](int n) { return static_cast<int>(random() % static_cast<unsigned>(n)); };

    struct Reopener {
        long Reopen(void*) {
            PostOffice::CreatePostOffice("Model");
            ++made;
            return 0;
        }
        int made = 0;
    } reopener;
    PostOffice* office = nullptr;
    int losses = 0;
    std::map<long, int> calls;  // asynchronous request id -> call-backs
    std::set<long> dropped;     // pending when their office was closed: called at most once
    // The office closed and made anew, between steps or from a handler that
    // the next wait runs, as a window closed and opened again.
    int seen = 0;  // offices made so far that the walk knows of (a new one may reuse the address)
    auto reopened = [&] {
        if (reopener.made == seen) return false;
        seen = reopener.made;
        office = PostOffice::Instance();
        office->AddPeerLostFunction([&](const std::string&) { ++losses; });
        for (const auto& [id, count] : calls)
            if (count == 0) dropped.insert(id);
        return true;
    };
    Timer reopen;
    reopen.SetTimeoutHdl(LINK(Reopener, &reopener, Reopen));
    reopener.Reopen(nullptr);
    reopened();
    long answered = 0, givenUp = 0, wrong = 0, kills = 0, reopens = 0, blockingUnanswered = 0,
         busLosses = 0;
    auto start = std::chrono::steady_clock::now();
    for (long id = 0; id < steps && !HasFailure(); ++id) {
        const int peer = below(kPeers);
        const int message = kMessages[below(3)];
        const int late = chance(0.05) ? 1 + below(8) : 0;
        const int op = below(100);
        reopened();     // a wait in the step before may have run the closing timer
        if (op < 45) {  // blocking, given up now and then
            const bool giveUp = chance(0.1);
            auto until = std::chrono::steady_clock::now() + std::chrono::milliseconds(below(6));
            MyMemoryBlock send = Request(late, id), answer;
            bool ok = office->SendAndReceive(peers[peer], message, send, answer, [&] {
                return !giveUp || std::chrono::steady_clock::now() < until;
            });
            if (reopened() && !ok) {
                ++givenUp;  // its office was closed while it waited
            } else if (ok) {
                ++answered;
                long got = IdOf(answer);
                if (got != id) ++wrong;
                EXPECT_EQ(got, id) << "blocking request " << id << " to " << peers[peer];
            } else if (giveUp) {
                ++givenUp;
            } else {
                ++blockingUnanswered;
                ADD_FAILURE() << "blocking request " << id
                              << " unanswered: " << office->GetLastError();
            }
        } else if (op < 90) {  // asynchronous, some with a short time-out
            auto timeout = chance(0.1) ? std::chrono::milliseconds(1 + below(8)) : 5000ms;
            calls.emplace(id, 0);
            auto done = [&, id](AnswerResult& result) {
                ++calls[id];
                if (!result.answered) {
                    ++givenUp;
                    return;
                }
                ++answered;
                long got = IdOf(result.data);
                if (got != id) ++wrong;
                EXPECT_EQ(got, id) << "asynchronous request " << id;
            };
            office->SendAndReceiveAsync(peers[peer], message, Request(late, id), done, timeout);
        } else if (op < 98) {  // the loop turns a while
            auto until = std::chrono::steady_clock::now() + std::chrono::microseconds(below(2000));
            while (std::chrono::steady_clock::now() < until)
                Application::Get().RunOneFor(std::chrono::ceil<std::chrono::milliseconds>(
                    until - std::chrono::steady_clock::now()));
            reopened();
        } else if (op < 99) {  // the office closes, now or during the next wait
            ++reopens;
            if (chance(0.5)) {
                reopener.Reopen(nullptr);
                reopened();
            } else {
                reopen.SetTimeout(static_cast<unsigned long>(1 + below(3)));
                reopen.Start();
            }
        } else if (haveBus && chance(0.02)) {  // the session bus dies, or comes back
            if (sandbox.BusRunning()) {
                sandbox.StopBus();
                ++busLosses;
            } else {
                ASSERT_TRUE(sandbox.StartBus());
            }
        } else if (chance(0.1)) {  // a peer dies; the next send starts it again
            // Until the loss is seen: a queued asynchronous send may start
            // the peer again at once.
            const int before = losses;
            const bool connected = Pipe::Instance()->HasChannel(peers[peer]);
            if (KillEvery(peers[peer])) {
                ++kills;
                if (connected) RunUntil([&] { return losses > before; }, 5s);
            }
        }
    }
    reopen.Stop();
    auto allCalled = [&] {
        for (const auto& [id, count] : calls)
            if (count == 0 && dropped.count(id) == 0) return false;
        return true;
    };
    ASSERT_TRUE(RunUntil(allCalled, 30s));
    // Every process on the bus again once it is back.
    if (haveBus) {
        if (!sandbox.BusRunning()) {
            ASSERT_TRUE(sandbox.StartBus());
        }
        EXPECT_TRUE(RunUntil([] { return DDE::Instance()->IsActive(); }, 40s));
    }
    RunUntil([] { return false; }, 50ms);  // nobody called twice
    for (const auto& [id, count] : calls) {
        EXPECT_LE(count, 1) << "asynchronous request " << id;
        if (dropped.count(id) == 0) {
            EXPECT_EQ(count, 1) << "asynchronous request " << id;
        }
    }
    auto took = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
    std::printf(
        "seed %lu: %ld steps in %.1f s, %ld answered, %ld given up, %ld peers killed, %ld "
        "offices closed, %ld bus losses\n",
        seed, steps, took, answered, givenUp, kills, reopens, busLosses);
    EXPECT_EQ(wrong, 0);
    EXPECT_EQ(blockingUnanswered, 0);
    EXPECT_GT(answered, steps / 2);
}

}  // namespace
