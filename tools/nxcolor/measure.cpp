#include "measure.h"

#include <stdexcept>

#include "nxbase/lumaclient.h"
#include "nxbase/poapps.h"
#include "nxbase/postoffice.h"

namespace nxcolor {

bool MeasureThroughServer(int count, SpectraTable* table, std::string* error,
                          ProgressListener* progress) {
    PostOffice* office = nullptr;
    try {
        office = PostOffice::CreatePostOffice("nxcolor");
    } catch (const std::exception& failure) {
        *error = std::string(failure.what()) + " (" + nxbase::ServerRegistrationHint() + ")";
        return false;
    }
    std::vector<nxbase::MeasuredSpectrum> measured;
    const bool ok = nxbase::MeasureWithLumaServer(*office, count, &measured, error, progress);
    for (const nxbase::MeasuredSpectrum& spectrum : measured) {
        SpectrumRow row;
        row.id = spectrum.id;
        row.sampleId = spectrum.id;
        row.values = spectrum.values;
        table->rows.push_back(std::move(row));
    }
    NxSingleton::DeleteAllSingleton();
    return ok;
}

}  // namespace nxcolor
