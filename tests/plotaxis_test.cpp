// Plot axes over random ranges of every magnitude, against what a reader
// expects of one: the range inside, few steps, a step of 1, 2 or 5 times a
// power of ten, ends on the grid, and no finer step that would also do.
#include "nxbase/plotaxis.h"

#include <gtest/gtest.h>

#include <cmath>
#include <random>
#include <string>

namespace {

// The mantissa of a step: 1, 2 or 5 (0 when it is none of them).
int Mantissa(double step) {
    const double m = step / std::pow(10.0, std::floor(std::log10(step)));
    for (int nice : {1, 2, 5, 10})
        if (std::fabs(m - nice) < 1e-9 * nice) return nice == 10 ? 1 : nice;
    return 0;
}

bool OnGrid(double value, double step) {
    const double k = value / step;
    return std::fabs(k - std::round(k)) < 1e-6;
}

TEST(PlotAxis, TakesInAnyRangeOnTheFewestNiceSteps) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_real_distribution<double> unit(0.0, 1.0);
    for (int round = 0; round < 20000; ++round) {
        const double scale = std::pow(10.0, std::floor(unit(random) * 24) - 12);
        const double a = (unit(random) - 0.5) * 4 * scale, b = a + unit(random) * scale;
        const int steps = 2 + static_cast<int>(random() % 20);
        const nxbase::PlotAxis axis = nxbase::NiceAxis(round % 2 ? a : b, round % 2 ? b : a, steps);
        const double slack = 1e-9 * axis.step;
        ASSERT_LE(axis.low, a + slack) << a << ".." << b << " in " << steps;
        ASSERT_GE(axis.high, b - slack) << a << ".." << b << " in " << steps;
        ASSERT_NE(Mantissa(axis.step), 0) << axis.step;
        ASSERT_TRUE(OnGrid(axis.low, axis.step) && OnGrid(axis.high, axis.step)) << axis.step;
        ASSERT_LE((axis.high - axis.low) / axis.step, steps + 1e-6) << a << ".." << b;
        // The next finer nice step would need more than `steps` steps.
        const int m = Mantissa(axis.step);
        const double finer = axis.step * (m == 1 ? 0.5 : m == 2 ? 0.5 : 0.4);
        ASSERT_GT(std::ceil(b / finer - 1e-9) - std::floor(a / finer + 1e-9), steps - 1e-6)
            << a << ".." << b << " could take steps of " << finer;
    }
}

TEST(PlotAxis, EmptyAndUnusableRangesGiveAnAxisStill) {
    const nxbase::PlotAxis around = nxbase::NiceAxis(3.0, 3.0);
    EXPECT_LE(around.low, 3.0);
    EXPECT_GE(around.high, 3.0);
    EXPECT_GT(around.high, around.low);
    for (double bad : {NAN, INFINITY, -INFINITY}) {
        const nxbase::PlotAxis axis = nxbase::NiceAxis(0.0, bad);
        EXPECT_EQ(axis.low, 0.0);
        EXPECT_EQ(axis.high, 1.0);
        EXPECT_EQ(axis.step, 0.1);
    }
    EXPECT_EQ(nxbase::NiceAxis(-1e308, 1e308).high, 1.0);  // wider than a double holds
    const nxbase::PlotAxis reflectance = nxbase::NiceAxis(0.0, 1.0, 12);
    EXPECT_DOUBLE_EQ(reflectance.step, 0.1);
    EXPECT_DOUBLE_EQ(reflectance.high, 1.0);
}

}  // namespace
