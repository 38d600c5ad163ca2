#include "nxbase/colorconverter.h"

#include <algorithm>
#include <cmath>
#include <limits>
#include <mutex>
#include <optional>

#include "nxbase/cielab.h"
#include "nxbase/cmetry.h"
#include "nxbase/iccprofile.h"
#include "nxbase/linalg.h"
#include "nxbase/logfile.h"
#include "nxbase/text.h"

namespace {

const String& LogKey() {
    static const String key("ColorConverter");
    return key;
}

bool LogEnabled() {
    static nxbase::CachedLogOption option(LogKey().str());
    return option.Enabled();
}

void Log(const String& text) {
    LogFile::WriteToLog(text, LogKey());
}

// Display gamma 1/0.45 sampled at half steps of 1/255: 512 entries.
float gGammaTable[nxbase::kGammaTableSize];
std::once_flag gGammaOnce;

void BuildGammaTable() {
    gGammaTable[0] = 0.0f;
    for (int k = 1; k < nxbase::kGammaTableSize; ++k)
        gGammaTable[k] = static_cast<float>(std::pow(0.5 * k / 255.0, 1.0 / 0.45));
}

// EBU Tech. 3213 primaries with D65 white, for XYZ on 0..100, row by row.
constexpr float kEbuMatrix[9] = {0.03065f,  -0.01394f, -0.00476f,  //
                                 -0.00969f, 0.01876f,  0.00042f,   //
                                 0.00068f,  -0.00229f, 0.0107f};

// IEC 61966-2-1 (sRGB): XYZ (D65, Y = 1) to linear RGB.
constexpr float kSrgbMatrix[9] = {3.2404542f, -1.5371385f, -0.4985314f,  //
                                  -0.969266f, 1.8760108f,  0.041556f,    //
                                  0.0556434f, -0.2040259f, 1.0572252f};

// 100/255 in single precision.
constexpr float kLevelToComponent = 0.3921568691730499f;

// The D65 white (Y = 1) of the library's own 2 degree weights.
struct WhitePoint {
    float x = 0.95047f;
    float z = 1.08883f;
};

const WhitePoint& D65White() {
    static const WhitePoint white = [] {
        CMetryFilter filter{Lichtart(IllumClass(ILLUM_D65, 65)), Observer(OBSERVER_2DEG)};
        WhitePoint w;
        float y = filter.GetWeightSum(1);
        w.x = filter.GetWeightSum(0) / y;
        w.z = filter.GetWeightSum(2) / y;
        return w;
    }();
    return white;
}

// The condition of screen colours from spectra: the RGB filter's illuminant
// (D65) and observer (2 degree). Built once: a default condition costs more
// to make than the whole conversion.
const MeasuringCondition& RgbCondition() {
    static const MeasuringCondition condition(IllumClass(ILLUM_D65, 65),
                                              ObserverClass(OBSERVER_2DEG), PhysicalConditions());
    return condition;
}

// sRGB companding (IEC 61966-2-1), scaled to 0..100.
inline float Compand(float v) {
    return 100.0f *
           (v > 0.0031308f ? 1.055f * std::pow(v, 0.4166666666666667f) - 0.055f : 12.92f * v);
}

inline void LabToSrgb(const float* lab, float* rgb, const WhitePoint& white) {
    float fy = (lab[0] + 16.0f) / 116.0f;
    float fx = lab[1] / 500.0f + fy;
    float fz = fy - lab[2] / 200.0f;
    using nxbase::cielab::FInverse;
    float xyz[3] = {white.x * FInverse(fx), FInverse(fy), white.z * FInverse(fz)};
    // Row by row, as LinAlg::MxV sums, written out so that it inlines.
    for (int i = 0; i < 3; ++i) {
        const float* row = kSrgbMatrix + 3 * i;
        rgb[i] = Compand(row[0] * xyz[0] + row[1] * xyz[1] + row[2] * xyz[2]);
    }
}

String Components(const float* v) {
    return String(ColorVector(v[0], v[1], v[2], MeasuringCondition()));
}

String ColorText(const Color& color) {
    return String::CreateFromInt(color.GetRed()) + " " + String::CreateFromInt(color.GetGreen()) +
           " " + String::CreateFromInt(color.GetBlue());
}

std::uint16_t ToChannel(float value) {
    // Truncation toward zero, then the 16-bit range; NaN counts as 0.
    float scaled = value * 655.36f;
    if (!(scaled > 0.0f)) return 0;
    if (scaled >= 65535.0f) return 65535;
    return static_cast<std::uint16_t>(scaled);
}

// The grey that outlines icons: dark on light colours, light on dark ones
// (Rec. 709 luma of the 8-bit channels).
Color OutlineFor(const Color& color) {
    double luma = 0.2126 * color.GetRed8() + 0.7152 * color.GetGreen8() + 0.0722 * color.GetBlue8();
    return luma > 128.0 ? Color(0x4000, 0x4000, 0x4000) : Color(0xC000, 0xC000, 0xC000);
}

// Built-in English colour names, by colour number; used while no text file
// with the group "FarbTexte" is loaded. The shipped files data/lng/NxBase1.lng
// and NxBase49.lng hold the same list in English and German.
const char* const kBuiltinNames[FARBE_ANZAHL] = {
    "black",        "dark grey",    "grey",           "light grey",   "white",
    "dark red",     "red",          "pink",           "brown",        "orange",
    "light orange", "olive",        "yellow",         "light yellow", "dark green",
    "green",        "light green",  "dark turquoise", "turquoise",    "light turquoise",
    "dark blue",    "blue",         "light blue",     "dark violet",  "violet",
    "lilac",        "dark magenta", "magenta",        "light magenta"};

// The text of a colour number from the loaded text files, or the built-in
// English name while no file holding it is loaded.
String ColourName(int number) {
    if (number < 0 || number >= FARBE_ANZAHL) return String();
    static const String group("FarbTexte");
    if (Text::GetEntryCount(group) > static_cast<unsigned long>(number))
        return Text::GetText(group, static_cast<unsigned long>(number));
    return String(kBuiltinNames[number]);
}

// Hue sectors of the naming rule: upper bounds in degrees and typical lightness.
struct HueSector {
    float end;
    float lightness;
};
constexpr HueSector kSectors[8] = {{45, 50},  {75, 65},  {110, 85}, {175, 55},
                                   {235, 60}, {290, 35}, {320, 40}, {350, 50}};
constexpr float kAchromaticChroma = 8.0f;
constexpr float kDarkBelow = 20.0f;
constexpr float kLightAbove = 15.0f;

}  // namespace

