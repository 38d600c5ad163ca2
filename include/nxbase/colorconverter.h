// Screen colours: RGBVector turns spectra and Lab values into display RGB
// (through the ICC engine when it is active, otherwise by built-in formulas),
// and ColorConverter wraps the results into the toolkit's Color, Brush and
// Bitmap and names colours. All functions may be called from any thread once
// the CMetry facade and the ICC engine are set up.
//
// Error model: nothing here raises. Out-of-gamut colours give components
// outside 0..100, which RGBToColor clamps.
#ifndef NXBASE_COLORCONVERTER_H_
#define NXBASE_COLORCONVERTER_H_

#include <cstddef>

#include "nxbase/colorvector.h"
#include "nxbase/export.h"
#include "toolkit/bitmap.h"
#include "toolkit/color.h"
#include "toolkit/string.h"

// Display RGB: components R, G, B on 0..100 (100 = full intensity), tagged
// with the measuring condition of the value they came from.
class NXBASE_EXPORT RGBVector : public ColorVector {
  public:
    RGBVector() = default;
    RGBVector(float axR, float axG, float axB, const MeasuringCondition& axCondition);
    // Through the ICC engine when active (Lab under the current CMetry
    // condition, which the result then carries), else EBU primaries on XYZ of
    // the RGB filter (D65, 2 degree) and the display gamma tables; the result
    // carries illuminant D65 and the 2 degree observer.
    explicit RGBVector(const ReflectanceSpectrum& axSpectrum);
    // The same with axFilter in place of the RGB filter (also for the Lab
    // handed to the ICC engine); the result carries the filter's illuminant
    // and observer and the spectrum's physical conditions.
    RGBVector(const ReflectanceSpectrum& axSpectrum, const CMetryFilter& axFilter);
    // Through the ICC engine when active, else sRGB (IEC 61966-2-1) with the
    // Lab value taken relative to the D65 white; not clamped.
    explicit RGBVector(const LABVector& axLab);
    RGBVector(const RGBVector&) = default;
    RGBVector& operator=(const RGBVector&) = default;

  private:
    // Builds the display gamma tables once per process.
    static void Init();
    void ReflectanceSpectrumToRGB(const ReflectanceSpectrum& axSpectrum,
                                  const CMetryFilter& axFilter, bool axRGBFilter);
    void FromLab(const LABVector& axLab);
    bool ProfiledLabToRGB(const LABVector& axLab);
};

namespace nxbase {

// Number of entries of each display gamma table.
constexpr int kGammaTableSize = 512;

// Lab (CIE 1976, L 0..100) to sRGB components 0..100 by the formula path of
// RGBVector(LABVector), `count` triples at a time, without the ICC engine and
// with one log-key check per call. Results equal RGBVector's bit for bit; a
// triple holding NaN or an infinity gives NaN.
NXBASE_EXPORT void LabToScreenRGB(const float* lab, float* rgb, std::size_t count);

namespace detail {
// The shared display gamma table: entry 0 = 0, entry k = (0.5 k / 255)^(1/0.45).
NXBASE_EXPORT const float* GammaTable();
// The largest k with table[k] <= v by the bisection of the display path
// (-1 below entry 0; never above 510).
NXBASE_EXPORT int GammaIndex(const float* table, float v);
}  // namespace detail

}  // namespace nxbase

// Colour numbers of Farbzuordnung/FarbNummer; the number is the index of the
// colour's name in the text group "FarbTexte".
//
// The rule, on the CIELAB L*, C*ab, hab of the value (CIE 15:2004, 8.2.1):
//  - C* < 8: achromatic, by L*: black < 20 <= dark grey < 45 <= grey < 70 <=
//    light grey < 90 <= white.
//  - otherwise a hue sector (degrees): red [350, 45), orange [45, 75),
//    yellow [75, 110), green [110, 175), turquoise [175, 235), blue
//    [235, 290), violet [290, 320), magenta [320, 350); then a lightness class
//    against the sector's typical lightness Lr (red 50, orange 65, yellow 85,
//    green 55, turquoise 60, blue 35, violet 40, magenta 50): dark when
//    L* < Lr - 20, light when L* > Lr + 15, else medium.
//  Number = 5 + 3 * sector + class (0 dark, 1 medium, 2 light). Some names
//  say it better than "dark"/"light": dark orange is brown, dark yellow olive,
//  light red pink.
enum FarbNummerType : int {
    FARBE_SCHWARZ = 0,
    FARBE_DUNKELGRAU = 1,
    FARBE_GRAU = 2,
    FARBE_HELLGRAU = 3,
    FARBE_WEISS = 4,
    FARBE_ERSTE_BUNTFARBE = 5,  // dark red; 5 + 3 * sector + lightness class
    FARBE_ANZAHL = 29           // count of colour numbers
};

