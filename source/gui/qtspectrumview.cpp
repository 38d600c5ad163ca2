#include "nxbase/qtspectrumview.h"

#include <QPainter>
#include <QPainterPath>
#include <algorithm>
#include <cmath>
#include <limits>

namespace nxbase::qt {
namespace {

// Margins around the plot, in pixels: room for the title, the tick labels
// and the axis names.
constexpr double kLeft = 58, kRight = 14, kTop = 30, kBottom = 40;
constexpr double kLegendRowHeight = 17;
constexpr int kLegendColumns = 4;

QString Tick(double value, double step) {
    // As many decimals as the step has, and never "-0".
    const int decimals = std::clamp(static_cast<int>(-std::floor(std::log10(step) + 1e-9)), 0, 6);
    if (std::fabs(value) < step * 1e-6) value = 0.0;
    return QString::number(value, 'f', decimals);
}

}  // namespace

SpectrumView::SpectrumView(QWidget* parent) : QWidget(parent) {
    setBackgroundRole(QPalette::Base);
    setAutoFillBackground(true);
}

void SpectrumView::SetCurves(std::vector<Curve> curves) {
    curves_ = std::move(curves);
    double first = std::numeric_limits<double>::infinity(), last = -first;
    double low = 0.0, high = 1.0;
    for (const Curve& curve : curves_) {
        const std::size_t n = std::min(curve.wavelengths.size(), curve.values.size());
        for (std::size_t k = 0; k < n; ++k) {
            if (!std::isfinite(curve.wavelengths[k])) continue;
            first = std::min(first, curve.wavelengths[k]);
            last = std::max(last, curve.wavelengths[k]);
            if (!std::isfinite(curve.values[k])) continue;
            low = std::min(low, curve.values[k]);
            high = std::max(high, curve.values[k]);
        }
    }
    wavelengthAxis_ = first <= last ? NiceAxis(first, last, 8) : PlotAxis{350, 750, 50};
    valueAxis_ = NiceAxis(low, high, 10);
    update();
}

void SpectrumView::SetTitle(const QString& title) {
    title_ = title;
    update();
}

int SpectrumView::LegendRows() const {
    const int named = std::min(static_cast<int>(curves_.size()), kLegendCurves);
    const int entries = named + (static_cast<int>(curves_.size()) > kLegendCurves ? 1 : 0);
    return (entries + kLegendColumns - 1) / kLegendColumns;
}

QRectF SpectrumView::PlotArea() const {
    const double bottom = kBottom + LegendRows() * kLegendRowHeight;
    return QRectF(kLeft, kTop, std::max(1.0, width() - kLeft - kRight),
                  std::max(1.0, height() - kTop - bottom));
}

QPointF SpectrumView::PointOf(double nm, double value) const {
    const QRectF area = PlotArea();
    const PlotAxis& x = wavelengthAxis_;
    const PlotAxis& y = valueAxis_;
    return {area.left() + area.width() * (nm - x.low) / (x.high - x.low),
            area.bottom() - area.height() * (value - y.low) / (y.high - y.low)};
}

void SpectrumView::paintEvent(QPaintEvent*) {
    QPainter painter(this);
    const QRectF area = PlotArea();
    painter.setPen(palette().color(QPalette::Text));
    QFont bold = font();
    bold.setBold(true);
    painter.setFont(bold);
    painter.drawText(QRectF(kLeft, 4, area.width(), kTop - 8), Qt::AlignLeft | Qt::AlignVCenter,
                     title_);
    painter.setFont(font());
    DrawGrid(painter, area);
    painter.save();
    painter.setClipRect(area.adjusted(-1, -1, 1, 1));
    painter.setRenderHint(QPainter::Antialiasing);
    DrawCurves(painter);
    painter.restore();
    DrawLegend(painter, area);
}

void SpectrumView::DrawGrid(QPainter& painter, const QRectF& area) const {
    const QColor text = palette().color(QPalette::Text);
    const QPen grid(QColor(225, 225, 225), 1);
    const QFontMetricsF metrics(font());
    const PlotAxis& x = wavelengthAxis_;
    const PlotAxis& y = valueAxis_;
    for (double nm = x.low; nm <= x.high + x.step * 1e-6; nm += x.step) {
        const double at = PointOf(nm, y.low).x();
        painter.setPen(grid);
        painter.drawLine(QPointF(at, area.top()), QPointF(at, area.bottom()));
        painter.setPen(text);
        painter.drawText(QRectF(at - 30, area.bottom() + 2, 60, metrics.height()),
                         Qt::AlignHCenter | Qt::AlignTop, Tick(nm, x.step));
    }
    for (double v = y.low; v <= y.high + y.step * 1e-6; v += y.step) {
        const double at = PointOf(x.low, v).y();
        painter.setPen(grid);
        painter.drawLine(QPointF(area.left(), at), QPointF(area.right(), at));
        painter.setPen(text);
        painter.drawText(QRectF(0, at - metrics.height() / 2, kLeft - 6, metrics.height()),
                         Qt::AlignRight | Qt::AlignVCenter, Tick(v, y.step));
    }
    painter.setPen(QPen(QColor(136, 136, 136), 1));
    painter.drawRect(area);
    painter.setPen(text);
    painter.drawText(
        QRectF(area.left(), area.bottom() + metrics.height() + 2, area.width(), metrics.height()),
        Qt::AlignHCenter | Qt::AlignTop, QStringLiteral("wavelength (nm)"));
    painter.save();
    painter.translate(12, area.center().y());
    painter.rotate(-90);
    painter.drawText(
        QRectF(-area.height() / 2, -metrics.height() / 2, area.height(), metrics.height()),
        Qt::AlignCenter, QStringLiteral("reflectance"));
    painter.restore();
}

void SpectrumView::DrawCurves(QPainter& painter) const {
    for (const Curve& curve : curves_) {
        QPen pen(curve.colour, 2);
        if (curve.dashed) pen.setStyle(Qt::DashLine);
        painter.setPen(pen);
        QPainterPath path;
        bool drawing = false;
        const std::size_t n = std::min(curve.wavelengths.size(), curve.values.size());
        for (std::size_t k = 0; k < n; ++k) {
            if (!std::isfinite(curve.wavelengths[k]) || !std::isfinite(curve.values[k])) {
                drawing = false;  // a gap
                continue;
            }
            const QPointF point = PointOf(curve.wavelengths[k], curve.values[k]);
            drawing ? path.lineTo(point) : path.moveTo(point);
            drawing = true;
        }
        painter.drawPath(path);
    }
}

void SpectrumView::DrawLegend(QPainter& painter, const QRectF& area) const {
    const double top = area.bottom() + kBottom;
    const int named = std::min(static_cast<int>(curves_.size()), kLegendCurves);
    // Fewer entries than a row holds share its width.
    const int columns = std::clamp(static_cast<int>(curves_.size()), 1, kLegendColumns);
    const double column = area.width() / columns;
    const QFontMetricsF metrics(font());
    for (int i = 0; i <= named && i < static_cast<int>(curves_.size()) + 1; ++i) {
        const double x = area.left() + (i % columns) * column;
        const double y = top + (i / columns) * kLegendRowHeight;
        if (i == named) {
            if (named < static_cast<int>(curves_.size())) {
                painter.setPen(palette().color(QPalette::Text));
                painter.drawText(QRectF(x, y, column, kLegendRowHeight), Qt::AlignVCenter,
                                 QStringLiteral("and %1 more").arg(curves_.size() - named));
            }
            break;
        }
        const Curve& curve = curves_[static_cast<std::size_t>(i)];
        QPen pen(curve.colour, 2);
        if (curve.dashed) pen.setStyle(Qt::DashLine);
        painter.setPen(pen);
        painter.drawLine(QPointF(x, y + kLegendRowHeight / 2),
                         QPointF(x + 18, y + kLegendRowHeight / 2));
        painter.setPen(palette().color(QPalette::Text));
        painter.drawText(QRectF(x + 22, y, column - 24, kLegendRowHeight), Qt::AlignVCenter,
                         metrics.elidedText(curve.name, Qt::ElideRight, column - 24));
    }
}

}  // namespace nxbase::qt
