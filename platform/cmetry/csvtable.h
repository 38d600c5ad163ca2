// Reader of the numeric CSV tables installed in the data directory (one
// header row, "," between fields, "." decimals, "\n" or "\r\n" line ends).
// Pure functions of their input; any thread may call them.
#ifndef KLUME_CMETRY_CSVTABLE_H_
#define KLUME_CMETRY_CSVTABLE_H_

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

#include "nxbase/export.h"

namespace klume {
namespace cmetry {
namespace detail {

// Limits of an installed table.
constexpr std::size_t kMaxTableBytes = 1 << 20;
constexpr std::size_t kMaxTableLineLength = 1024;
constexpr std::size_t kMaxTableRows = 10000;
constexpr std::size_t kMaxTableColumns = 16;

struct CsvTable {
    std::vector<std::string> columns;         // header names, column 0 "wavelength"
    std::vector<double> wavelengths;          // strictly ascending, finite
    std::vector<std::vector<double>> values;  // values[column - 1][row], finite
};

// Parses `text` into `table`. The header must start with "wavelength" and
// have between 2 and kMaxTableColumns columns, at least `minColumns`; every
// row as many finite numbers (read without locale), wavelengths strictly
// ascending; at least two rows. Blank lines are skipped. On failure returns
// false with "<source>: line <n>: <reason>: <text>" in `error`.
NXBASE_EXPORT bool ParseCsvTable(std::string_view text, const std::string& source,
                                 std::size_t minColumns, CsvTable& table, std::string& error);

// Reads a whole file of at most kMaxTableBytes into `text`; false with a
// message in `error` when it is missing, unreadable or too large.
bool ReadTableFile(const std::string& path, std::string& text, std::string& error);

}  // namespace detail
}  // namespace cmetry
}  // namespace klume

#endif  // KLUME_CMETRY_CSVTABLE_H_
