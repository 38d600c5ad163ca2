// Colour vectors: tristimulus sums, CIELAB and DIN99, LCh, the mg space and
// colour differences, in single precision as the header describes.
#include "nxbase/colorvector.h"

#include <atomic>
#include <charconv>
#include <cmath>
#include <optional>
#include <string>

#include "tristimulus.h"

namespace {

// CIE 15:2004 CIELAB constants, single precision (shared with the batch).
using nxbase::detail::kLabEpsilon;
using nxbase::detail::kLabExponent;
using nxbase::detail::kLabKappa;
using nxbase::detail::kLabOffset;
constexpr float kLabInverseEpsilon = nxbase::cielab::kInverseEpsilonF;

// LCh hue: degrees per radian, and the neutral threshold for a and b.
constexpr double kDegreesPerRadian = 57.29577951308232;
constexpr float kNeutral = 0.00001f;
constexpr double kPi = 3.141592653589793;

// DIN 6176 (DIN99), kE = kCH = 1. The rotation angle is computed from this
// truncated pi, in the forward and the inverse transform alike.
constexpr double kDinPi = 3.1415926;
constexpr double kDinAngle = 2.0 * kDinPi * 16.0 / 360.0;

// The mg hue transform works in single precision.
constexpr float kPiF = 3.14159265f;

std::atomic<int> gLabColorSpace{LAB_CIE1976};

// --- Filters and conditions -------------------------------------------------

// The last filter asked for by illuminant and observer on this thread; a
// colour vector converted back and forth under one condition then builds no
// filter per value.
const CMetryFilter& FilterFor(const IllumClass& axIllum, const ObserverClass& axObserver) {
    struct Cache {
        boost::shared_ptr<klume::cmetry::IIlluminant> illum;
        boost::shared_ptr<klume::cmetry::IObserver> observer;
        std::string illumName;
        String observerName;
        std::optional<CMetryFilter> filter;
    };
    thread_local Cache cache;
    const auto illum = axIllum.GetIlluminant();
    const auto observer = axObserver.GetObserver();
    if (!cache.filter || cache.illum != illum || cache.observer != observer ||
        cache.observerName != axObserver.GetName()) {
        cache.filter.emplace(Lichtart(axIllum), Observer(axObserver));
        cache.illum = illum;
        cache.observer = observer;
        cache.observerName = axObserver.GetName();
    }
    return *cache.filter;
}

// The condition of values summed with axFilter from a spectrum with
// axPhysical: the filter's illuminant and observer. The illuminant, observer
// and density standard of the last filter are kept per thread, so that the
// object path copies three shared pointers and takes no lock.
MeasuringCondition ConditionFor(const CMetryFilter& axFilter,
                                const PhysicalConditions& axPhysical) {
    struct Cache {
        boost::shared_ptr<const klume::cmetry::CMetryFilter> key;
        std::optional<MeasuringCondition> condition;
    };
    thread_local Cache cache;
    const auto& key = axFilter.GetProviderFilter();
    if (!key) {
        return MeasuringCondition(axFilter.GetIllum(), axFilter.GetObserver(), axPhysical);
    }
    if (!cache.condition || cache.key != key) {
        cache.condition.emplace(axFilter.GetIllum(), axFilter.GetObserver(), PhysicalConditions());
        cache.key = key;
    }
    const MeasuringCondition& c = *cache.condition;
    return MeasuringCondition(c.GetIllum(), c.GetObserver(), c.GetDStd(), axPhysical);
}

const CMetryFilter& CurrentFilter() {
    return *CMetry::Instance()->GetLXYZFilter();
}

void WeightSums(const CMetryFilter& axFilter, float pSums[3]) {
    for (unsigned short c = 0; c < 3; ++c) pSums[c] = axFilter.GetWeightSum(c);
}

// --- DIN99 (DIN 6176) -------------------------------------------------------

// The hue angle of (e, f) in radians, 0..2 pi, placed by quadrant.
double DinHue(double e, double f) {
    if (e > 0.0) {
        const double h = std::atan(f / e);
        return f >= 0.0 ? h : h + 2.0 * kDinPi;
    }
    if (e < 0.0) return std::atan(f / e) + kDinPi;
    if (f > 0.0) return kDinPi / 2.0;
    if (f < 0.0) return 3.0 * kDinPi / 2.0;
    return 0.0;
}

void Din99Forward(float* pLab) {
    const double cosA = std::cos(kDinAngle);
    const double sinA = std::sin(kDinAngle);
    const double l = pLab[0];
    const double a = pLab[1];
    const double b = pLab[2];
    const double l99 = 105.51 * std::log(1.0 + 0.0158 * l);
    const double e = a * cosA + b * sinA;
    const double f = 0.7 * (-a * sinA + b * cosA);
    const double g = std::sqrt(e * e + f * f);
    const double h = DinHue(e, f);
    const double c99 = std::log(1.0 + 0.045 * g) / 0.045;
    pLab[0] = static_cast<float>(l99);
    pLab[1] = static_cast<float>(c99 * std::cos(h));
    pLab[2] = static_cast<float>(c99 * std::sin(h));
}

void Din99Inverse(const float* pDin, float* pLab) {
    const double cosA = std::cos(kDinAngle);
    const double sinA = std::sin(kDinAngle);
    const double a99 = pDin[1];
    const double b99 = pDin[2];
    const double l = (std::exp(pDin[0] / 105.51) - 1.0) / 0.0158;
    const double c99 = std::sqrt(a99 * a99 + b99 * b99);
    const double g = (std::exp(0.045 * c99) - 1.0) / 0.045;
    const double h = DinHue(a99, b99);
    const double e = g * std::cos(h);
    const double f = g * std::sin(h) / 0.7;
    pLab[0] = static_cast<float>(l);
    pLab[1] = static_cast<float>(e * cosA - f * sinA);
    pLab[2] = static_cast<float>(e * sinA + f * cosA);
}

// --- LCh ------------------------------------------------------------------

float HueDegrees(float a, float b) {
    if (std::fabs(a) < kNeutral && std::fabs(b) < kNeutral) return 360.0f;
    double h = std::atan2(static_cast<double>(b), static_cast<double>(a)) * kDegreesPerRadian;
    if (h <= 0.0) h += 360.0;
    return static_cast<float>(h);
}

}  // namespace

