// Measuring a chart through the measuring-device server: nxcolor connects to
// "LumaServer" (started from the registry when it does not run), locks it,
// triggers and reads N measurements and disconnects.
#ifndef NXCOLOR_MEASURE_H_
#define NXCOLOR_MEASURE_H_

#include <string>

#include "spectra_csv.h"

class ProgressListener;

namespace nxcolor {

// Appends `count` measured spectra to *table (reflectance = value / 100000).
// False, with the reason in *error, when the server cannot be reached or
// refuses; what was measured until then stays in *table.
bool MeasureThroughServer(int count, SpectraTable* table, std::string* error,
                          ProgressListener* progress);

}  // namespace nxcolor

#endif  // NXCOLOR_MEASURE_H_
