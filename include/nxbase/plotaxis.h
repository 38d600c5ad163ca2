// The value axis of a plot: ends and grid step that a reader takes in at a
// glance, as 0, 0.2, 0.4, ... rather than 0, 0.17, 0.34, ...
#ifndef NXBASE_PLOTAXIS_H_
#define NXBASE_PLOTAXIS_H_

#include "nxbase/export.h"

namespace nxbase {

struct PlotAxis {
    double low = 0.0;
    double high = 1.0;
    double step = 0.1;
};

// An axis that takes in [alLow, alHigh] (in either order) with steps of 1, 2
// or 5 times a power of ten, at most `alMaxSteps` of them (at least 2: a
// range around zero needs two), and
// ends on multiples of the step. An empty range is widened to one unit
// around its value; a range with an end that is not finite, or wider than a
// double holds, gives 0..1 in steps of 0.1.
NXBASE_EXPORT PlotAxis NiceAxis(double alLow, double alHigh, int alMaxSteps = 12);

}  // namespace nxbase

#endif  // NXBASE_PLOTAXIS_H_
