// nxcolor's screen colours and SVG chart picture.
#include "screen.h"

#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <cmath>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "nxbase/appconfig.h"
#include "nxbase/colorconverter.h"
#include "nxbase/files.h"
#include "nxbase/iccprofile.h"
#include "nxbase/plotaxis.h"
#include "toolkit/string.h"

namespace nxcolor {
namespace {

// Layout of the picture, in SVG user units (px).
constexpr int kCell = 210;  // cell width and height
constexpr int kMargin = 20;
constexpr int kTitleHeight = 56;
constexpr int kSwatchHeight = 88;
constexpr int kPlotHeight = 56;
constexpr int kMaxColumns = 6;
constexpr std::size_t kMaxIdChars = 26;  // of the bold 13 px id font in a cell

std::string Num(double value, int precision) {
    char buffer[64];
    if (value == 0.0) value = 0.0;
    auto result =
        std::to_chars(buffer, buffer + sizeof buffer, value, std::chars_format::fixed, precision);
    return std::string(buffer, result.ptr);
}

// Text for the SVG: UTF-8 (names from Windows exports are Windows-1252),
// with XML's special characters escaped.
std::string Escape(const std::string& raw) {
    const std::string text = toolkit::EightBitToUtf8(raw);
    std::string out;
    for (char c : text) {
        switch (c) {
            case '&':
                out += "&amp;";
                break;
            case '<':
                out += "&lt;";
                break;
            case '>':
                out += "&gt;";
                break;
            case '"':
                out += "&quot;";
                break;
            default:
                // Control characters are not allowed in XML 1.0.
                if (static_cast<unsigned char>(c) < 0x20 && c != '\t') {
                    out += ' ';
                } else {
                    out += c;
                }
        }
    }
    return out;
}

std::string Hex(const ScreenColor& c) {
    static const char kDigits[] = "0123456789abcdef";
    std::string text = "#";
    for (int v : {c.red, c.green, c.blue}) {
        text += kDigits[(v >> 4) & 0xF];
        text += kDigits[v & 0xF];
    }
    return text;
}

// The curve is drawn in the sample's colour unless that is too light to see.
std::string CurveColour(const ScreenColor& c) {
    double luma = 0.2126 * c.red + 0.7152 * c.green + 0.0722 * c.blue;
    return luma > 200.0 ? "#555555" : Hex(c);
}

// Dark text on light colours, light text on dark ones.
const char* TextOn(const ScreenColor& c) {
    double luma = 0.2126 * c.red + 0.7152 * c.green + 0.0722 * c.blue;
    return luma > 140.0 ? "#222222" : "#f4f4f4";
}

// Ids longer than a cell is wide end in "...". Cuts before a UTF-8
// continuation byte never happen: the cut moves back to a character start.
std::string Shortened(const std::string& id) {
    if (id.size() <= kMaxIdChars) return id;
    std::size_t cut = kMaxIdChars - 3;
    while (cut > 0 && (static_cast<unsigned char>(id[cut]) & 0xC0) == 0x80) --cut;
    return id.substr(0, cut) + "...";
}

// The XML declaration and the opening svg element of a picture.
void Open(std::ostream& out, int width, int height) {
    out << "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
        << "<svg xmlns=\"http://www.w3.org/2000/svg\" width=\"" << width << "\" height=\"" << height
        << "\" viewBox=\"0 0 " << width << " " << height << "\">\n";
}

// Closes the picture and makes it the file at `path` (beside it first, then
// renamed); false with the reason on failure.
bool CloseAndWrite(std::ostringstream& out, const std::string& path, std::string* error) {
    out << "</svg>\n";
    try {
        nxbase::WriteWholeFile(path, out.str());
    } catch (const std::exception& failure) {
        *error = failure.what();
        return false;
    }
    return true;
}

class ScopedLab {
  public:
    ScopedLab() : previous_(LABVector::GetColorSpaceType()) {
        LABVector::SetColorSpaceType(LAB_CIE1976);
    }
    ~ScopedLab() { LABVector::SetColorSpaceType(previous_); }
    ScopedLab(const ScopedLab&) = delete;
    ScopedLab& operator=(const ScopedLab&) = delete;