double nxbase::HueOfComputedLab(double a, double b) {
    if (std::fabs(a) < kComputedNeutral && std::fabs(b) < kComputedNeutral) return 360.0;
    const double h = std::atan2(b, a) * kDegreesPerRadian;
    return h <= 0.0 ? h + 360.0 : h;
}

namespace {

float Chroma(float a, float b) {
    return std::sqrt(a * a + b * b);
}

void LabToLCh(const float* pLab, float* pLCh) {
    pLCh[0] = pLab[0];
    pLCh[1] = Chroma(pLab[1], pLab[2]);
    pLCh[2] = HueDegrees(pLab[1], pLab[2]);
}

void LChToMg(const float* pLCh, float* pMg) {
    pMg[0] = LCHmgVector::LightnessToMg(pLCh[0]);
    pMg[1] = LCHmgVector::ChromaToMg(pLCh[1]);
    pMg[2] = LCHmgVector::HueToMg(pLCh[2]);
}

void MgToLabMg(const float* pMg, float* pLabMg) {
    const float hr = pMg[2] * kPiF / 180.0f;
    pLabMg[0] = pMg[0];
    pLabMg[1] = pMg[1] * std::cos(hr);
    pLabMg[2] = pMg[1] * std::sin(hr);
}

// --- Interval search ----------------------------------------------------------

// The x in [lo, hi] whose forward value is nearest the target: ten steps per
// pass, each pass narrowing to one step either side of the best, until the
// error is at most 0.001 or the step at most 0.001. Negative x are skipped.
template <typename Forward>
float Probiere(float axTarget, double axLo, double axHi, Forward fForward) {
    constexpr double kTolerance = 0.001;
    constexpr int kSteps = 10;
    double lo = axLo;
    double hi = axHi;
    for (;;) {
        const double step = (hi - lo) / kSteps;
        double bestError = 1000.0;
        double bestX = 0.0;
        for (int k = 0; k <= kSteps; ++k) {
            const double x = lo + k * step;
            if (x < 0.0) continue;
            const double error =
                std::fabs(static_cast<double>(axTarget) - fForward(static_cast<float>(x)));
            if (error < bestError) {
                bestError = error;
                bestX = x;
            }
        }
        if (bestError <= kTolerance || step <= kTolerance) return static_cast<float>(bestX);
        lo = bestX - step;
        hi = bestX + step;
    }
}

// --- Text -------------------------------------------------------------------

void AppendFixed(std::string& asOut, float axValue) {
    char buffer[64];
    const auto result = std::to_chars(buffer, buffer + sizeof buffer, static_cast<double>(axValue),
                                      std::chars_format::fixed, 2);
    asOut.append(buffer, result.ptr);
}

}  // namespace

