// Fuzz target: the reader of installed colorimetry tables (illuminants and
// density standards) must reject any bytes with a message, never crash or hang.
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "csvtable.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    klume::cmetry::detail::CsvTable table;
    std::string error;
    if (klume::cmetry::detail::ParseCsvTable(text, "fuzz.csv", 2, table, error)) {
        // A table that parses keeps its invariants.
        if (table.columns.size() < 2 || table.wavelengths.size() < 2) __builtin_trap();
        for (const auto& column : table.values) {
            if (column.size() != table.wavelengths.size()) __builtin_trap();
        }
        for (std::size_t i = 1; i < table.wavelengths.size(); ++i) {
            if (!(table.wavelengths[i] > table.wavelengths[i - 1])) __builtin_trap();
        }
    } else if (error.empty()) {
        __builtin_trap();
    }
    return 0;
}
