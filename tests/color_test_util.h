// Helpers for the colour tests: the ColorChecker chart shipped with nxcolor
// and its reference values, read without locale.
#ifndef NXBASE_TESTS_COLOR_TEST_UTIL_H_
#define NXBASE_TESTS_COLOR_TEST_UTIL_H_

#include <charconv>
#include <cstdlib>
#include <limits>
#include <string>
#include <vector>

#ifdef NXCOLOR_PATH
#include <sys/wait.h>
#endif

#include "test_util.h"

namespace nxtest {

// Tolerances of the colour tests, each named by why it is what it is.
// The same double-precision formula evaluated along another path.
constexpr double kDoubleReordered = 1e-12;
// Double sums of a few hundred terms against the same terms summed in another order.
constexpr double kDoubleSumReordered = 1e-9;
// A few units in the last place of a float below 1.
constexpr double kFloatNearOne = 5e-7;
// A few units in the last place of a float below 16.
constexpr double kFloatNearTen = 1e-6;
// A float interpolation of values below 1 whose weights are rounded to float.
constexpr double kFloatInterpolation = 1e-5;
// Single-precision formulas (sums of 36 products, cube roots, logarithms,
// square roots) with results up to about 100.
constexpr double kFloatAtHundred = 1e-4;
// The same, through one more stage (a matrix, a series, a difference of two such results).
constexpr double kFloatTwoStagesAtHundred = 1e-3;
// A hue difference from the difference of two chromas of 50 in float: the
// cancellation leaves a thousandth.
constexpr double kFloatCancellation = 2e-3;
// A 36-term float sum near 100 against the double sum of the same terms.
constexpr double kFloatSumAgainstDouble = 5e-4;
// Values published (or worked out by hand) to 7, 4, 3 and 2 decimals.
constexpr double kPublished7Decimals = 1e-6;
constexpr double kPublished4Decimals = 1e-4;
constexpr double kPublished3Decimals = 1e-3;
constexpr double kPublished2Decimals = 0.01;
// Written to a file with 2 decimals of percent or 5 decimals of a fraction.
constexpr double kFileDecimals = 5e-5;
// D50 chromaticity from the 10 nm tables against the values published for 5 nm ones.
constexpr double kChromaticityOfGrid = 5e-4;
// X of the D65 white from the 10 nm tables against the 95.04 of the 5 nm ones.
constexpr double kWhiteOfGrid = 0.05;
// Colours against ArgyllCMS's own spectral integration (finer tables).
constexpr double kOtherIntegration = 0.01;
// One display level of 8-bit screen RGB on the 0..100 scale (100 / 255).
constexpr double kOneDisplayLevel = 1.0;

// One CSV row: the text fields and the numbers after the first two fields.
struct CsvRow {
    std::string id;
    std::string name;
    std::vector<double> values;
};

// Rows of a "patch_index,patch_name,v,v,..." file after its header; an
// unparsable number becomes NaN (and fails the comparisons that read it).
inline std::vector<CsvRow> ReadPatchCsv(const std::string& asPath) {
    std::vector<CsvRow> rows;
    for (const std::vector<std::string>& fields : ReadCsvRows(asPath)) {
        CsvRow& row = rows.emplace_back();
        row.id = fields.at(0);
        row.name = fields.at(1);
        for (std::size_t i = 2; i < fields.size(); ++i) {
            double v = std::numeric_limits<double>::quiet_NaN();
            std::from_chars(fields[i].data(), fields[i].data() + fields[i].size(), v);
            row.values.push_back(v);
        }
    }
    return rows;
}

inline std::string ChartPath() {
    return std::string(NXBASE_SOURCE_DIR) +
           "/tools/nxcolor/data/colorchecker_babelcolor_average.csv";
}

inline std::string ChartReferencePath() {
    return std::string(NXBASE_TEST_DATA_DIR) + "/colorchecker_D50_2deg.csv";
}

#ifdef NXCOLOR_PATH
// Runs nxcolor with a shell command line, its user configuration in a
// temporary directory; returns the exit status and fills the outputs.
inline int RunNxcolor(const std::string& args, std::string* out, std::string* err) {
    TempDir dir;
    ScopedEnv config("XDG_CONFIG_HOME", dir.path().string());
    const std::string command =
        std::string(NXCOLOR_PATH) + " " + args + " >" + dir.File("out") + " 2>" + dir.File("err");
    const int status = std::system(command.c_str());
    *out = ReadFile(dir.File("out"));
    *err = ReadFile(dir.File("err"));
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}
#endif

}  // namespace nxtest

#endif  // NXBASE_TESTS_COLOR_TEST_UTIL_H_
