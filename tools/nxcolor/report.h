// What nxcolor prints: quantities computed per spectrum (XYZ, Lab, LCh,
// DIN99, ...) collected into a report, and the writers that lay a report out
// (aligned table, CSV). A new quantity is one more entry of Quantities(); a new
// layout one more entry of Writers(). Single-threaded (DIN99 switches the
// process-wide Lab type while it computes).
#ifndef NXCOLOR_REPORT_H_
#define NXCOLOR_REPORT_H_

#include <array>
#include <functional>
#include <map>
#include <ostream>
#include <string>
#include <vector>

#include "nxbase/colorvector.h"
#include "nxbase/progress.h"
#include "spectra_csv.h"

namespace nxcolor {

struct Column {
    enum class Kind { kNumber, kHexColor };
    std::string name;   // "X", "L*", ...
    std::string cgats;  // the CGATS field name: "XYZ_X", "LAB_L", ...
    int precision = 4;  // decimals
    // A column whose precision is its own, not the report's (screen levels).
    bool ownPrecision = false;
    // kHexColor: the value is 0xRRGGBB, printed "#RRGGBB".
    Kind kind = Kind::kNumber;
};

// One quantity: its columns and how to compute them from a spectrum under a
// measuring condition (pOut receives one float per column).
struct Quantity {
    std::string key;  // "xyz", "xyy", "lab", "lch", "din99", "density"
    std::vector<Column> columns;
    std::function<void(const ReflectanceSpectrum&, const MeasuringCondition&, float* pOut)> compute;
    // The same from XYZ and CIE 1976 Lab computed at a fine grid's own
    // interval; empty for quantities that need the 36-point spectrum.
    std::function<void(const std::array<double, 3>& xyz, const std::array<double, 3>& lab,
                       const MeasuringCondition&, float* pOut)>
        fromColour;
};

// Every quantity nxcolor knows, in output order.
const std::vector<Quantity>& Quantities();

struct ReportRow {
    std::string id;        // id and name joined
    std::string sampleId;  // as the input gave them (CGATS SAMPLE_ID, SAMPLE_NAME)
    std::string sampleName;
    std::array<float, kSpectrumSize> spectrum{};
    std::vector<float> values;  // one per column of the report
};

struct Report {
    std::string source;           // file name or the built-in chart's name
    std::string illuminant;       // "D65"
    std::string observer;         // "10"
    std::string densityStandard;  // "Status T" (used by the density columns)
    std::vector<Column> columns;
    std::vector<ReportRow> rows;
    // Rows left out because a value came out infinite or not a number,
    // "<source>:<line>: <what>".
    std::vector<std::string> errors;
    // CGATS: also write the spectra (SPEC_380..SPEC_730), making the output a
    // measurement file other software reads back.
    bool keepSpectra = false;
    std::string created;  // ISO 8601 time of the run; empty: now
    std::string originator = "nxcolor";
};

// Computes `quantities` (keys of Quantities(), in that order) for every row,
// reporting the share of rows done to `progress` when given. A row whose
// values are not all finite (densities aside, which are NaN where nothing is
// reflected) is left out and named in the report's errors.
Report Evaluate(const SpectraTable& table, const std::string& source,
                const MeasuringCondition& condition, const std::vector<std::string>& quantities,
                int precision, ProgressListener* progress = nullptr);

using Writer = std::function<void(const Report&, std::ostream&)>;
// Layouts by name: "table" (aligned columns, a "#" title line), "csv" and
// "cgats" (CGATS.17 text with the standard field names).
const std::map<std::string, Writer>& Writers();

// A number with `precision` decimals and "." as separator, whatever the locale.
std::string FormatNumber(float value, int precision);
// A cell of `column`: FormatNumber, or "#RRGGBB" for a colour column.
std::string FormatCell(float value, const Column& column);

}  // namespace nxcolor

#endif  // NXCOLOR_REPORT_H_