// --- ColorVector -------------------------------------------------------------

ColorVector::ColorVector(float ax0, float ax1, float ax2, const MeasuringCondition& axCondition)
    : amCondition(axCondition), amV{ax0, ax1, ax2} {}

ColorVector::ColorVector(const MeasuringCondition& axCondition) : amCondition(axCondition) {}

ColorVector::ColorVector(const CMetryFilter& axFilter, const ReflectanceSpectrum& axSpectrum)
    : amCondition(ConditionFor(axFilter, axSpectrum.GetPhysicalConditions())) {
    const float* weights[3] = {axFilter.GetWeights(0), axFilter.GetWeights(1),
                               axFilter.GetWeights(2)};
    nxbase::detail::LaneSums(weights, axSpectrum.GetData(), amV);
}

float ColorVector::Length() const {
    return std::sqrt(amV[0] * amV[0] + amV[1] * amV[1] + amV[2] * amV[2]);
}

ColorVector& ColorVector::operator+=(const ColorVector& axOther) {
    for (int i = 0; i < 3; ++i) amV[i] += axOther.amV[i];
    return *this;
}

ColorVector& ColorVector::operator-=(const ColorVector& axOther) {
    for (int i = 0; i < 3; ++i) amV[i] -= axOther.amV[i];
    return *this;
}

ColorVector& ColorVector::operator*=(const ColorVector& axOther) {
    for (int i = 0; i < 3; ++i) amV[i] *= axOther.amV[i];
    return *this;
}

ColorVector& ColorVector::operator/=(const ColorVector& axOther) {
    for (int i = 0; i < 3; ++i) amV[i] /= axOther.amV[i];
    return *this;
}

ColorVector& ColorVector::operator*=(float axFactor) {
    for (float& v : amV) v *= axFactor;
    return *this;
}

ColorVector& ColorVector::operator/=(float axDivisor) {
    for (float& v : amV) v /= axDivisor;
    return *this;
}

ColorVector::operator String() const {
    std::string text;
    for (int i = 0; i < 3; ++i) {
        if (i > 0) text += ' ';
        AppendFixed(text, amV[i]);
    }
    return String(text);
}

bool operator==(const ColorVector& axA, const ColorVector& axB) {
    return axA[0] == axB[0] && axA[1] == axB[1] && axA[2] == axB[2] &&
           axA.GetMeasuringCondition() == axB.GetMeasuringCondition();
}

bool operator!=(const ColorVector& axA, const ColorVector& axB) {
    return !(axA == axB);
}

// --- XYZVector ---------------------------------------------------------------

XYZVector::XYZVector(float axX, float axY, float axZ, const MeasuringCondition& axCondition)
    : ColorVector(axX, axY, axZ, axCondition) {}

XYZVector::XYZVector(const ReflectanceSpectrum& axSpectrum)
    : XYZVector(CurrentFilter(), axSpectrum) {}