  private:
    LabColorSpaceType previous_;
};

void WriteCell(std::ostream& out, const ReportRow& row, const MeasuringCondition& condition, int x,
               int y) {
    const ReflectanceSpectrum spectrum(row.spectrum.data(), PhysicalConditions());
    ScopedLab cie;
    const LABVector lab(spectrum, condition);
    const ScreenColor colour = ScreenColorOf(spectrum, condition);
    const int w = kCell - 14;
    out << "<g transform=\"translate(" << x << "," << y << ")\">\n";
    out << "  <rect width=\"" << w << "\" height=\"" << kSwatchHeight << "\" rx=\"6\" fill=\""
        << Hex(colour) << "\" stroke=\"#888\" stroke-width=\"1\"/>\n";
    // The hex code sits in the swatch's corner, in a colour that reads on it.
    out << "  <text x=\"" << w - 6 << "\" y=\"" << kSwatchHeight - 7
        << "\" class=\"hex\" text-anchor=\"end\" fill=\"" << TextOn(colour) << "\">" << Hex(colour)
        << "</text>\n";
    out << "  <text x=\"0\" y=\"" << kSwatchHeight + 16 << "\" class=\"id\">"
        << Escape(Shortened(row.id)) << "</text>\n";
    out << "  <text x=\"0\" y=\"" << kSwatchHeight + 31 << "\" class=\"lab\">L* " << Num(lab[0], 2)
        << "  a* " << Num(lab[1], 2) << "  b* " << Num(lab[2], 2) << "</text>\n";
    // Reflectance 0..1 over 380..730 nm; values above 1 (fluorescence) are
    // clipped to the top of the plot.
    const int top = kSwatchHeight + 40;
    out << "  <rect x=\"0\" y=\"" << top << "\" width=\"" << w << "\" height=\"" << kPlotHeight
        << "\" class=\"plot\"/>\n";
    out << "  <line x1=\"0\" x2=\"" << w << "\" y1=\"" << top + kPlotHeight / 2 << "\" y2=\""
        << top + kPlotHeight / 2 << "\" class=\"grid\"/>\n";
    out << "  <polyline class=\"curve\" stroke=\"" << CurveColour(colour) << "\" points=\"";
    for (int i = 0; i < kSpectrumSize; ++i) {
        double r = std::clamp(static_cast<double>(row.spectrum[i]), 0.0, 1.0);
        if (!std::isfinite(row.spectrum[i])) r = 0.0;
        double px = w * i / double(kSpectrumSize - 1);
        double py = top + kPlotHeight * (1.0 - r);
        out << (i ? " " : "") << Num(px, 1) << "," << Num(py, 1);
    }
    out << "\"/>\n</g>\n";
}

}  // namespace

ScreenColor ScreenColorOf(const ReflectanceSpectrum& spectrum,
                          const MeasuringCondition& condition) {
    ScopedLab cie;
    const Color colour = ColorConverter::RGBToColor(RGBVector(LABVector(spectrum, condition)));
    return {colour.GetRed8(), colour.GetGreen8(), colour.GetBlue8()};
}

ScreenColor ScreenColorOf(const LABVector& lab) {
    const Color colour = ColorConverter::RGBToColor(RGBVector(lab));
    return {colour.GetRed8(), colour.GetGreen8(), colour.GetBlue8()};
}

std::string ScreenColorSource() {
    if (ICCEngine::Instance()->IsActive())
        return "ICC profile " + std::string(ICCProfile::GetProfileName().str());
    return "sRGB (built-in formulas)";
}

std::string SetUpScreenColors(const std::string& profilePath) {
    if (!profilePath.empty()) {
        nxbase::SetICCSettingsReader([profilePath](const std::string& key, const std::string& def) {
            if (key == ICCEngine::kEnableKey) return std::string("1");
            if (key == ICCEngine::kPathKey) return profilePath;
            return def;
        });
    } else if (!UserConfig::IsInitialized()) {
        UserConfig::CreateUserConfig(String("nxcolor"), String(), String());
    }
    ICCEngine* engine = ICCEngine::CreateICCEngine();
    // A profile was asked for (the engine tried it) but cannot be used.
    if (!engine->ProfileOK() && !engine->GetProblem().empty())
        return "ICC profile not used (" + engine->GetProblem() + "); sRGB formulas instead";
    return "";
}

bool WriteSvgReport(const Report& report, const MeasuringCondition& condition,
                    const std::string& path, std::string* error) {
    const std::size_t count = std::min(report.rows.size(), kMaxSvgSamples);
    const int columns = static_cast<int>(std::min<std::size_t>(
        std::max<std::size_t>(count, 1),
        count <= 24 ? kMaxColumns
                    : static_cast<std::size_t>(std::ceil(std::sqrt(count * 4.0 / 3.0)))));
    const int rows = static_cast<int>((count + columns - 1) / columns);
    const int width = 2 * kMargin + columns * kCell;
    const int height = kTitleHeight + kMargin + std::max(rows, 1) * kCell;

    std::ostringstream out;
    Open(out, width, height);
    out << "<style>\n"
        << "  text { font-family: 'DejaVu Sans', Verdana, sans-serif; }\n"
        << "  .title, .sub, .id, .lab { fill: #222; }\n"
        << "  .title { font-size: 18px; font-weight: bold; }\n"
        << "  .sub { font-size: 12px; fill: #555; }\n"
        << "  .id { font-size: 13px; font-weight: bold; }\n"
        << "  .hex { font-size: 11px; font-family: 'DejaVu Sans Mono', monospace; }\n"
        << "  .lab { font-size: 11px; fill: #444; }\n"
        << "  .plot { fill: #fff; stroke: #ccc; stroke-width: 1; }\n"
        << "  .grid { stroke: #e4e4e4; stroke-width: 1; }\n"
        << "  .curve { fill: none; stroke-width: 2; stroke-linejoin: round; }\n"
        << "</style>\n"
        << "<rect width=\"100%\" height=\"100%\" fill=\"#f4f4f2\"/>\n";
    std::string title = report.source + ": " + std::to_string(report.rows.size()) + " samples";
    if (count < report.rows.size()) title += ", the first " + std::to_string(count) + " shown";
    out << "<text x=\"" << kMargin << "\" y=\"28\" class=\"title\">" << Escape(title)
        << "</text>\n";
    out << "<text x=\"" << kMargin << "\" y=\"46\" class=\"sub\">CIELAB under illuminant "
        << Escape(report.illuminant) << ", observer " << Escape(report.observer)
        << "\xC2\xB0; screen colours: " << Escape(ScreenColorSource())
        << "; curves: reflectance 0..1 over 380..730 nm</text>\n";
    for (std::size_t i = 0; i < count; ++i) {
        int x = kMargin + static_cast<int>(i % columns) * kCell;
        int y = kTitleHeight + kMargin + static_cast<int>(i / columns) * kCell;
        WriteCell(out, report.rows[i], condition, x, y);
    }
    return CloseAndWrite(out, path, error);
}

namespace {

// Layout of the plot, in SVG user units (px).
constexpr int kPlotLeft = 70;
constexpr int kPlotTop = 64;
constexpr int kPlotWidth = 640;
constexpr int kPlotHeight2 = 360;
constexpr int kLegendColumns = 4;
constexpr int kLegendRowHeight = 18;

// The reflectance axis: from min(0, lowest) to max(1, highest), on steps of
// 1, 2 or 5 times a power of ten, so that it has at most twelve, whatever
// the range.
nxbase::PlotAxis ReflectanceAxis(const std::vector<ReportRow>& rows, std::size_t count) {
    double low = 0.0, high = 1.0;
    for (std::size_t i = 0; i < count; ++i) {
        for (float v : rows[i].spectrum) {
            if (!std::isfinite(v)) continue;
            low = std::min(low, static_cast<double>(v));
            high = std::max(high, static_cast<double>(v));
        }
    }
    return nxbase::NiceAxis(low, high, 12);
}

}  // namespace

bool WriteSvgPlot(const Report& report, const MeasuringCondition& condition,
                  const std::string& path, std::string* error) {
    const std::size_t count = std::min(report.rows.size(), kMaxSvgSamples);
    const std::size_t legend = std::min(count, kMaxLegendSamples);
    const int legendRows = static_cast<int>((legend + kLegendColumns - 1) / kLegendColumns);
    const int width = kPlotLeft + kPlotWidth + 30;
    const int bottom = kPlotTop + kPlotHeight2;
    const int height = bottom + 56 + legendRows * kLegendRowHeight + 10;
    const nxbase::PlotAxis axis = ReflectanceAxis(report.rows, count);
    auto xOf = [](int sample) {
        return kPlotLeft + kPlotWidth * sample / double(kSpectrumSize - 1);
    };
    auto yOf = [&](double r) {
        return bottom - kPlotHeight2 * (r - axis.low) / (axis.high - axis.low);
    };

    std::ostringstream out;
    Open(out, width, height);
    out << "<style>\n"
        << "  text { font-family: 'DejaVu Sans', Verdana, sans-serif; fill: #222; }\n"
        << "  .title { font-size: 16px; font-weight: bold; }\n"
        << "  .sub, .tick, .legend { font-size: 11px; }\n"
        << "  .sub { fill: #555; }\n"
        << "  .axis { font-size: 12px; }\n"
        << "  .frame { fill: #fff; stroke: #888; stroke-width: 1; }\n"
        << "  .grid { stroke: #e4e4e4; stroke-width: 1; }\n"
        << "  .curve { fill: none; stroke-width: 1.6; stroke-linejoin: round; }\n"
        << "</style>\n"
        << "<rect width=\"100%\" height=\"100%\" fill=\"#f4f4f2\"/>\n";
    std::string title = report.source + ": " + std::to_string(report.rows.size()) + " spectra";
    if (count < report.rows.size()) title += ", the first " + std::to_string(count) + " drawn";
    out << "<text x=\"" << kPlotLeft << "\" y=\"24\" class=\"title\">" << Escape(title)
        << "</text>\n"
        << "<text x=\"" << kPlotLeft
        << "\" y=\"42\" class=\"sub\">lines in the screen colour under "
        << "illuminant " << Escape(report.illuminant) << ", observer " << Escape(report.observer)
        << "\xC2\xB0 (" << Escape(ScreenColorSource()) << ")</text>\n";
    out << "<rect x=\"" << kPlotLeft << "\" y=\"" << kPlotTop << "\" width=\"" << kPlotWidth
        << "\" height=\"" << kPlotHeight2 << "\" class=\"frame\"/>\n";
    // Grid and ticks: every 50 nm from 400, every step of reflectance.
    for (int nm = 400; nm <= 700; nm += 50) {
        const std::string x = Num(xOf((nm - kFirstWavelength) / kWavelengthStep), 1);
        out << "<line class=\"grid\" x1=\"" << x << "\" x2=\"" << x << "\" y1=\"" << kPlotTop
            << "\" y2=\"" << bottom << "\"/>\n"
            << "<text class=\"tick\" x=\"" << x << "\" y=\"" << bottom + 16
            << "\" text-anchor=\"middle\">" << nm << "</text>\n";
    }
    const int ticks = static_cast<int>(std::lround((axis.high - axis.low) / axis.step));
    // Enough decimals for the step (0.1 -> 1, 0.05 -> 2), none from 1 on.
    const int decimals = std::max(0, static_cast<int>(std::ceil(-std::log10(axis.step) - 1e-9)));
    for (int t = 0; t <= ticks; ++t) {
        const double r = axis.low + t * axis.step;
        const std::string y = Num(yOf(r), 1);
        out << "<line class=\"grid\" x1=\"" << kPlotLeft << "\" x2=\"" << kPlotLeft + kPlotWidth
            << "\" y1=\"" << y << "\" y2=\"" << y << "\"/>\n"
            << "<text class=\"tick\" x=\"" << kPlotLeft - 6 << "\" y=\"" << y
            << "\" dy=\"4\" text-anchor=\"end\">" << Num(r, decimals) << "</text>\n";
    }
    out << "<text class=\"axis\" x=\"" << kPlotLeft + kPlotWidth / 2 << "\" y=\"" << bottom + 34
        << "\" text-anchor=\"middle\">Wavelength (nm)</text>\n"
        << "<text class=\"axis\" transform=\"translate(18," << kPlotTop + kPlotHeight2 / 2
        << ") rotate(-90)\" text-anchor=\"middle\">Reflectance</text>\n";
    // One group per sample; a value that is not a number ends a line piece.
    std::vector<std::string> colours(count);
    for (std::size_t i = 0; i < count; ++i) {
        const ReportRow& row = report.rows[i];
        const bool finite = std::all_of(row.spectrum.begin(), row.spectrum.end(),
                                        [](float v) { return std::isfinite(v); });
        colours[i] =
            finite ? CurveColour(ScreenColorOf(
                         ReflectanceSpectrum(row.spectrum.data(), PhysicalConditions()), condition))
                   : "#888888";
        out << "<g class=\"curve\" stroke=\"" << colours[i] << "\"><title>" << Escape(row.id)
            << "</title>";
        std::string points;
        auto flush = [&] {
            if (!points.empty()) out << "<polyline points=\"" << points << "\"/>";
            points.clear();
        };
        for (int k = 0; k < kSpectrumSize; ++k) {
            if (!std::isfinite(row.spectrum[k])) {
                flush();
                continue;
            }
            points +=
                (points.empty() ? "" : " ") + Num(xOf(k), 1) + "," + Num(yOf(row.spectrum[k]), 1);
        }
        flush();
        out << "</g>\n";
    }
    // The legend, below the axis label.
    const int legendTop = bottom + 56;
    const int legendWidth = kPlotWidth / kLegendColumns;
    for (std::size_t i = 0; i < legend; ++i) {
        const int x = kPlotLeft + static_cast<int>(i % kLegendColumns) * legendWidth;
        const int y = legendTop + static_cast<int>(i / kLegendColumns) * kLegendRowHeight;
        out << "<g class=\"legend\"><line x1=\"" << x << "\" x2=\"" << x + 22 << "\" y1=\"" << y - 4
            << "\" y2=\"" << y - 4 << "\" stroke=\"" << colours[i]
            << "\" stroke-width=\"3\"/><text x=\"" << x + 28 << "\" y=\"" << y << "\">"
            << Escape(Shortened(report.rows[i].id)) << "</text></g>\n";
    }
    if (count > legend) {
        out << "<text class=\"sub\" x=\"" << kPlotLeft << "\" y=\"" << height - 6
            << "\">legend: the first " << legend << " of " << count << "</text>\n";
    }
    return CloseAndWrite(out, path, error);
}

}  // namespace nxcolor
