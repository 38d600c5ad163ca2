// The spectrum view drawn offscreen: random curves, one at a time, must show
// their colour where the view says each sample lies; gaps stay empty; the
// axes take in every finite value.
#include "nxbase/qtspectrumview.h"

#include <gtest/gtest.h>

#include <QImage>
#include <cmath>
#include <random>
#include <string>

#include "qt_test_util.h"

namespace {

using nxbase::qt::SpectrumView;

// Whether a pixel within `radius` of `at` has (nearly) the colour.
bool ColourNear(const QImage& image, QPointF at, const QColor& colour, int radius = 2) {
    for (int dy = -radius; dy <= radius; ++dy) {
        for (int dx = -radius; dx <= radius; ++dx) {
            const QPoint p(static_cast<int>(std::lround(at.x())) + dx,
                           static_cast<int>(std::lround(at.y())) + dy);
            if (!image.rect().contains(p)) continue;
            const QColor c = image.pixelColor(p);
            if (std::abs(c.red() - colour.red()) + std::abs(c.green() - colour.green()) +
                    std::abs(c.blue() - colour.blue()) <
                24)
                return true;
        }
    }
    return false;
}

std::vector<double> Grid(double from, double step, int count) {
    std::vector<double> grid(static_cast<std::size_t>(count));
    for (int k = 0; k < count; ++k) grid[static_cast<std::size_t>(k)] = from + step * k;
    return grid;
}

TEST(SpectrumView, EverySampleIsDrawnWhereTheViewSaysInItsColour) {
    nxtest::QtApp();
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_real_distribution<double> unit(0.0, 1.0);
    SpectrumView view;
    view.resize(520, 340);
    for (int round = 0; round < 40; ++round) {
        const int count = 3 + static_cast<int>(random() % 80);
        const double step = round % 2 ? 10.0 : 1 + 9 * unit(random);
        SpectrumView::Curve curve{QStringLiteral("c"),
                                  Grid(360 + 40 * unit(random), step, count),
                                  {},
                                  QColor(static_cast<int>(random() % 120), 40, 200)};
        const double scale = round % 5 == 0 ? 100.0 : 1.0;  // a file in percent
        for (int k = 0; k < count; ++k) curve.values.push_back(scale * (1.2 * unit(random) - 0.1));
        view.SetCurves({curve});
        const QImage image = view.grab().toImage();
        const QRectF area = view.PlotArea();
        for (int k = 0; k < count; ++k) {
            const QPointF at = view.PointOf(curve.wavelengths[k], curve.values[k]);
            ASSERT_TRUE(area.adjusted(-0.5, -0.5, 0.5, 0.5).contains(at))
                << "sample " << k << " outside the frame";
            ASSERT_TRUE(ColourNear(image, at, curve.colour))
                << "sample " << k << " of " << count << " not drawn at " << at.x() << "," << at.y();
        }
    }
}

TEST(SpectrumView, ANonFiniteValueLeavesAGapAndTheAxesTakeInTheRest) {
    nxtest::QtApp();
    SpectrumView view;
    view.resize(520, 340);
    SpectrumView::Curve curve{QStringLiteral("gap"),
                              Grid(400, 50, 7),
                              {0.2, 0.2, 0.2, NAN, 0.2, 0.2, 1.6},
                              QColor(200, 30, 30)};
    view.SetCurves({curve});
    EXPECT_LE(view.ValueAxis().low, 0.0);
    EXPECT_GE(view.ValueAxis().high, 1.6);
    EXPECT_LE(view.WavelengthAxis().low, 400.0);
    EXPECT_GE(view.WavelengthAxis().high, 700.0);
    const QImage image = view.grab().toImage();
    EXPECT_TRUE(ColourNear(image, view.PointOf(475, 0.2), curve.colour));   // drawn between
    EXPECT_FALSE(ColourNear(image, view.PointOf(525, 0.2), curve.colour));  // the gap
    // No curves, or more than the legend names: drawn without trouble.
    view.SetCurves({});
    EXPECT_FALSE(view.grab().toImage().isNull());
    view.SetCurves(std::vector<SpectrumView::Curve>(30, curve));
    EXPECT_LT(view.PlotArea().height(), 340 - 100);  // the legend's rows take room
    EXPECT_FALSE(view.grab().toImage().isNull());
}

}  // namespace