XYZVector::XYZVector(const CMetryFilter& axFilter, const ReflectanceSpectrum& axSpectrum)
    : ColorVector(axFilter, axSpectrum) {
    const float sumY = axFilter.GetWeightSum(1);
    for (float& v : amV) v = v / sumY * 100.0f;
}

// The components are taken as CIELAB whatever the vector's type: convert a
// DIN99 vector with GetCIELab() first.
XYZVector::XYZVector(const LABVector& axLab) : ColorVector(axLab.GetMeasuringCondition()) {
    const float lab[3] = {axLab[0], axLab[1], axLab[2]};
    const MeasuringCondition& condition = axLab.GetMeasuringCondition();
    float sums[3];
    WeightSums(FilterFor(condition.GetIllum(), condition.GetObserver()), sums);
    const float fy = (lab[0] + 16.0f) / 116.0f;
    const float f[3] = {lab[1] / 500.0f + fy, fy, fy - lab[2] / 200.0f};
    for (int i = 0; i < 3; ++i) {
        const float white = 100.0f * sums[i] / sums[1];
        amV[i] = f[i] > kLabInverseEpsilon ? f[i] * f[i] * f[i] * white
                                           : (f[i] - kLabOffset) * white / kLabKappa;
    }
}

// --- xyYVector ---------------------------------------------------------------

xyYVector::xyYVector(float axx, float axy, float axY, const MeasuringCondition& axCondition)
    : ColorVector(axx, axy, axY, axCondition) {}

xyYVector::xyYVector(const ReflectanceSpectrum& axSpectrum) : xyYVector(XYZVector(axSpectrum)) {}

xyYVector::xyYVector(const XYZVector& axXYZ) : ColorVector(axXYZ.GetMeasuringCondition()) {
    const float sum = axXYZ[0] + axXYZ[1] + axXYZ[2];
    amV[0] = axXYZ[0] / sum;
    amV[1] = axXYZ[1] / sum;
    amV[2] = axXYZ[1];
}

// --- LABVector ---------------------------------------------------------------

LABVector::LABVector(float axL, float axa, float axb, const MeasuringCondition& axCondition)
    : ColorVector(axL, axa, axb, axCondition), amType(LAB_CIE1976) {}

LABVector::LABVector(const ReflectanceSpectrum& axSpectrum)
    : LABVector(CurrentFilter(), axSpectrum) {}

LABVector::LABVector(const ReflectanceSpectrum& axSpectrum, const MeasuringCondition& axCondition)
    : LABVector(FilterFor(axCondition.GetIllum(), axCondition.GetObserver()), axSpectrum) {
    amCondition = axCondition;
}

LABVector::LABVector(const ReflectanceSpectrum& axSpectrum, const IllumClass& axIllum,
                     const ObserverClass& axObserver)
    : LABVector(FilterFor(axIllum, axObserver), axSpectrum) {}

LABVector::LABVector(const CMetryFilter& axFilter, const ReflectanceSpectrum& axSpectrum)
    : ColorVector(axFilter, axSpectrum) {
    float sums[3];
    WeightSums(axFilter, sums);
    float xyz[3];
    for (int i = 0; i < 3; ++i) xyz[i] = amV[i] / sums[1] * 100.0f;
    FromXYZ(sums, xyz);
}

LABVector::LABVector(const XYZVector& axXYZ) : LABVector(CurrentFilter(), axXYZ) {}

LABVector::LABVector(const CMetryFilter& axFilter, const XYZVector& axXYZ)
    : ColorVector(axXYZ.GetMeasuringCondition()) {
    float sums[3];
    WeightSums(axFilter, sums);
    FromXYZ(sums, axXYZ.getV());
}

LABVector::LABVector(const LChVector& axLCh) : ColorVector(axLCh.GetMeasuringCondition()) {
    const double h = static_cast<double>(axLCh[2]) * kPi / 180.0;
    amV[0] = axLCh[0];
    amV[1] = static_cast<float>(axLCh[1] * std::cos(h));
    amV[2] = static_cast<float>(axLCh[1] * std::sin(h));
}

