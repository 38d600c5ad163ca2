// Fuzz target: nxcolor's spectra reader (CSV, and CGATS through LittleCMS)
// must take any bytes, keeping the good rows and naming every bad one, never
// crash or hang, and give rows only for grids that cover the visible.
#include <cmath>
#include <cstddef>
#include <cstdint>
#include <string_view>

#include "nxbase/resample.h"
#include "nxbase/spectrafile.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    const std::string_view text(reinterpret_cast<const char*>(data), size);
    const nxbase::SpectraTable table = nxbase::ParseSpectra(text, "fuzz");
    if (table.unusable && !table.rows.empty()) __builtin_trap();
    // Rows come only from a grid that covers the visible.
    if (!table.rows.empty() && !nxbase::VisibleCoverageProblem(table.sourceWavelengths).empty())
        __builtin_trap();
    for (const nxbase::SpectrumRow& row : table.rows) {
        if (row.id.empty() || row.line < 0) __builtin_trap();
        for (float v : row.values) {
            if (!std::isfinite(v)) __builtin_trap();
        }
    }
    return 0;
}