class NXBASE_EXPORT ColorConverter {
  public:
    // Shapes of the small colour icons of LabToBitmap. The shape is filled
    // with the colour and outlined one pixel wide in a grey that contrasts
    // with it (dark grey on light colours, light grey on dark ones); pixels
    // outside the shape are transparent.
    enum IconShape {
        ICON_SQUARE = 0,    // the whole bitmap
        ICON_CIRCLE = 1,    // the inscribed disc
        ICON_DIAMOND = 2,   // the inscribed square standing on a corner
        ICON_TRIANGLE = 3,  // upward, base on the bottom row, apex top centre
        ICON_STRIPE = 4     // middle third of the height, full width (a strip)
    };

    // Default size of the bitmaps made here.
    static const Size_t<short> kDefaultBitmapSize;

    // Each component x 655.36, truncated and clamped to 0..65535.
    static Color RGBToColor(const RGBVector& axRGB);
    // C, M, Y, K in percent (0..100): channel = (65536 - x 655.36) (1 - K/100)
    // for x = C, M, Y, clamped to 0..65535. A null pointer gives black.
    static Color CMYKToColor(const float* pCMYK);
    static Color SpectrumToColor(const ReflectanceSpectrum& axSpectrum);
    static Color SpectrumToColor(const ReflectanceSpectrum& axSpectrum,
                                 const CMetryFilter& axFilter);
    // Same as SpectrumToColor; kept for older callers.
    static Color ConvertSpectrumToColor(const ReflectanceSpectrum& axSpectrum);
    static Brush SpectrumToBrush(const ReflectanceSpectrum& axSpectrum);
    static Brush SpectrumToBrush(const ReflectanceSpectrum& axSpectrum,
                                 const CMetryFilter& axFilter);
    static Brush LabToBrush(const LABVector& axLab);

    // A patch: the colour with a one-pixel mid-grey frame, so that white
    // and black patches stay visible on any background.
    static Bitmap SpectrumToBitmap(const ReflectanceSpectrum& axSpectrum);
    static Bitmap SpectrumToBitmap(const ReflectanceSpectrum& axSpectrum,
                                   const Size_t<short>& axSize);
    static Bitmap SpectrumToBitmap(const ReflectanceSpectrum& axSpectrum,
                                   const CMetryFilter& axFilter);
    static Bitmap SpectrumToBitmap(const ReflectanceSpectrum& axSpectrum,
                                   const CMetryFilter& axFilter, const Size_t<short>& axSize);
    static Bitmap LabToBitmap(const LABVector& axLab, IconShape axShape);
    static Bitmap LabToBitmap(const LABVector& axLab, const Size_t<short>& axSize,
                              IconShape axShape);
    static Bitmap ColorToBitmap(const Color& axColor);
    static Bitmap ColorToBitmap(const Color& axColor, const Size_t<short>& axSize);

    // The colour's name: text FarbNummer(lab) of the group "FarbTexte".
    static String Farbzuordnung(const LABVector& axLab);
    // Of the spectrum's Lab under the current CMetry filter.
    static String Farbzuordnung(const ReflectanceSpectrum& axSpectrum);
    // The colour number by the rule above (DIN99 values are taken back to CIELAB).
    static FarbNummerType FarbNummer(const LABVector& axLab);

  private:
    static Bitmap BuildBitmap(const Brush& axBrush, const Size_t<short>& axSize);
    static Bitmap BuildIcon(const Color& axColor, const Size_t<short>& axSize, IconShape axShape);
};

#endif  // NXBASE_COLORCONVERTER_H_
