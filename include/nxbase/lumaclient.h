// Measuring through the measuring-device server LumaServer with a post
// office: connect (the server is started from the registry when it does not
// run), lock it, trigger and read N measurements, unlock and disconnect.
//
// A measurement is right or it fails. Inside the conversation (after CONNECT)
// no send starts the server: a server that was lost and started anew would
// measure from the first patch again and know nothing of the lock. Losing it
// ends the measurement with "LumaServer was lost at patch i of N", and each
// EXEC_MEASUREMENT answer's patch index must follow the one before.
#ifndef NXBASE_LUMACLIENT_H_
#define NXBASE_LUMACLIENT_H_

#include <array>
#include <boost/function.hpp>
#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/spectralgrid.h"

class MyMemoryBlock;
class PostOffice;
class ProgressListener;

namespace nxbase {

// LumaServer sends reflectance factors as integers of 1/100000.
constexpr double kLumaSpectrumScale = 100000.0;

struct NXBASE_EXPORT MeasuredSpectrum {
    std::string id;                             // the patch the server measured
    std::array<float, kSpectrumSize> values{};  // 380..730 nm, reflectance factors
};

// The protocol level in CONNECT's answer (one byte: the level both sides
// speak, at most 3); -1 when the answer holds none.
NXBASE_EXPORT int ProtocolLevel(const MyMemoryBlock& axConnectAnswer);

// What an EXEC_MEASUREMENT answer says after its status byte: the patch
// measured and its index in the server's chart. False (with the reason) for
// a malformed answer.
struct NXBASE_EXPORT MeasurementTrigger {
    std::string id;
    int index = -1;
};
NXBASE_EXPORT bool DecodeMeasurementAnswer(MyMemoryBlock& axAnswer, MeasurementTrigger* pOut,
                                           std::string* pError);

// Reads a SPECTRUM_REQUEST answer after its status byte: the patch id, the
// number of values (36) and the values in 1/100000. False (with the reason)
// for a malformed or short answer, or a value beyond kMaxPlausibleReflectance;
// *pOut is then unchanged.
NXBASE_EXPORT bool DecodeSpectrumAnswer(MyMemoryBlock& axAnswer, MeasuredSpectrum* pOut,
                                        std::string* pError);

// Appends `count` measurements to *out. False, with the reason in *error,
// when `count` is below 1, when the server cannot be reached, refuses, is lost, measures a patch
// out of turn or sends a malformed spectrum; what was measured until then stays in *out.
// `keepWaiting`, when given, is asked while each answer is awaited (false gives up); without it the
// post office's own waiting rules apply. A progress listener that says it was aborted stops the
// measurement before the next patch.
//
// It sends CONNECT first and DISCONNECT last: the server counts each
// application's CONNECTs and ends one second after the last is matched, so a
// part of the same application that subscribes to notices (NOTIFY_MESSUNG)
// sends its own CONNECT and keeps the server for as long as it stays.
NXBASE_EXPORT bool MeasureWithLumaServer(PostOffice& axOffice, int alCount,
                                         std::vector<MeasuredSpectrum>* pOut, std::string* pError,
                                         ProgressListener* pProgress = nullptr,
                                         boost::function<bool()> fKeepWaiting = {});

// The same measurement on the event loop, for GUI applications: Start()
// returns at once, `onPatch` is called with each spectrum as it comes
// (patch numbers from 1), and `onDone` once at the end with the outcome.
// Abort() ends it before the next request (onDone then says so); a count
// below 1 is refused through onDone at once. Destroying
// the session ends it without calling back; the server is unlocked and
// disconnected in every case, unless it was lost.
class NXBASE_EXPORT MeasurementSession {
  public:
    using PatchFunction = std::function<void(const MeasuredSpectrum&, int alPatch, int alCount)>;
    using DoneFunction = std::function<void(bool abOk, const std::string& asError)>;

    MeasurementSession(PostOffice& axOffice, int alCount, PatchFunction fOnPatch,
                       DoneFunction fOnDone,
                       std::chrono::milliseconds answerTimeout = std::chrono::seconds(30));
    ~MeasurementSession();
    MeasurementSession(const MeasurementSession&) = delete;
    MeasurementSession& operator=(const MeasurementSession&) = delete;

    void Start();
    void Abort();
    bool IsRunning() const;

  private:
    struct State;
    std::shared_ptr<State> pmState;
};

}  // namespace nxbase

#endif  // NXBASE_LUMACLIENT_H_