void LABVector::FromXYZ(const float axSums[3], const float* pXYZ) {
    float f[3];
    for (int i = 0; i < 3; ++i) {
        const float t = pXYZ[i] * axSums[1] / axSums[i] / 100.0f;
        f[i] = t > kLabEpsilon ? std::pow(t, kLabExponent) : kLabKappa * t + kLabOffset;
    }
    amV[0] = 116.0f * f[1] - 16.0f;
    amV[1] = 500.0f * (f[0] - f[1]);
    amV[2] = 200.0f * (f[1] - f[2]);
    amType = LAB_CIE1976;
    if (GetColorSpaceType() == LAB_DIN99) {
        Din99Forward(amV);
        amType = LAB_DIN99;
    }
}

LABVector LABVector::GetCIELab() const {
    LABVector result(*this);
    switch (GetColorSpaceType()) {
        case LAB_CIE1976:
            break;
        case LAB_DIN99:
            Din99Inverse(amV, result.amV);
            result.amType = LAB_CIE1976;
            break;
        default:
            result.amV[0] = result.amV[1] = result.amV[2] = 0.0f;
            break;
    }
    return result;
}

void LABVector::SetColorSpaceType(LabColorSpaceType axType) {
    gLabColorSpace.store(axType, std::memory_order_relaxed);
}

LabColorSpaceType LABVector::GetColorSpaceType() {
    return static_cast<LabColorSpaceType>(gLabColorSpace.load(std::memory_order_relaxed));
}

String LABVector::ToString() const {
    const bool din = amType == LAB_DIN99;
    const char* names[3] = {din ? "L99=" : "L*=", din ? " a99=" : " a*=", din ? " b99=" : " b*="};
    std::string text;
    for (int i = 0; i < 3; ++i) {
        text += names[i];
        AppendFixed(text, amV[i]);
    }
    return String(text);
}

// --- LChVector ---------------------------------------------------------------

LChVector::LChVector(float axL, float axC, float axh, const MeasuringCondition& axCondition)
    : ColorVector(axL, axC, axh, axCondition) {}

LChVector::LChVector(const ReflectanceSpectrum& axSpectrum) : LChVector(LABVector(axSpectrum)) {}

LChVector::LChVector(const LABVector& axLab) : ColorVector(axLab.GetMeasuringCondition()) {
    LabToLCh(axLab.getV(), amV);
}

LChVector::LChVector(const LCHmgVector& axMg) : ColorVector(axMg.GetMeasuringCondition()) {
    ProbiereL(axMg, 0.0, 200.0);
    ProbiereC(axMg, 0.0, 1000.0);
    ProbiereH(axMg, 0.0, 360.0);
}

void LChVector::ProbiereL(const LCHmgVector& axTarget, double axLo, double axHi) {
    amV[0] = Probiere(axTarget[0], axLo, axHi, LCHmgVector::LightnessToMg);
}

void LChVector::ProbiereC(const LCHmgVector& axTarget, double axLo, double axHi) {
    amV[1] = Probiere(axTarget[1], axLo, axHi, LCHmgVector::ChromaToMg);
}

// The forward hue transform of the trial is compared with the target as it
// is: the transform maps 0 to 0 and 360 to 360 and is monotonic in between,
// so no folding by 360 is needed.
void LChVector::ProbiereH(const LCHmgVector& axTarget, double axLo, double axHi) {
    amV[2] = Probiere(axTarget[2], axLo, axHi, LCHmgVector::HueToMg);
}

// --- LCHmgVector / LABmgVector -----------------------------------------------

LCHmgVector::LCHmgVector(float axL, float axC, float axh, const MeasuringCondition& axCondition)
    : ColorVector(axL, axC, axh, axCondition) {}

LCHmgVector::LCHmgVector(const LABVector& axLab) : LCHmgVector(LChVector(axLab)) {}

