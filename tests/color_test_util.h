// Helpers for the colour tests: the ColorChecker chart shipped with nxcolor
// and its reference values, read without locale.
#ifndef NXBASE_TESTS_COLOR_TEST_UTIL_H_
#define NXBASE_TESTS_COLOR_TEST_UTIL_H_

#include <array>
#include <charconv>
#include <cstdlib>
#include <limits>
#include <sstream>
#include <string>
#include <vector>

#ifdef NXCOLOR_PATH
#include <sys/wait.h>
#endif

#include "test_util.h"

namespace nxtest {

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
    const std::vector<std::string> lines = ReadLines(asPath);
    for (std::size_t i = 1; i < lines.size(); ++i) {  // after the header
        if (lines[i].empty()) continue;
        std::stringstream fields(lines[i]);
        CsvRow row;
        std::getline(fields, row.id, ',');
        std::getline(fields, row.name, ',');
        for (std::string field; std::getline(fields, field, ',');) {
            double v = std::numeric_limits<double>::quiet_NaN();
            std::from_chars(field.data(), field.data() + field.size(), v);
            row.values.push_back(v);
        }
        rows.push_back(row);
    }
    return rows;
}

inline std::string ChartPath() {
    return std::string(NXBASE_SOURCE_DIR) + "/tools/nxcolor/data/colorchecker_babelcolor_average.csv";
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
    const std::string command = std::string(NXCOLOR_PATH) + " " + args + " >" + dir.File("out") +
                                " 2>" + dir.File("err");
    const int status = std::system(command.c_str());
    *out = ReadFile(dir.File("out"));
    *err = ReadFile(dir.File("err"));
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}
#endif

}  // namespace nxtest

#endif  // NXBASE_TESTS_COLOR_TEST_UTIL_H_
