// Colour vectors: three single-precision components tagged with the measuring
// condition they were computed under (XYZ, xyY, CIELAB or DIN99, LCh, the
// CMC-like "mg" space and colour differences). Vectors are values: distinct
// objects may be used on distinct threads. Construction from spectra reads the
// CMetry facade, which must be set up before values are computed elsewhere;
// the process-wide Lab colour-space type is an atomic setting.
//
// Error model: none is raised. Formulas run in IEEE single precision with the
// constants given at each class; degenerate input (X + Y + Z = 0, zero white
// sums) yields infinities or NaNs as IEEE arithmetic gives them.
#ifndef NXBASE_COLORVECTOR_H_
#define NXBASE_COLORVECTOR_H_

#include <cstddef>

#include "nxbase/cmetry.h"
#include "nxbase/export.h"
#include "toolkit/string.h"

// The colour space a LABVector holds.
enum LabColorSpaceType : int {
    LAB_CIE1976 = 0,  // CIE 1976 L*a*b* (CIE 15:2004)
    LAB_DIN99 = 1     // DIN 6176 (DIN99) L99, a99, b99
};

class NXBASE_EXPORT ColorVector {
  public:
    // Zero components, default measuring condition.
    ColorVector() = default;
    ColorVector(float ax0, float ax1, float ax2, const MeasuringCondition& axCondition);
    ColorVector(const ColorVector&) = default;
    ColorVector& operator=(const ColorVector&) = default;

    // REQUIRES: 0 <= alIndex <= 2 (not checked).
    float& operator[](int alIndex) { return amV[alIndex]; }
    const float& operator[](int alIndex) const { return amV[alIndex]; }
    float* getV() { return amV; }
    const float* getV() const { return amV; }

    const MeasuringCondition& GetMeasuringCondition() const { return amCondition; }
    void SetMeasuringCondition(const MeasuringCondition& axCondition) { amCondition = axCondition; }

    // sqrt(v0^2 + v1^2 + v2^2), summed in single precision.
    float Length() const;

    // Component-wise; the measuring condition stays as it is.
    ColorVector& operator+=(const ColorVector& axOther);
    ColorVector& operator-=(const ColorVector& axOther);
    ColorVector& operator*=(const ColorVector& axOther);
    ColorVector& operator/=(const ColorVector& axOther);
    ColorVector& operator*=(float axFactor);
    ColorVector& operator/=(float axDivisor);

    // The three components with two decimals, separated by blanks
    // ("12.34 -5.67 89.01"); "." is the decimal separator whatever the locale.
    operator String() const;  // NOLINT: the toolkit's display conversion

  protected:
    explicit ColorVector(const MeasuringCondition& axCondition);
    // Raw weighted sums S_i = sum of W_i * R over the 36 samples, formed in
    // eight pairwise-added lanes (the order of the batch path, so that both
    // agree bit for bit); the condition is the filter's illuminant and
    // observer with the spectrum's physical conditions.
    ColorVector(const CMetryFilter& axFilter, const ReflectanceSpectrum& axSpectrum);

    MeasuringCondition amCondition;
    float amV[3] = {0.0f, 0.0f, 0.0f};
};

// Components and measuring conditions equal (components exactly).
NXBASE_EXPORT bool operator==(const ColorVector& axA, const ColorVector& axB);
NXBASE_EXPORT bool operator!=(const ColorVector& axA, const ColorVector& axB);

class LABVector;

// CIE XYZ tristimulus values, white Y = 100 (CIE 15:2004; ASTM E308 weights).
class NXBASE_EXPORT XYZVector : public ColorVector {
  public:
    XYZVector() = default;
    XYZVector(float axX, float axY, float axZ, const MeasuringCondition& axCondition);
    // With the current filter of the CMetry facade.
    explicit XYZVector(const ReflectanceSpectrum& axSpectrum);
    // X_i = S_i / sum(W_1) * 100, so the perfect white has Y = 100.
    XYZVector(const CMetryFilter& axFilter, const ReflectanceSpectrum& axSpectrum);
    // Inverse CIELAB relative to the white point of the vector's own
    // illuminant and observer: f_Y = (L + 16)/116, f_X = a/500 + f_Y,
    // f_Z = f_Y - b/200; X_i = f_i^3 Xn_i when f_i > 0.206893034423, else
    // (f_i - 16/116) Xn_i / 7.787. A DIN99 vector is taken back to CIELAB first.
    explicit XYZVector(const LABVector& axLab);
};