LCHmgVector::LCHmgVector(const LChVector& axLCh) : ColorVector(axLCh.GetMeasuringCondition()) {
    LChToMg(axLCh.getV(), amV);
}

float LCHmgVector::LightnessToMg(float axL) {
    if (axL < 16.0f) return axL / 0.511f;
    return (std::log(0.040975f * axL) + 0.01765f * axL) / 0.040975f + 34.7231f;
}

float LCHmgVector::ChromaToMg(float axC) {
    return 12.253f * std::log(0.072158f * axC + 0.638f) + 0.181547f * axC + 5.50671f;
}

float LCHmgVector::HueToMg(float axh) {
    const float hr = axh * kPiF / 180.0f;
    const float hr2 = 2.0f * hr;
    const float hr3 = 3.0f * hr;
    const float hr4 = 4.0f * hr;
    const float big = hr + 0.17914f + 0.13893f * std::sin(hr) - 0.09622f * std::cos(hr) -
                      0.0539f * std::sin(hr2) - 0.06742f * std::cos(hr2) -
                      0.04029f * std::sin(hr3) - 0.02137f * std::cos(hr3) -
                      0.01043f * std::sin(hr4) + 0.00587f * std::cos(hr4);
    return big * 180.0f / kPiF;
}

LABmgVector::LABmgVector(float axL, float axa, float axb, const MeasuringCondition& axCondition)
    : ColorVector(axL, axa, axb, axCondition) {}

LABmgVector::LABmgVector(const LCHmgVector& axMg) : ColorVector(axMg.GetMeasuringCondition()) {
    MgToLabMg(axMg.getV(), amV);
}

// --- Differences -------------------------------------------------------------

dLCHVector::dLCHVector(float axdL, float axdC, float axdH, const MeasuringCondition& axCondition)
    : ColorVector(axdL, axdC, axdH, axCondition) {}

dLCHVector::dLCHVector(const LABVector& axA, const LABVector& axB)
    : ColorVector(axA.GetMeasuringCondition()) {
    Decompose(axA.getV(), axB.getV(), amV);
}

void dLCHVector::Decompose(const float* pA, const float* pB, float pResult[3]) {
    const float d[3] = {pA[0] - pB[0], pA[1] - pB[1], pA[2] - pB[2]};
    const float dL = d[0];
    const float dC = Chroma(pA[1], pA[2]) - Chroma(pB[1], pB[2]);
    const float dE = std::sqrt(d[0] * d[0] + d[1] * d[1] + d[2] * d[2]);
    float dH = std::sqrt(std::fabs(dE * dE - dL * dL - dC * dC));
    if (pA[1] * pB[2] - pB[1] * pA[2] > 0.0f) dH = -dH;
    pResult[0] = dL;
    pResult[1] = dC;
    pResult[2] = dH;
}

dLCHmgVector::dLCHmgVector(float axdL, float axdC, float axdH,
                           const MeasuringCondition& axCondition)
    : ColorVector(axdL, axdC, axdH, axCondition) {}

dLCHmgVector::dLCHmgVector(const LABVector& axA, const LABVector& axB)
    : ColorVector(axA.GetMeasuringCondition()) {
    float lch[3];
    float mg[3];
    float labA[3];
    float labB[3];
    LabToLCh(axA.getV(), lch);
    LChToMg(lch, mg);
    MgToLabMg(mg, labA);
    LabToLCh(axB.getV(), lch);
    LChToMg(lch, mg);
    MgToLabMg(mg, labB);
    dLCHVector::Decompose(labA, labB, amV);
}

namespace nxbase {

void LabToDin99(const float* pLab, float* pDin99, std::size_t alCount) {
    for (std::size_t i = 0; i < alCount; ++i) {
        float v[3] = {pLab[3 * i], pLab[3 * i + 1], pLab[3 * i + 2]};
        Din99Forward(v);
        for (int c = 0; c < 3; ++c) pDin99[3 * i + c] = v[c];
    }
}

}  // namespace nxbase