// ---------------------------------------------------------------------------
// RGBVector

RGBVector::RGBVector(float axR, float axG, float axB, const MeasuringCondition& axCondition)
    : ColorVector(axR, axG, axB, axCondition) {}

RGBVector::RGBVector(const ReflectanceSpectrum& axSpectrum) : ColorVector(RgbCondition()) {
    ReflectanceSpectrumToRGB(axSpectrum, CMetry::GetRGBFilter(), true);
}

RGBVector::RGBVector(const ReflectanceSpectrum& axSpectrum, const CMetryFilter& axFilter)
    : ColorVector(MeasuringCondition(axFilter.GetIllum(), axFilter.GetObserver(),
                                     axSpectrum.GetPhysicalConditions())) {
    ReflectanceSpectrumToRGB(axSpectrum, axFilter, false);
}

RGBVector::RGBVector(const LABVector& axLab) : ColorVector(axLab.GetMeasuringCondition()) {
    FromLab(axLab);
}

void RGBVector::Init() {
    std::call_once(gGammaOnce, BuildGammaTable);
}

void RGBVector::ReflectanceSpectrumToRGB(const ReflectanceSpectrum& axSpectrum,
                                         const CMetryFilter& axFilter, bool /*axRGBFilter*/) {
    Init();
    if (ICCEngine::Instance()->IsActive()) {
        // Lab under the vector's own condition (the RGB filter's, or the
        // given filter's), not under whatever the facade has current.
        const LABVector lab(axSpectrum, amCondition);
        if (ProfiledLabToRGB(lab.GetCIELab())) return;
    }
    // XYZ on 0..100: X_i = 100 (W_i . R) / sum(W_1).
    float sums[3];
    axFilter.Tristimulus(axSpectrum.GetData(), sums);
    float scale = 100.0f / axFilter.GetWeightSum(1);
    float xyz[3] = {sums[0] * scale, sums[1] * scale, sums[2] * scale};
    float linear[3];
    LinAlg::MxV(linear, kEbuMatrix, xyz, 3, 3);
    for (int i = 0; i < 3; ++i) {
        int k = nxbase::detail::GammaIndex(gGammaTable, linear[i]);
        int level = k / 2;  // truncates toward zero: -1 gives 0
        amV[i] = static_cast<float>(level) * kLevelToComponent;
    }
    if (LogEnabled()) Log(String("Spectrum -> RGB: ") + String(*this));
}

