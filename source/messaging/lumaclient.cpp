// Measuring through LumaServer; see nxbase/lumaclient.h.
#include "nxbase/lumaclient.h"

#include <cmath>

#include "nxbase/msgcat.h"
#include "nxbase/postoffice.h"
#include "nxbase/progress.h"
#include "nxbase/strhelp.h"

namespace nxbase {
namespace {

constexpr const char* kServer = "LumaServer";

std::string LostAt(int alPatch, int alCount) {
    return "LumaServer was lost at patch " + std::to_string(alPatch) + " of " +
           std::to_string(alCount);
}

// The server measures its chart's patches in turn, wrapping to the first: a
// patch out of turn means another server, or another client, measured.
bool FollowsInTurn(int alLast, int alIndex) {
    return alLast < 0 || alIndex == alLast + 1 || (alIndex == 0 && alLast > 0);
}

// The status byte of an answer; false (with the reason) unless it is 0.
bool StatusDone(MyMemoryBlock& axAnswer, int alMessage, std::string* pError) {
    signed char status = -1;
    axAnswer >> status;
    if (!axAnswer.ReadPastEnd() && status == kDone) return true;
    *pError = std::string("LumaServer answered ") + MessageName(alMessage) +
              (axAnswer.ReadPastEnd() ? std::string(" with nothing")
                                      : " with status " + std::to_string(status));
    return false;
}

// One patch from the two answers; false (with the reason) when they do not
// fit together or do not follow the patch before.
bool TakePatch(MyMemoryBlock& axTrigger, MyMemoryBlock& axSpectrum, int& alLastIndex,
               MeasuredSpectrum* pOut, std::string* pError) {
    MeasurementTrigger trigger;
    if (!DecodeMeasurementAnswer(axTrigger, &trigger, pError)) return false;
    if (!FollowsInTurn(alLastIndex, trigger.index)) {
        *pError = "LumaServer measured patch index " + std::to_string(trigger.index) + " where " +
                  std::to_string(alLastIndex + 1) + " was next";
        return false;
    }
    alLastIndex = trigger.index;
    if (!DecodeSpectrumAnswer(axSpectrum, pOut, pError)) return false;
    if (pOut->id != trigger.id) {
        *pError = "LumaServer sent the spectrum of " + pOut->id + " for patch " + trigger.id;
        return false;
    }
    return true;
}

// Whether `axOffice` is still the process's post office (a handler may have
// destroyed it while a wait ran).
bool IsAlive(const PostOffice& axOffice) {
    return PostOffice::IsInitialized() && PostOffice::Instance() == &axOffice;
}

// Notes that the server's channel was lost, for as long as it lives.
class LossWatch {
  public:
    explicit LossWatch(PostOffice& axOffice)
        : amOffice(axOffice), amLost(std::make_shared<bool>(false)) {
        auto lost = amLost;
        amId = amOffice.AddPeerLostFunction([lost](const std::string& asPeer) {
            if (asPeer == kServer) *lost = true;
        });
    }
    ~LossWatch() {
        if (IsAlive(amOffice)) amOffice.RemovePeerLostFunction(amId);
    }
    LossWatch(const LossWatch&) = delete;
    LossWatch& operator=(const LossWatch&) = delete;
    // The notice comes through the loop: let it come first.
    bool Lost() {
        Application::Get().Reschedule();
        return *amLost;
    }

  private:
    PostOffice& amOffice;
    std::shared_ptr<bool> amLost;
    int amId = 0;
};

class Exchange {
  public:
    Exchange(PostOffice& office, boost::function<bool()> keepWaiting, std::string* error)
        : amOffice(office), fKeepWaiting(std::move(keepWaiting)), pError(error) {}

    bool Send(int message, MyMemoryBlock& request, MyMemoryBlock& answer, PeerStart start) {
        const unsigned char sent =
            fKeepWaiting
                ? amOffice.SendAndReceive(kServer, message, request, answer, fKeepWaiting,
                                          DisEnableNone, start)
                : amOffice.SendAndReceive(kServer, message, request, answer, DisEnableNone, start);
        if (!sent) {
            *pError = std::string("no answer from LumaServer to ") + MessageName(message);
            if (IsAlive(amOffice)) *pError += ": " + amOffice.GetLastError();
        }
        return sent != 0;
    }

    // One exchange inside the conversation that must be answered with status 0.
    bool Ask(int message, MyMemoryBlock& request, MyMemoryBlock& answer) {
        return Send(message, request, answer, PeerStart::kNever) &&
               StatusDone(answer, message, pError);
    }

    PostOffice& Office() { return amOffice; }