// CIE xyY: x = X/(X+Y+Z), y = Y/(X+Y+Z), Y. No guard for X+Y+Z = 0.
class NXBASE_EXPORT xyYVector : public ColorVector {
  public:
    xyYVector() = default;
    xyYVector(float axx, float axy, float axY, const MeasuringCondition& axCondition);
    // Via the XYZVector of the spectrum (current CMetry filter).
    explicit xyYVector(const ReflectanceSpectrum& axSpectrum);
    explicit xyYVector(const XYZVector& axXYZ);
};

class LChVector;

// CIE 1976 L*a*b* (CIE 15:2004) or DIN99 (DIN 6176), according to the
// process-wide colour-space type at construction from tristimulus values.
//
// f(t) = t^0.33333334 (single-precision pow) for t > 0.008856, else
// 7.787 t + 16/116 (the boundary takes the linear branch); L = 116 f(Y/Yn) - 16,
// a = 500 (f(X/Xn) - f(Y/Yn)), b = 200 (f(Y/Yn) - f(Z/Zn)). DIN99 (kE = kCH = 1)
// then maps L, a, b with the 16 degree rotation computed from pi = 3.1415926.
class NXBASE_EXPORT LABVector : public ColorVector {
  public:
    LABVector() = default;
    // Stored as given, as CIE 1976 values: only vectors computed from
    // tristimulus values take the process-wide type.
    LABVector(float axL, float axa, float axb, const MeasuringCondition& axCondition);
    // With the current filter of the CMetry facade. Allocates nothing.
    explicit LABVector(const ReflectanceSpectrum& axSpectrum);
    // With the filter of the condition's illuminant and observer; the result
    // carries axCondition.
    LABVector(const ReflectanceSpectrum& axSpectrum, const MeasuringCondition& axCondition);
    LABVector(const ReflectanceSpectrum& axSpectrum, const IllumClass& axIllum,
              const ObserverClass& axObserver);
    LABVector(const CMetryFilter& axFilter, const ReflectanceSpectrum& axSpectrum);
    // Relative to the white point of the current CMetry filter.
    explicit LABVector(const XYZVector& axXYZ);
    // Relative to the white point of axFilter.
    LABVector(const CMetryFilter& axFilter, const XYZVector& axXYZ);
    // a = C cos h, b = C sin h (h in degrees); CIE 1976 type.
    explicit LABVector(const LChVector& axLCh);

    // Looks at the current process-wide type, not at the vector's: DIN99
    // gives the inverse DIN99 of the components (typed CIE 1976); CIE 1976
    // gives the vector as it is; any other type a zero vector.
    LABVector GetCIELab() const;
    LabColorSpaceType GetLabVectorColorSpace() const { return amType; }

    // The type new vectors from tristimulus values take; initially CIE 1976.
    static void SetColorSpaceType(LabColorSpaceType axType);
    static LabColorSpaceType GetColorSpaceType();

    // "L*=52.31 a*=-3.12 b*=10.54", or "L99=... a99=... b99=..." for DIN99.
    String ToString() const;

  private:
    // CIELAB (then DIN99 when current) of pXYZ against a filter whose weight
    // sums are axSums.
    void FromXYZ(const float axSums[3], const float* pXYZ);

    LabColorSpaceType amType = LAB_CIE1976;
};

class LCHmgVector;

// The hue in degrees, within (0, 360], of a* and b* computed from a spectrum
// in single precision (the batch path, nxcolor, the Python module): grey, 360,
// when both are below kComputedNeutral. A perfect white's a* and b* come out
// of float arithmetic at up to about 1e-4, which crosses LChVector's 0.00001
// and would give it a hue of 90 or 158 degrees; 0.001 (a thousandth of a just
// noticeable difference) is beyond that rounding. NaN in gives NaN.
namespace nxbase {
constexpr double kComputedNeutral = 0.001;
NXBASE_EXPORT double HueOfComputedLab(double a, double b);
}  // namespace nxbase

