#include "nxbase/plotaxis.h"

#include <algorithm>
#include <cmath>

namespace nxbase {

PlotAxis NiceAxis(double alLow, double alHigh, int alMaxSteps) {
    if (!std::isfinite(alHigh - alLow)) return {};
    double low = std::min(alLow, alHigh), high = std::max(alLow, alHigh);
    if (high == low) {
        low -= 0.5;
        high += 0.5;
    }
    // A range around zero needs two steps whatever their size.
    const double steps = std::max(alMaxSteps, 2);
    const double power = std::pow(10.0, std::floor(std::log10((high - low) / steps)));
    PlotAxis axis;
    // From the power of ten below the plain step up: the first that fits
    // (at the latest a step as large as the range, twice over).
    for (int i = 0; i < 9; ++i) {
        axis.step = (i % 3 == 0 ? 1.0 : i % 3 == 1 ? 2.0 : 5.0) * power * std::pow(10.0, i / 3);
        axis.low = std::floor(low / axis.step) * axis.step;
        axis.high = std::ceil(high / axis.step) * axis.step;
        if ((axis.high - axis.low) / axis.step <= steps + 1e-9) break;
    }
    return axis;
}

}  // namespace nxbase