void RGBVector::FromLab(const LABVector& axLab) {
    // GetCIELab() copies the vector with its condition; under CIELAB it would
    // return the vector unchanged, so the copy is skipped.
    std::optional<LABVector> converted;
    if (LABVector::GetColorSpaceType() != LAB_CIE1976) converted = axLab.GetCIELab();
    const LABVector& lab = converted ? *converted : axLab;
    if (ProfiledLabToRGB(lab)) return;
    LabToSrgb(lab.getV(), amV, D65White());
    if (LogEnabled()) Log(String("Lab -> RGB: ") + String(lab) + " -> " + String(*this));
}

bool RGBVector::ProfiledLabToRGB(const LABVector& axLab) {
    ICCEngine* engine = ICCEngine::Instance();
    if (!engine->IsActive()) return false;
    double lab[3] = {axLab[0], axLab[1], axLab[2]}, rgb[3];
    if (!engine->LabToRGB(lab, rgb)) return false;
    for (int i = 0; i < 3; ++i) amV[i] = static_cast<float>(100.0 * rgb[i]);
    if (LogEnabled()) Log(String("Lab -> RGB (ICC): ") + String(axLab) + " -> " + String(*this));
    return true;
}

namespace nxbase {

void LabToScreenRGB(const float* lab, float* rgb, std::size_t count) {
    const WhitePoint& white = D65White();
    for (std::size_t i = 0; i < count; ++i) {
        const float* in = lab + 3 * i;
        float* out = rgb + 3 * i;
        if (std::isfinite(in[0]) && std::isfinite(in[1]) && std::isfinite(in[2])) {
            LabToSrgb(in, out, white);
        } else {
            out[0] = out[1] = out[2] = std::numeric_limits<float>::quiet_NaN();
        }
    }
    if (count > 0 && LogEnabled())
        Log(String("Lab -> RGB: ") + String::CreateFromInt(static_cast<long>(count)) +
            " values, first " + Components(lab) + " -> " + Components(rgb));
}

namespace detail {

const float* GammaTable() {
    std::call_once(gGammaOnce, BuildGammaTable);
    return gGammaTable;
}

int GammaIndex(const float* table, float v) {
    int lo = 0, hi = kGammaTableSize - 1, mid = 256;
    while (lo != mid) {
        if (table[mid] <= v) {
            lo = mid;
        } else {
            hi = mid;
        }
        mid = (hi - lo) / 2 + lo;
    }
    return table[lo] <= v ? lo : lo - 1;
}

}  // namespace detail
}  // namespace nxbase

// ---------------------------------------------------------------------------
// ColorConverter

const Size_t<short> ColorConverter::kDefaultBitmapSize(16, 16);