  private:
    PostOffice& amOffice;
    boost::function<bool()> fKeepWaiting;
    std::string* pError;
};

}  // namespace

int ProtocolLevel(const MyMemoryBlock& axConnectAnswer) {
    MyMemoryBlock answer(axConnectAnswer);
    unsigned char level = 0;
    answer >> level;
    return answer.ReadPastEnd() ? -1 : level;
}

bool DecodeMeasurementAnswer(MyMemoryBlock& axAnswer, MeasurementTrigger* pOut,
                             std::string* pError) {
    String id;
    int index = -1;
    axAnswer >> id >> index;
    if (axAnswer.ReadPastEnd() || index < 0) {
        *pError = "LumaServer sent a malformed EXEC_MEASUREMENT answer";
        return false;
    }
    pOut->id = id.str();
    pOut->index = index;
    return true;
}

bool DecodeSpectrumAnswer(MyMemoryBlock& axAnswer, MeasuredSpectrum* pOut, std::string* pError) {
    String id;
    int count = 0;
    axAnswer >> id >> count;
    MeasuredSpectrum result;
    if (axAnswer.ReadPastEnd()) {
        *pError = "LumaServer sent a short spectrum";
        return false;
    }
    if (count != static_cast<int>(result.values.size())) {
        *pError = "LumaServer sent a spectrum of " + std::to_string(count) + " values";
        return false;
    }
    result.id = id.str();
    for (float& value : result.values) {
        int scaled = 0;
        axAnswer >> scaled;
        value = static_cast<float>(scaled / kLumaSpectrumScale);
    }
    if (axAnswer.ReadPastEnd()) {
        *pError = "LumaServer sent a short spectrum";
        return false;
    }
    // A value no reflectance has would print as a colour far from the sample's.
    for (std::size_t k = 0; k < result.values.size(); ++k) {
        if (std::fabs(result.values[k]) > kMaxPlausibleReflectance) {
            *pError = "LumaServer sent " + StringHelpers::Shortest(result.values[k]) + " at " +
                      std::to_string(kFirstWavelength + kWavelengthStep * static_cast<int>(k)) +
                      " nm for patch " + result.id + ": not a reflectance factor";
            return false;
        }
    }
    *pOut = std::move(result);
    return true;
}

bool MeasureWithLumaServer(PostOffice& axOffice, int alCount, std::vector<MeasuredSpectrum>* pOut,
                           std::string* pError, ProgressListener* pProgress,
                           boost::function<bool()> fKeepWaiting) {
    if (alCount < 1) {
        *pError = "the number of patches must be at least 1, not " + std::to_string(alCount);
        return false;
    }
    Exchange exchange(axOffice, fKeepWaiting, pError);
    MyMemoryBlock level, answer, none;
    level << static_cast<unsigned char>(2);
    if (!exchange.Send(CONNECT, level, answer, PeerStart::kIfNeeded)) {
        *pError = "LumaServer cannot be reached: " + *pError;
        return false;
    }
    LossWatch watch(axOffice);
    MyMemoryBlock lock;
    lock << static_cast<unsigned char>(0);
    bool ok = exchange.Ask(LOCK, lock, answer);
    int patch = 1;  // the one under way
    for (int lastIndex = -1; ok && patch <= alCount; ++patch) {
        if (pProgress && pProgress->IsAborted()) {
            *pError = "the measurement was aborted";
            ok = false;
            break;
        }
        MyMemoryBlock trigger, spectrum;
        MeasuredSpectrum measured;
        ok = exchange.Ask(EXEC_MEASUREMENT, none, trigger) &&
             exchange.Ask(SPECTRUM_REQUEST, none, spectrum) &&
             TakePatch(trigger, spectrum, lastIndex, &measured, pError) && !watch.Lost();
        if (!ok) break;
        pOut->push_back(std::move(measured));
        if (pProgress) pProgress->DisplayProgress(static_cast<double>(patch) / alCount);
    }
    if (!IsAlive(axOffice)) return false;
    if (watch.Lost()) {
        if (ok) return true;  // lost after the last patch: every patch came from it
        *pError = LostAt(patch, alCount);
        return false;
    }
    // The cleanup never starts a server: a new one holds no lock of ours.
    MyMemoryBlock unlockAnswer;
    std::string ignored;
    Exchange closing(axOffice, fKeepWaiting, &ignored);
    closing.Send(UNLOCK, none, unlockAnswer, PeerStart::kNever);
    axOffice.Send(kServer, DISCONNECT, none, {}, PeerStart::kNever);
    return ok;
}

// ---- the same on the event loop ----

struct MeasurementSession::State : std::enable_shared_from_this<State> {
    PostOffice* office;
    int count;
    PatchFunction onPatch;
    DoneFunction onDone;
    std::chrono::milliseconds timeout;
    bool running = false, aborted = false, connected = false, lost = false;
    int patch = 1;  // the one under way
    int lastIndex = -1;
    int lostId = 0;
    MyMemoryBlock trigger;

