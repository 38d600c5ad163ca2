// Colour-difference formulas; see nxbase/colordiff.h.
#include "nxbase/colordiff.h"

#include <strings.h>

#include <cmath>
#include <cstring>
#include <limits>

#include "nxbase/colorvector.h"

namespace nxbase {
namespace {

constexpr double kPi = 3.14159265358979323846;
constexpr double kDegree = kPi / 180.0;
constexpr double k25Pow7 = 6103515625.0;  // 25^7

double Chroma(const LabValue& axLab) {
    return std::sqrt(axLab.a * axLab.a + axLab.b * axLab.b);
}

// A square that rounding can take a hair below zero, clamped; NaN stays NaN,
// so that a NaN in the input is never a perfect match.
double NonNegative(double x) {
    return x < 0.0 ? 0.0 : x;
}

// Every formula answers NaN for a triple that holds NaN or infinity.
constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();

bool Finite(const LabValue& v) {
    return std::isfinite(v.L) && std::isfinite(v.a) && std::isfinite(v.b);
}

// ΔH² from Δa, Δb and ΔC.
double HueDifferenceSquared(const LabValue& axA, const LabValue& axB, double axDeltaC) {
    const double da = axA.a - axB.a;
    const double db = axA.b - axB.b;
    return NonNegative(da * da + db * db - axDeltaC * axDeltaC);
}

double Pow7(double x) {
    const double x2 = x * x;
    const double x3 = x2 * x;
    return x3 * x3 * x;
}

// Hue angle in degrees, 0 <= h < 360; 0 for a neutral.
double HueDegrees(double b, double a) {
    if (a == 0.0 && b == 0.0) return 0.0;
    double h = std::atan2(b, a) / kDegree;
    if (h < 0.0) h += 360.0;
    return h;
}

// T(h) = 1 - 0.17 cos(h - 30°) + 0.24 cos 2h + 0.32 cos(3h + 6°) - 0.20 cos(4h - 63°),
// from one sine and cosine of h by the multiple-angle formulas.
double HueWeighting(double axCos, double axSin) {
    constexpr double kCos30 = 0.86602540378443865, kSin30 = 0.5;
    constexpr double kCos6 = 0.99452189536827333, kSin6 = 0.10452846326765347;
    constexpr double kCos63 = 0.45399049973954675, kSin63 = 0.89100652418836786;
    const double c = axCos, s = axSin;
    const double cos2 = c * c - s * s, sin2 = 2.0 * s * c;
    const double cos3 = c * (4.0 * c * c - 3.0), sin3 = s * (3.0 - 4.0 * s * s);
    const double cos4 = cos2 * cos2 - sin2 * sin2, sin4 = 2.0 * sin2 * cos2;
    return 1.0 - 0.17 * (c * kCos30 + s * kSin30) + 0.24 * cos2 +
           0.32 * (cos3 * kCos6 - sin3 * kSin6) - 0.20 * (cos4 * kCos63 + sin4 * kSin63);
}

}  // namespace

LabValue ToLabValue(const LABVector& axLab) {
    return {axLab[0], axLab[1], axLab[2]};
}

double DeltaEab(const LabValue& axReference, const LabValue& axSample) {
    if (!Finite(axReference) || !Finite(axSample)) return kNaN;
    const double dL = axSample.L - axReference.L;
    const double da = axSample.a - axReference.a;
    const double db = axSample.b - axReference.b;
    return std::sqrt(dL * dL + da * da + db * db);
}

double DeltaE94(const LabValue& axReference, const LabValue& axSample,
                Cie94Application axApplication) {
    const bool textiles = axApplication == Cie94Application::kTextiles;
    return DeltaE94(axReference, axSample,
                    textiles ? Cie94Parameters{2.0, 0.048, 0.014, false}
                             : Cie94Parameters{1.0, 0.045, 0.015, false});
}

double DeltaE94(const LabValue& axReference, const LabValue& axSample,
                const Cie94Parameters& axParameters) {
    if (!Finite(axReference) || !Finite(axSample)) return kNaN;
    const double c1 = Chroma(axReference);
    const double c2 = Chroma(axSample);
    const double dC = c1 - c2;
    const double dL = (axReference.L - axSample.L) / axParameters.kL;
    const double c = axParameters.geometricMeanChroma ? std::sqrt(c1 * c2) : c1;
    const double sc = 1.0 + axParameters.k1 * c;
    const double sh = 1.0 + axParameters.k2 * c;
    const double dh2 = HueDifferenceSquared(axReference, axSample, dC);
    return std::sqrt(dL * dL + (dC / sc) * (dC / sc) + dh2 / (sh * sh));
}

double DeltaECMC(const LabValue& axReference, const LabValue& axSample, double axLightness,
                 double axChroma) {
    if (!Finite(axReference) || !Finite(axSample)) return kNaN;
    const double l1 = axReference.L;
    const double c1 = Chroma(axReference);
    const double h1 = HueDegrees(axReference.b, axReference.a);
    const double dC = c1 - Chroma(axSample);
    const double dL = l1 - axSample.L;
    const double sl = l1 < 16.0 ? 0.511 : 0.040975 * l1 / (1.0 + 0.01765 * l1);
    const double sc = 0.0638 * c1 / (1.0 + 0.0131 * c1) + 0.638;
    const double c4 = c1 * c1 * c1 * c1;
    const double f = std::sqrt(c4 / (c4 + 1900.0));
    const double t = (h1 >= 164.0 && h1 <= 345.0)
                         ? 0.56 + std::fabs(0.2 * std::cos((h1 + 168.0) * kDegree))
                         : 0.36 + std::fabs(0.4 * std::cos((h1 + 35.0) * kDegree));
    const double sh = sc * (f * t + 1.0 - f);
    const double tl = dL / (axLightness * sl);
    const double tc = dC / (axChroma * sc);
    return std::sqrt(tl * tl + tc * tc +
                     HueDifferenceSquared(axReference, axSample, dC) / (sh * sh));
}

namespace {

// a' and C' of a pair: a' stretches the a axis near neutral so that greys of
// small chroma weigh as observers see them.
struct Primed {
    double a1, a2, c1, c2;
};

Primed Prime(const LabValue& p1, const LabValue& p2) {
    const double cMean = 0.5 * (Chroma(p1) + Chroma(p2));
    const double cMean7 = Pow7(cMean);
    const double stretch = 1.5 - 0.5 * std::sqrt(cMean7 / (cMean7 + k25Pow7));  // 1 + G
    const double a1 = stretch * p1.a;
    const double a2 = stretch * p2.a;
    return {a1, a2, std::sqrt(a1 * a1 + p1.b * p1.b), std::sqrt(a2 * a2 + p2.b * p2.b)};
}

// CIEDE2000 through hue angles, step by step as Sharma, Wu and Dalal write
// it; used where the vector form below has no direction to work with (a
// neutral colour, or hues exactly opposite).
DeltaE2000Parts DeltaE2000ByAngles(const LabValue& axReference, const LabValue& axSample,
                                   const DeltaE2000Weights& axWeights) {
    const LabValue& p1 = axReference;
    const LabValue& p2 = axSample;
    const auto [a1, a2, c1, c2] = Prime(p1, p2);
    const double h1 = HueDegrees(p1.b, a1);
    const double h2 = HueDegrees(p2.b, a2);

    const bool neutral = c1 * c2 == 0.0;
    double dh = neutral ? 0.0 : h2 - h1;
    if (dh > 180.0) dh -= 360.0;
    if (dh < -180.0) dh += 360.0;
    double hMean = h1 + h2;
    if (!neutral) {
        if (std::fabs(h1 - h2) <= 180.0) {
            hMean *= 0.5;
        } else {
            hMean = hMean < 360.0 ? 0.5 * (hMean + 360.0) : 0.5 * (hMean - 360.0);
        }
    }

    DeltaE2000Parts parts;
    parts.dL = p2.L - p1.L;
    parts.dC = c2 - c1;
    parts.dH = 2.0 * std::sqrt(c1 * c2) * std::sin(0.5 * dh * kDegree);

    const double lMean = 0.5 * (p1.L + p2.L);
    const double cpMean = 0.5 * (c1 + c2);
    const double l50 = (lMean - 50.0) * (lMean - 50.0);
    const double sl = 1.0 + 0.015 * l50 / std::sqrt(20.0 + l50);
    const double sc = 1.0 + 0.045 * cpMean;
    const double hRad = hMean * kDegree;
    const double sh = 1.0 + 0.015 * cpMean * HueWeighting(std::cos(hRad), std::sin(hRad));
    const double x = (hMean - 275.0) / 25.0;
    const double dTheta = 30.0 * std::exp(-x * x);
    const double cpMean7 = Pow7(cpMean);
    const double rc = 2.0 * std::sqrt(cpMean7 / (cpMean7 + k25Pow7));
    const double rt = -std::sin(2.0 * dTheta * kDegree) * rc;

    const double tl = parts.dL / (axWeights.kL * sl);
    const double tc = parts.dC / (axWeights.kC * sc);
    const double th = parts.dH / (axWeights.kH * sh);
    const double sum = tl * tl + tc * tc + th * th + rt * tc * th;
    parts.dE = std::sqrt(NonNegative(sum));
    return parts;
}

// The weighting and the total from ΔL', ΔC', ΔH' and the mean L', C', hue.
// `rotation` is the rotation term's -sin(2 Δθ) (without RC).
double Ciede2000Total(const DeltaE2000Parts& parts, double lMean, double cpMean, double cosHue,
                      double sinHue, double rotation, const DeltaE2000Weights& axWeights) {
    const double l50 = (lMean - 50.0) * (lMean - 50.0);
    const double sl = 1.0 + 0.015 * l50 / std::sqrt(20.0 + l50);
    const double sc = 1.0 + 0.045 * cpMean;
    const double sh = 1.0 + 0.015 * cpMean * HueWeighting(cosHue, sinHue);
    const double cpMean7 = Pow7(cpMean);
    const double rc = 2.0 * std::sqrt(cpMean7 / (cpMean7 + k25Pow7));
    const double rt = rotation * rc;
    const double tl = parts.dL / (axWeights.kL * sl);
    const double tc = parts.dC / (axWeights.kC * sc);
    const double th = parts.dH / (axWeights.kH * sh);
    const double sum = tl * tl + tc * tc + th * th + rt * tc * th;
    return std::sqrt(NonNegative(sum));
}

}  // namespace

// The same formula with the hues handled as unit vectors instead of angles:
// ΔH' = 2 sqrt(C1 C2) sin(Δh/2) is sign(u1 x u2) sqrt(2 (C1 C2 - a1 a2 - b1 b2)),
// and the mean hue is the direction of u1 + u2 (the bisector of the smaller
// arc, which is what the angle rules of the formula pick). One atan2 instead
// of two, and no sine of the hue difference or cosines of the mean hue.
DeltaE2000Parts DeltaE2000Detailed(const LabValue& axReference, const LabValue& axSample,
                                   const DeltaE2000Weights& axWeights) {
    if (!Finite(axReference) || !Finite(axSample)) return {kNaN, kNaN, kNaN, kNaN};
    const LabValue& p1 = axReference;
    const LabValue& p2 = axSample;
    const auto [a1, a2, c1, c2] = Prime(p1, p2);
    const double c12 = c1 * c2;
    const double dot = a1 * a2 + p1.b * p2.b;
    const double cross = a1 * p2.b - a2 * p1.b;
    // The bisector u1 + u2, scaled by C1 C2 to avoid two divisions.
    const double bx = a1 * c2 + a2 * c1;
    const double by = p1.b * c2 + p2.b * c1;
    const double bisector = std::sqrt(bx * bx + by * by);
    if (c12 == 0.0 || cross == 0.0 || !(bisector > 1e-12 * c12)) {
        return DeltaE2000ByAngles(axReference, axSample, axWeights);
    }
    DeltaE2000Parts parts;
    parts.dL = p2.L - p1.L;
    parts.dC = c2 - c1;
    const double chord = 2.0 * (c12 - dot);
    parts.dH = std::copysign(std::sqrt(NonNegative(chord)), cross);
    const double inverse = 1.0 / bisector;
    const double cosHue = bx * inverse;
    const double sinHue = by * inverse;
    // The rotation term lives around the blue hue 275°: for a mean hue below
    // 125° it is below 1e-15 and not worth an atan2, exp and sin.
    constexpr double kCos125 = -0.57357643635104609;
    double rotation = 0.0;
    if (!(sinHue >= 0.0 && cosHue > kCos125)) {
        // The hue's distance from 275°, from the vector rotated by -275°.
        constexpr double kCos275 = 0.087155742747658166, kSin275 = -0.99619469809174553;
        constexpr double kRadiansTo25Degrees = 180.0 / kPi / 25.0;
        const double x =
            std::atan2(sinHue * kCos275 - cosHue * kSin275, cosHue * kCos275 + sinHue * kSin275) *
            kRadiansTo25Degrees;
        rotation = -std::sin(2.0 * 30.0 * std::exp(-x * x) * kDegree);
    }
    parts.dE = Ciede2000Total(parts, 0.5 * (p1.L + p2.L), 0.5 * (c1 + c2), cosHue, sinHue, rotation,
                              axWeights);
    return parts;
}

double DeltaE2000(const LabValue& axReference, const LabValue& axSample,
                  const DeltaE2000Weights& axWeights) {
    return DeltaE2000Detailed(axReference, axSample, axWeights).dE;
}

double DeltaEab(const LABVector& axReference, const LABVector& axSample) {
    return DeltaEab(ToLabValue(axReference), ToLabValue(axSample));
}

double DeltaE94(const LABVector& axReference, const LABVector& axSample,
                Cie94Application axApplication) {
    return DeltaE94(ToLabValue(axReference), ToLabValue(axSample), axApplication);
}

double DeltaECMC(const LABVector& axReference, const LABVector& axSample, double axLightness,
                 double axChroma) {
    return DeltaECMC(ToLabValue(axReference), ToLabValue(axSample), axLightness, axChroma);
}

DeltaE2000Parts DeltaE2000Detailed(const LABVector& axReference, const LABVector& axSample,
                                   const DeltaE2000Weights& axWeights) {
    return DeltaE2000Detailed(ToLabValue(axReference), ToLabValue(axSample), axWeights);
}

double DeltaE2000(const LABVector& axReference, const LABVector& axSample,
                  const DeltaE2000Weights& axWeights) {
    return DeltaE2000Detailed(ToLabValue(axReference), ToLabValue(axSample), axWeights).dE;
}

void DeltaE2000Batch(const float* pReference, const float* pSample, std::size_t alCount,
                     float* pDeltaE, const DeltaE2000Weights& axWeights) {
    for (std::size_t i = 0; i < alCount; ++i) {
        const float* r = pReference + 3 * i;
        const float* s = pSample + 3 * i;
        pDeltaE[i] =
            static_cast<float>(DeltaE2000({r[0], r[1], r[2]}, {s[0], s[1], s[2]}, axWeights));
    }
}

namespace {
struct MethodName {
    const char* name;
    DeltaEMethod method;
};
constexpr MethodName kMethodNames[] = {
    {"2000", DeltaEMethod::kCiede2000},
    {"00", DeltaEMethod::kCiede2000},
    {"ab", DeltaEMethod::kCie76},
    {"76", DeltaEMethod::kCie76},
    {"94", DeltaEMethod::kCie94},
    {"94t", DeltaEMethod::kCie94Textiles},
    {"cmc", DeltaEMethod::kCmc21},
    {"cmc21", DeltaEMethod::kCmc21},
    {"cmc11", DeltaEMethod::kCmc11},
    // colour-science's names (CMC there defaults to l = 2, c = 1).
    {"CIE 1976", DeltaEMethod::kCie76},
    {"CIE 1994", DeltaEMethod::kCie94},
    {"CIE 2000", DeltaEMethod::kCiede2000},
};
}  // namespace

bool ParseDeltaEMethod(const char* pName, DeltaEMethod* pMethod) {
    for (const MethodName& entry : kMethodNames) {
        if (pName && ::strcasecmp(pName, entry.name) == 0) {
            *pMethod = entry.method;
            return true;
        }
    }
    return false;
}

const char* DeltaEMethodName(DeltaEMethod axMethod) {
    switch (axMethod) {
        case DeltaEMethod::kCie76:
            return "dE*ab";
        case DeltaEMethod::kCie94:
            return "dE94";
        case DeltaEMethod::kCie94Textiles:
            return "dE94(textiles)";
        case DeltaEMethod::kCmc21:
            return "dE CMC(2:1)";
        case DeltaEMethod::kCmc11:
            return "dE CMC(1:1)";
        case DeltaEMethod::kCiede2000:
            return "dE00";
    }
    return "?";
}

double DeltaE(const LabValue& axReference, const LabValue& axSample, DeltaEMethod axMethod) {
    switch (axMethod) {
        case DeltaEMethod::kCie76:
            return DeltaEab(axReference, axSample);
        case DeltaEMethod::kCie94:
            return DeltaE94(axReference, axSample);
        case DeltaEMethod::kCie94Textiles:
            return DeltaE94(axReference, axSample, Cie94Application::kTextiles);
        case DeltaEMethod::kCmc21:
            return DeltaECMC(axReference, axSample, 2.0, 1.0);
        case DeltaEMethod::kCmc11:
            return DeltaECMC(axReference, axSample, 1.0, 1.0);
        case DeltaEMethod::kCiede2000:
            return DeltaE2000(axReference, axSample);
    }
    return 0.0;
}

}  // namespace nxbase