Color ColorConverter::RGBToColor(const RGBVector& axRGB) {
    return Color(ToChannel(axRGB[0]), ToChannel(axRGB[1]), ToChannel(axRGB[2]));
}

Color ColorConverter::CMYKToColor(const float* pCMYK) {
    if (pCMYK == nullptr) return Color();
    float keep = 1.0f - std::clamp(pCMYK[3], 0.0f, 100.0f) / 100.0f;
    auto channel = [keep](float x) {
        float value = (65536.0f - x * 655.36f) * keep;
        if (!(value > 0.0f)) return std::uint16_t(0);
        return value >= 65535.0f ? std::uint16_t(65535) : static_cast<std::uint16_t>(value);
    };
    return Color(channel(pCMYK[0]), channel(pCMYK[1]), channel(pCMYK[2]));
}

Color ColorConverter::SpectrumToColor(const ReflectanceSpectrum& axSpectrum) {
    return RGBToColor(RGBVector(axSpectrum));
}

Color ColorConverter::SpectrumToColor(const ReflectanceSpectrum& axSpectrum,
                                      const CMetryFilter& axFilter) {
    return RGBToColor(RGBVector(axSpectrum, axFilter));
}

Color ColorConverter::ConvertSpectrumToColor(const ReflectanceSpectrum& axSpectrum) {
    return SpectrumToColor(axSpectrum);
}

Brush ColorConverter::SpectrumToBrush(const ReflectanceSpectrum& axSpectrum) {
    Color color = SpectrumToColor(axSpectrum);
    if (LogEnabled()) Log(String("Spectrum to Brush: -> ") + ColorText(color));
    return Brush(color);
}

Brush ColorConverter::SpectrumToBrush(const ReflectanceSpectrum& axSpectrum,
                                      const CMetryFilter& axFilter) {
    Color color = SpectrumToColor(axSpectrum, axFilter);
    if (LogEnabled()) Log(String("Spectrum to Brush: -> ") + ColorText(color));
    return Brush(color);
}

Brush ColorConverter::LabToBrush(const LABVector& axLab) {
    Color color = RGBToColor(RGBVector(axLab));
    if (LogEnabled()) Log(String("Lab to Brush: -> ") + ColorText(color));
    return Brush(color);
}

Bitmap ColorConverter::BuildBitmap(const Brush& axBrush, const Size_t<short>& axSize) {
    return BuildIcon(axBrush.GetColor(), axSize, ICON_SQUARE);
}

Bitmap ColorConverter::BuildIcon(const Color& axColor, const Size_t<short>& axSize,
                                 IconShape axShape) {
    Bitmap bitmap(axSize);
    const int w = bitmap.GetWidth(), h = bitmap.GetHeight();
    const Color frame =
        axShape == ICON_SQUARE ? Color(0x8000, 0x8000, 0x8000) : OutlineFor(axColor);
    // Inside test at pixel centres, in units where the bitmap spans 0..w, 0..h.
    auto inside = [&](int x, int y) {
        double px = x + 0.5, py = y + 0.5;
        double cx = w / 2.0, cy = h / 2.0;
        switch (axShape) {
            case ICON_CIRCLE: {
                double r = std::min(w, h) / 2.0;
                return (px - cx) * (px - cx) + (py - cy) * (py - cy) <= r * r;
            }
            case ICON_DIAMOND: {
                double r = std::min(w, h) / 2.0;
                return std::fabs(px - cx) + std::fabs(py - cy) <= r;
            }
            case ICON_TRIANGLE: {
                // Apex (cx, 0), base from (0, h) to (w, h).
                double half = cx * py / h;
                return std::fabs(px - cx) <= half;
            }
            case ICON_STRIPE:
                return py >= h / 3.0 && py <= 2.0 * h / 3.0;
            case ICON_SQUARE:
            default:
                return true;
        }
    };
    for (int y = 0; y < h; ++y) {
        for (int x = 0; x < w; ++x) {
            if (!inside(x, y)) {
                bitmap.SetTransparent(x, y);
                continue;
            }
            // A pixel of the shape whose 4-neighbour lies outside it is outline.
            bool edge = x == 0 || y == 0 || x == w - 1 || y == h - 1 || !inside(x - 1, y) ||
                        !inside(x + 1, y) || !inside(x, y - 1) || !inside(x, y + 1);
            bitmap.SetPixel(x, y, edge ? frame : axColor);
        }
    }
    return bitmap;
}