    using Next = void (State::*)(MyMemoryBlock&);

    // One request; `next` gets its answer after the status byte.
    void Ask(int alMessage, PeerStart axStart, Next fNext,
             MyMemoryBlock axData = MyMemoryBlock(0)) {
        if (aborted) return Finish(false, "the measurement was aborted");
        std::weak_ptr<State> weak = shared_from_this();
        office->SendAndReceiveAsync(
            kServer, alMessage, axData,
            [weak, alMessage, fNext](AnswerResult& result) {
                auto self = weak.lock();
                if (!self || !self->running) return;
                std::string error;
                if (!result.answered) {
                    error = std::string("no answer from LumaServer to ") + MessageName(alMessage) +
                            ": " + result.error;
                } else if (alMessage == CONNECT || StatusDone(result.data, alMessage, &error)) {
                    return ((*self).*fNext)(result.data);
                }
                self->Finish(false, error);
            },
            timeout, {}, axStart);
    }
    void Connected(MyMemoryBlock&) {
        connected = true;
        std::weak_ptr<State> weak = shared_from_this();
        lostId = office->AddPeerLostFunction([weak](const std::string& asPeer) {
            if (auto self = weak.lock(); self && asPeer == kServer) self->lost = true;
        });
        MyMemoryBlock noWaitingState;
        noWaitingState << static_cast<unsigned char>(0);
        Ask(LOCK, PeerStart::kNever, &State::Measure, noWaitingState);
    }
    void Measure(MyMemoryBlock&) {
        if (patch > count) return Finish(true, std::string());
        Ask(EXEC_MEASUREMENT, PeerStart::kNever, &State::Triggered);
    }
    void Triggered(MyMemoryBlock& axAnswer) {
        trigger = std::move(axAnswer);
        Ask(SPECTRUM_REQUEST, PeerStart::kNever, &State::Spectrum);
    }
    void Spectrum(MyMemoryBlock& axAnswer) {
        MeasuredSpectrum measured;
        std::string error;
        if (lost || !TakePatch(trigger, axAnswer, lastIndex, &measured, &error))
            return Finish(false, error);
        if (onPatch) onPatch(measured, patch, count);
        if (!running) return;
        ++patch;
        MyMemoryBlock none;
        Measure(none);
    }
    // Unlocks and disconnects a server that is still there; never starts one.
    void Release() {
        if (!connected || !IsAlive(*office)) return;
        office->RemovePeerLostFunction(lostId);
        connected = false;
        if (lost) return;
        office->SendAndReceiveAsync(
            kServer, UNLOCK, MyMemoryBlock(0), [](AnswerResult&) {}, timeout, {},
            PeerStart::kNever);
        MyMemoryBlock none;
        office->Send(kServer, DISCONNECT, none, {}, PeerStart::kNever);
    }
    void Finish(bool abOk, std::string asError) {
        if (!running) return;
        running = false;
        if (!abOk && lost) asError = LostAt(patch, count);
        Release();
        if (onDone) onDone(abOk, asError);
    }
};

MeasurementSession::MeasurementSession(PostOffice& axOffice, int alCount, PatchFunction fOnPatch,
                                       DoneFunction fOnDone, std::chrono::milliseconds timeout)
    : pmState(std::make_shared<State>()) {
    pmState->office = &axOffice;
    pmState->count = alCount;
    pmState->onPatch = std::move(fOnPatch);
    pmState->onDone = std::move(fOnDone);
    pmState->timeout = timeout;
}

MeasurementSession::~MeasurementSession() {
    pmState->running = false;
    pmState->Release();
}

void MeasurementSession::Start() {
    State& state = *pmState;
    if (state.running) return;
    if (state.count < 1) {
        if (state.onDone)
            state.onDone(false, "the number of patches must be at least 1, not " +
                                    std::to_string(state.count));
        return;
    }
    state.running = true;
    state.aborted = state.lost = false;
    state.patch = 1;
    state.lastIndex = -1;
    MyMemoryBlock level;
    level << static_cast<unsigned char>(2);
    state.Ask(CONNECT, PeerStart::kIfNeeded, &State::Connected, level);
}

void MeasurementSession::Abort() {
    pmState->aborted = true;
}

bool MeasurementSession::IsRunning() const {
    return pmState->running;
}

}  // namespace nxbase
