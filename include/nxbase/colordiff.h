// Colour-difference formulas of the graphic arts and textile trades over CIE
// 1976 L*a*b*: ΔE*ab (CIE 1976), ΔE94 (CIE 116-1995), CMC(l:c) (BS 6923 /
// ISO 105-J03) and CIEDE2000 (CIE 142-2001, following the implementation notes
// of Sharma, Wu and Dalal 2005, whose 34 test pairs it reproduces to 1e-4).
//
// All formulas run in double precision; a triple holding NaN or infinity gives
// NaN, never a match. The first argument is the reference
// (standard), the second the sample: ΔE94 and CMC are not symmetric, and take
// their weighting functions from the reference. A LABVector tagged DIN99 is
// taken for CIELAB values as they stand; convert it first (GetCIELab).
#ifndef NXBASE_COLORDIFF_H_
#define NXBASE_COLORDIFF_H_

#include <cstddef>

#include "nxbase/export.h"

class LABVector;

namespace nxbase {

struct LabValue {
    double L = 0.0;
    double a = 0.0;
    double b = 0.0;
};

NXBASE_EXPORT LabValue ToLabValue(const LABVector& axLab);

// CIE 1976: the Euclidean distance.
NXBASE_EXPORT double DeltaEab(const LabValue& axReference, const LabValue& axSample);

// CIE 1994 parametric constants: graphic arts kL = 1, K1 = 0.045, K2 = 0.015;
// textiles kL = 2, K1 = 0.048, K2 = 0.014 (kC = kH = 1 in both).
enum class Cie94Application { kGraphicArts, kTextiles };
NXBASE_EXPORT double DeltaE94(const LabValue& axReference, const LabValue& axSample,
                              Cie94Application axApplication = Cie94Application::kGraphicArts);
// The formula with its constants given. SC = 1 + K1 C, SH = 1 + K2 C with C the
// reference's chroma, or the geometric mean of both chromas (a symmetric
// variant; LittleCMS's cmsCIE94DeltaE is kL = 1, K1 = 0.048, K2 = 0.014 so).
struct Cie94Parameters {
    double kL = 1.0;
    double k1 = 0.045;
    double k2 = 0.015;
    bool geometricMeanChroma = false;
};
NXBASE_EXPORT double DeltaE94(const LabValue& axReference, const LabValue& axSample,
                              const Cie94Parameters& axParameters);

// CMC(l:c); 2:1 is the acceptability form, 1:1 perceptibility.
NXBASE_EXPORT double DeltaECMC(const LabValue& axReference, const LabValue& axSample,
                               double axLightness = 2.0, double axChroma = 1.0);

// CIEDE2000 with its parts. dL, dC, dH are ΔL', ΔC', ΔH' (sample minus
// reference, before weighting); the total is
// sqrt((dL/(kL SL))² + (dC/(kC SC))² + (dH/(kH SH))² + RT (dC/(kC SC)) (dH/(kH SH))).
struct DeltaE2000Parts {
    double dE = 0.0;
    double dL = 0.0;
    double dC = 0.0;
    double dH = 0.0;
};
struct DeltaE2000Weights {
    double kL = 1.0;
    double kC = 1.0;
    double kH = 1.0;
};
NXBASE_EXPORT DeltaE2000Parts DeltaE2000Detailed(const LabValue& axReference,
                                                 const LabValue& axSample,
                                                 const DeltaE2000Weights& axWeights = {});
NXBASE_EXPORT double DeltaE2000(const LabValue& axReference, const LabValue& axSample,
                                const DeltaE2000Weights& axWeights = {});

// The same over LABVectors.
NXBASE_EXPORT double DeltaEab(const LABVector& axReference, const LABVector& axSample);
NXBASE_EXPORT double DeltaE94(const LABVector& axReference, const LABVector& axSample,
                              Cie94Application axApplication = Cie94Application::kGraphicArts);
NXBASE_EXPORT double DeltaECMC(const LABVector& axReference, const LABVector& axSample,
                               double axLightness = 2.0, double axChroma = 1.0);
NXBASE_EXPORT DeltaE2000Parts DeltaE2000Detailed(const LABVector& axReference,
                                                 const LABVector& axSample,
                                                 const DeltaE2000Weights& axWeights = {});
NXBASE_EXPORT double DeltaE2000(const LABVector& axReference, const LABVector& axSample,
                                const DeltaE2000Weights& axWeights = {});

// CIEDE2000 of alCount pairs of L, a, b triples (pReference[3i..3i+2] against
// pSample[3i..3i+2]) into pDeltaE[i]; the arrays may be any alignment.
NXBASE_EXPORT void DeltaE2000Batch(const float* pReference, const float* pSample,
                                   std::size_t alCount, float* pDeltaE,
                                   const DeltaE2000Weights& axWeights = {});

// A formula by name, for tools and scripts: "ab" (or "76"), "94" (graphic
// arts), "94t" (textiles), "cmc" (2:1), "cmc11" (1:1), "2000" (or "00"), and
// colour-science's "CIE 1976", "CIE 1994", "CIE 2000"; any case.
enum class DeltaEMethod { kCie76, kCie94, kCie94Textiles, kCmc21, kCmc11, kCiede2000 };
NXBASE_EXPORT bool ParseDeltaEMethod(const char* pName, DeltaEMethod* pMethod);
NXBASE_EXPORT const char* DeltaEMethodName(DeltaEMethod axMethod);
NXBASE_EXPORT double DeltaE(const LabValue& axReference, const LabValue& axSample,
                            DeltaEMethod axMethod);

}  // namespace nxbase

#endif  // NXBASE_COLORDIFF_H_