Bitmap ColorConverter::SpectrumToBitmap(const ReflectanceSpectrum& axSpectrum) {
    return BuildBitmap(SpectrumToBrush(axSpectrum), kDefaultBitmapSize);
}

Bitmap ColorConverter::SpectrumToBitmap(const ReflectanceSpectrum& axSpectrum,
                                        const Size_t<short>& axSize) {
    return BuildBitmap(SpectrumToBrush(axSpectrum), axSize);
}

Bitmap ColorConverter::SpectrumToBitmap(const ReflectanceSpectrum& axSpectrum,
                                        const CMetryFilter& axFilter) {
    return BuildBitmap(SpectrumToBrush(axSpectrum, axFilter), kDefaultBitmapSize);
}

Bitmap ColorConverter::SpectrumToBitmap(const ReflectanceSpectrum& axSpectrum,
                                        const CMetryFilter& axFilter, const Size_t<short>& axSize) {
    return BuildBitmap(SpectrumToBrush(axSpectrum, axFilter), axSize);
}

Bitmap ColorConverter::LabToBitmap(const LABVector& axLab, IconShape axShape) {
    return LabToBitmap(axLab, kDefaultBitmapSize, axShape);
}

Bitmap ColorConverter::LabToBitmap(const LABVector& axLab, const Size_t<short>& axSize,
                                   IconShape axShape) {
    return BuildIcon(RGBToColor(RGBVector(axLab)), axSize, axShape);
}

Bitmap ColorConverter::ColorToBitmap(const Color& axColor) {
    return BuildBitmap(Brush(axColor), kDefaultBitmapSize);
}

Bitmap ColorConverter::ColorToBitmap(const Color& axColor, const Size_t<short>& axSize) {
    return BuildBitmap(Brush(axColor), axSize);
}

FarbNummerType ColorConverter::FarbNummer(const LABVector& axLab) {
    LABVector lab = axLab.GetCIELab();
    float l = lab[0], a = lab[1], b = lab[2];
    float chroma = std::sqrt(a * a + b * b);
    if (!(chroma >= kAchromaticChroma)) {  // NaN counts as achromatic
        if (!(l >= 20.0f)) return FARBE_SCHWARZ;
        if (l < 45.0f) return FARBE_DUNKELGRAU;
        if (l < 70.0f) return FARBE_GRAU;
        if (l < 90.0f) return FARBE_HELLGRAU;
        return FARBE_WEISS;
    }
    float hue = std::atan2(b, a) * 57.29577951308232f;
    if (hue < 0.0f) hue += 360.0f;
    int sector = 0;  // red covers [350, 360) and [0, 45)
    if (hue < 350.0f) {
        while (sector < 7 && hue >= kSectors[sector].end) ++sector;
    }
    float typical = kSectors[sector].lightness;
    int tone = l < typical - kDarkBelow ? 0 : (l > typical + kLightAbove ? 2 : 1);
    return static_cast<FarbNummerType>(FARBE_ERSTE_BUNTFARBE + 3 * sector + tone);
}

String ColorConverter::Farbzuordnung(const LABVector& axLab) {
    return ColourName(FarbNummer(axLab));
}

String ColorConverter::Farbzuordnung(const ReflectanceSpectrum& axSpectrum) {
    return Farbzuordnung(LABVector(axSpectrum));
}