// CIE 1976 LCh: C = sqrt(a^2 + b^2); h = atan2(b, a) in degrees within
// (0, 360]; an exact 0 degrees and grey (|a|, |b| < 0.00001) give 360. For
// a* and b* computed from spectra, HueOfComputedLab tells grey reliably.
class NXBASE_EXPORT LChVector : public ColorVector {
  public:
    LChVector() = default;
    LChVector(float axL, float axC, float axh, const MeasuringCondition& axCondition);
    // Via the LABVector of the spectrum (current CMetry filter).
    explicit LChVector(const ReflectanceSpectrum& axSpectrum);
    explicit LChVector(const LABVector& axLab);
    // Inverse of the mg transform by interval search (ProbiereL, ProbiereC,
    // ProbiereH): each component to within 0.001 of the mg target where the
    // transform is that steep, else to a search step of 0.001.
    explicit LChVector(const LCHmgVector& axMg);

  private:
    void ProbiereL(const LCHmgVector& axTarget, double axLo, double axHi);
    void ProbiereC(const LCHmgVector& axTarget, double axLo, double axHi);
    void ProbiereH(const LCHmgVector& axTarget, double axLo, double axHi);
};

// The "mg" LCh whose Euclidean distances approximate the CMC colour
// difference: Lmg = L/0.511 below L = 16, else
// (ln(0.040975 L) + 0.01765 L)/0.040975 + 34.7231;
// Cmg = 12.253 ln(0.072158 C + 0.638) + 0.181547 C + 5.50671;
// hmg = degrees of hr + 0.17914 + a four-term Fourier series in hr (not
// folded into 0..360).
class NXBASE_EXPORT LCHmgVector : public ColorVector {
  public:
    LCHmgVector() = default;
    LCHmgVector(float axL, float axC, float axh, const MeasuringCondition& axCondition);
    explicit LCHmgVector(const LABVector& axLab);
    explicit LCHmgVector(const LChVector& axLCh);

    // The forward transforms of one component, as the searches use them.
    static float LightnessToMg(float axL);
    static float ChromaToMg(float axC);
    static float HueToMg(float axh);
};

// amg = Cmg cos hmg, bmg = Cmg sin hmg (hmg in degrees), Lmg unchanged.
class NXBASE_EXPORT LABmgVector : public ColorVector {
  public:
    LABmgVector() = default;
    LABmgVector(float axL, float axa, float axb, const MeasuringCondition& axCondition);
    explicit LABmgVector(const LCHmgVector& axMg);
};

// Colour difference a - b split into dL, dC, dH: dL = La - Lb, dC = Ca - Cb,
// dH = sqrt(|dE^2 - dL^2 - dC^2|) with dE the length of a - b, negative when
// a_a b_b - a_b b_a > 0. The result carries a's measuring condition.
class NXBASE_EXPORT dLCHVector : public ColorVector {
  public:
    dLCHVector() = default;
    dLCHVector(float axdL, float axdC, float axdH, const MeasuringCondition& axCondition);
    dLCHVector(const LABVector& axA, const LABVector& axB);

    // The decomposition above for two (L, a, b) triples.
    static void Decompose(const float* pA, const float* pB, float pResult[3]);
};

// The same decomposition applied to the LABmg forms of both vectors.
class NXBASE_EXPORT dLCHmgVector : public ColorVector {
  public:
    dLCHmgVector() = default;
    dLCHmgVector(float axdL, float axdC, float axdH, const MeasuringCondition& axCondition);
    dLCHmgVector(const LABVector& axA, const LABVector& axB);
};

namespace nxbase {
// DIN99 (DIN 6176) L99, a99, b99 of alCount CIE 1976 L, a, b triples, by the
// transform LABVector applies; pLab and pDin99 may be the same array.
NXBASE_EXPORT void LabToDin99(const float* pLab, float* pDin99, std::size_t alCount);
}  // namespace nxbase

#endif  // NXBASE_COLORVECTOR_H_
