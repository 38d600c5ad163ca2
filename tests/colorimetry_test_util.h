// Helpers of the colorimetry tests: reading the reference tables below
// tests/data/colorimetry.
#ifndef NXBASE_TESTS_COLORIMETRY_TEST_UTIL_H_
#define NXBASE_TESTS_COLORIMETRY_TEST_UTIL_H_

#include <cstdio>
#include <cstdlib>
#include <sstream>
#include <string>
#include <vector>

#include "test_util.h"

namespace nxtest {

inline std::string ColorimetryData(const std::string& name) {
    return std::string(NXBASE_TEST_DATA_DIR) + "/colorimetry/" + name;
}

// The rows of a CSV file below the header, split at ",".
inline std::vector<std::vector<std::string>> ReadCsvRows(const std::string& path) {
    std::vector<std::vector<std::string>> rows;
    const std::vector<std::string> lines = ReadLines(path);
    for (std::size_t i = 1; i < lines.size(); ++i) {
        if (lines[i].empty()) continue;
        std::vector<std::string> fields;
        std::istringstream in(lines[i]);
        for (std::string field; std::getline(in, field, ',');) fields.push_back(field);
        rows.push_back(fields);
    }
    return rows;
}

inline std::string Scientific(double value) {
    char text[32];
    std::snprintf(text, sizeof text, "%.3e", value);
    return text;
}

inline double ToDouble(const std::string& text) { return std::strtod(text.c_str(), nullptr); }

}  // namespace nxtest

#endif  // NXBASE_TESTS_COLORIMETRY_TEST_UTIL_H_
