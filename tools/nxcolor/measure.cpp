#include "measure.h"

#include "nxbase/postoffice.h"
#include "nxbase/progress.h"

namespace nxcolor {
namespace {

constexpr const char* kServer = "LumaServer";
constexpr double kSpectrumScale = 100000.0;

// One exchange; false (with *error) unless answered with status 0.
bool Ask(PostOffice* office, int message, MyMemoryBlock& request, MyMemoryBlock& answer,
         std::string* error) {
    if (!office->SendAndReceive(kServer, message, request, answer)) {
        *error = std::string("no answer from LumaServer to ") + nxbase::MessageName(message);
        return false;
    }
    signed char status = -1;
    answer >> status;
    if (status != 0) {
        *error = std::string("LumaServer answered ") + nxbase::MessageName(message) +
                 " with status " + std::to_string(status);
        return false;
    }
    return true;
}

bool MeasureOne(PostOffice* office, SpectraTable* table, std::string* error) {
    MyMemoryBlock none, measured, spectrum;
    if (!Ask(office, EXEC_MEASUREMENT, none, measured, error)) return false;
    if (!Ask(office, SPECTRUM_REQUEST, none, spectrum, error)) return false;
    String id;
    int count = 0;
    spectrum >> id >> count;
    if (count != kSpectrumSize) {
        *error = "LumaServer sent a spectrum of " + std::to_string(count) + " values";
        return false;
    }
    SpectrumRow row;
    row.id = id.str();
    for (float& value : row.values) {
        int scaled = 0;
        spectrum >> scaled;
        value = static_cast<float>(scaled / kSpectrumScale);
    }
    if (spectrum.ReadPastEnd()) {
        *error = "LumaServer sent a short spectrum";
        return false;
    }
    table->rows.push_back(row);
    return true;
}

}  // namespace

bool MeasureThroughServer(int count, SpectraTable* table, std::string* error,
                          ProgressListener* progress) {
    PostOffice* office = PostOffice::CreatePostOffice("nxcolor");
    MyMemoryBlock level, answer, none;
    level << static_cast<unsigned char>(2);
    if (!office->SendAndReceive(kServer, CONNECT, level, answer)) {
        *error = "LumaServer cannot be reached";
        return false;
    }
    MyMemoryBlock lock;
    lock << static_cast<unsigned char>(0);
    bool ok = Ask(office, LOCK, lock, answer, error);
    for (int i = 0; ok && i < count; ++i) {
        ok = MeasureOne(office, table, error);
        if (progress) progress->DisplayProgress(static_cast<double>(i + 1) / count);
    }
    MyMemoryBlock unlockAnswer;
    office->SendAndReceive(kServer, UNLOCK, none, unlockAnswer);
    office->Send(kServer, DISCONNECT, none);
    NxSingleton::DeleteAllSingleton();
    return ok;
}

}  // namespace nxcolor
