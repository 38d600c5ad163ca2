// A spectral plot for Qt windows, drawn with QPainter (no Qt module beyond
// Widgets): reflectance against wavelength, one line per curve in its own
// colour (a dashed one for a reference, say), a grid every 50 nm or so and
// on round reflectance steps, labelled axes, and a legend for up to 24
// curves (more are drawn and counted, not named). A value that is not
// finite leaves a gap in its line; the axes take in every finite value and
// at least 0..1.
#ifndef NXBASE_QTSPECTRUMVIEW_H_
#define NXBASE_QTSPECTRUMVIEW_H_

#include <QColor>
#include <QPointF>
#include <QRectF>
#include <QString>
#include <QWidget>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/plotaxis.h"

class QPainter;

namespace nxbase::qt {

class NXBASE_EXPORT SpectrumView : public QWidget {
  public:
    struct Curve {
        QString name;
        std::vector<double> wavelengths;  // nm, increasing
        std::vector<double> values;       // one per wavelength (extra ones are ignored)
        QColor colour = Qt::black;
        bool dashed = false;
    };
    static constexpr int kLegendCurves = 24;

    explicit SpectrumView(QWidget* parent = nullptr);

    // Replaces the curves and repaints.
    void SetCurves(std::vector<Curve> curves);
    const std::vector<Curve>& Curves() const { return curves_; }
    void SetTitle(const QString& title);

    // Where (nm, value) is drawn at the widget's present size: for tool
    // tips, and for checking a drawing.
    QPointF PointOf(double nm, double value) const;
    // The frame of the plot, and its axes (wavelength, value) as drawn.
    QRectF PlotArea() const;
    PlotAxis WavelengthAxis() const { return wavelengthAxis_; }
    PlotAxis ValueAxis() const { return valueAxis_; }

    QSize sizeHint() const override { return {520, 320}; }
    QSize minimumSizeHint() const override { return {240, 160}; }

  protected:
    void paintEvent(QPaintEvent* event) override;

  private:
    int LegendRows() const;
    void DrawGrid(QPainter& painter, const QRectF& area) const;
    void DrawCurves(QPainter& painter) const;
    void DrawLegend(QPainter& painter, const QRectF& area) const;

    std::vector<Curve> curves_;
    QString title_;
    PlotAxis wavelengthAxis_{350, 750, 50};
    PlotAxis valueAxis_{0, 1, 0.1};
};

}  // namespace nxbase::qt

#endif  // NXBASE_QTSPECTRUMVIEW_H_
