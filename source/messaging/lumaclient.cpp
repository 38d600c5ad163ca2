// Measuring through LumaServer; see nxbase/lumaclient.h.
#include "nxbase/lumaclient.h"

#include "nxbase/msgcat.h"
#include "nxbase/postoffice.h"
#include "nxbase/progress.h"

namespace nxbase {
namespace {

constexpr const char* kServer = "LumaServer";

class Exchange {
  public:
    Exchange(PostOffice& office, boost::function<bool()> keepWaiting, std::string* error)
        : amOffice(office), fKeepWaiting(std::move(keepWaiting)), pError(error) {}

    bool Send(int message, MyMemoryBlock& request, MyMemoryBlock& answer) {
        const unsigned char sent =
            fKeepWaiting ? amOffice.SendAndReceive(kServer, message, request, answer, fKeepWaiting)
                         : amOffice.SendAndReceive(kServer, message, request, answer);
        if (!sent) *pError = std::string("no answer from LumaServer to ") + MessageName(message);
        return sent != 0;
    }

    // One exchange that must be answered with status 0.
    bool Ask(int message, MyMemoryBlock& request, MyMemoryBlock& answer) {
        if (!Send(message, request, answer)) return false;
        signed char status = -1;
        answer >> status;
        if (status != 0) {
            *pError = std::string("LumaServer answered ") + MessageName(message) + " with status " +
                      std::to_string(status);
            return false;
        }
        return true;
    }

    bool MeasureOne(std::vector<MeasuredSpectrum>* out) {
        MyMemoryBlock none, measured, spectrum;
        if (!Ask(EXEC_MEASUREMENT, none, measured)) return false;
        if (!Ask(SPECTRUM_REQUEST, none, spectrum)) return false;
        String id;
        int count = 0;
        spectrum >> id >> count;
        MeasuredSpectrum result;
        if (count != static_cast<int>(result.values.size())) {
            *pError = "LumaServer sent a spectrum of " + std::to_string(count) + " values";
            return false;
        }
        result.id = id.str();
        for (float& value : result.values) {
            int scaled = 0;
            spectrum >> scaled;
            value = static_cast<float>(scaled / kLumaSpectrumScale);
        }
        if (spectrum.ReadPastEnd()) {
            *pError = "LumaServer sent a short spectrum";
            return false;
        }
        out->push_back(std::move(result));
        return true;
    }

    PostOffice& Office() { return amOffice; }

  private:
    PostOffice& amOffice;
    boost::function<bool()> fKeepWaiting;
    std::string* pError;
};

}  // namespace

bool MeasureWithLumaServer(PostOffice& axOffice, int alCount, std::vector<MeasuredSpectrum>* pOut,
                           std::string* pError, ProgressListener* pProgress,
                           boost::function<bool()> fKeepWaiting) {
    Exchange exchange(axOffice, fKeepWaiting, pError);
    MyMemoryBlock level, answer, none;
    level << static_cast<unsigned char>(2);
    if (!exchange.Send(CONNECT, level, answer)) {
        *pError = "LumaServer cannot be reached";
        return false;
    }
    MyMemoryBlock lock;
    lock << static_cast<unsigned char>(0);
    bool ok = exchange.Ask(LOCK, lock, answer);
    for (int i = 0; ok && i < alCount; ++i) {
        if (pProgress && pProgress->IsAborted()) {
            *pError = "the measurement was aborted";
            ok = false;
            break;
        }
        ok = exchange.MeasureOne(pOut);
        if (pProgress) pProgress->DisplayProgress(static_cast<double>(i + 1) / alCount);
    }
    MyMemoryBlock unlockAnswer;
    std::string ignored;
    Exchange closing(axOffice, fKeepWaiting, &ignored);
    closing.Send(UNLOCK, none, unlockAnswer);
    axOffice.Send(kServer, DISCONNECT, none);
    return ok;
}

}  // namespace nxbase
