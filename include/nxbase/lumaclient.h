// Measuring through the measuring-device server LumaServer with a post
// office: connect (the server is started from the registry when it does not
// run), lock it, trigger and read N measurements, unlock and disconnect.
#ifndef NXBASE_LUMACLIENT_H_
#define NXBASE_LUMACLIENT_H_

#include <array>
#include <boost/function.hpp>
#include <string>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/spectralgrid.h"

class PostOffice;
class ProgressListener;

namespace nxbase {

// LumaServer sends reflectance factors as integers of 1/100000.
constexpr double kLumaSpectrumScale = 100000.0;

struct NXBASE_EXPORT MeasuredSpectrum {
    std::string id;                             // the patch the server measured
    std::array<float, kSpectrumSize> values{};  // 380..730 nm, reflectance factors
};

// Appends `count` measurements to *out. False, with the reason in *error,
// when the server cannot be reached, refuses or sends a malformed spectrum;
// what was measured until then stays in *out. `keepWaiting`, when given,
// is asked while each answer is awaited (false gives up); without it the
// post office's own waiting rules apply. A progress listener that says it
// was aborted stops the measurement before the next patch.
//
// It sends CONNECT first and DISCONNECT last: the server counts each
// application's CONNECTs and ends one second after the last is matched, so a
// part of the same application that subscribes to notices (NOTIFY_MESSUNG)
// sends its own CONNECT and keeps the server for as long as it stays.
NXBASE_EXPORT bool MeasureWithLumaServer(PostOffice& axOffice, int alCount,
                                         std::vector<MeasuredSpectrum>* pOut, std::string* pError,
                                         ProgressListener* pProgress = nullptr,
                                         boost::function<bool()> fKeepWaiting = {});

}  // namespace nxbase

#endif  // NXBASE_LUMACLIENT_H_
