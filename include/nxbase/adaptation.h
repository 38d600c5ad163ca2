// Chromatic adaptation between two white points: XYZ scaling, von Kries
// (Hunt-Pointer-Estevez cone responses), Bradford and CAT02 (CIECAM02), all as
// the linear transform M^-1 diag(cone(destination white) / cone(source white)) M.
// The matrices are the published ones (Bradford as in ICC.1 Annex E; CAT02
// from CIE 159:2004), in double precision. White points are XYZ on any scale;
// only their ratios matter, and a colour keeps the scale it comes in.
#ifndef NXBASE_ADAPTATION_H_
#define NXBASE_ADAPTATION_H_

#include <array>

#include "nxbase/export.h"

class MeasuringCondition;
class XYZVector;

namespace nxbase {

using Matrix3 = std::array<std::array<double, 3>, 3>;
using Tristimulus = std::array<double, 3>;

enum class AdaptationMethod { kXYZScaling, kVonKries, kBradford, kCat02 };

// "xyz" (or "scaling"), "vonkries", "bradford", "cat02", without ASCII case.
NXBASE_EXPORT bool ParseAdaptationMethod(const char* pName, AdaptationMethod* pMethod);

// The cone-response matrix M of a method (identity for XYZ scaling).
NXBASE_EXPORT Matrix3 ConeResponseMatrix(AdaptationMethod axMethod);

// The matrix taking XYZ seen under axSource's white to the corresponding
// colour under axDestination's white. The whites may be on any scale (Y = 1
// or Y = 100, each its own): only their chromaticities count, and the colour
// keeps its scale. Throws std::invalid_argument for a white with a component
// that is not positive and finite, or a zero cone response.
NXBASE_EXPORT Matrix3 AdaptationMatrix(const Tristimulus& axSource,
                                       const Tristimulus& axDestination,
                                       AdaptationMethod axMethod = AdaptationMethod::kBradford);

NXBASE_EXPORT Tristimulus Apply(const Matrix3& axMatrix, const Tristimulus& axXYZ);
NXBASE_EXPORT Matrix3 Invert(const Matrix3& axMatrix);

// The white point (Y = 100) of a condition's illuminant and observer.
NXBASE_EXPORT Tristimulus WhitePointOf(const MeasuringCondition& axCondition);

// A colour under its own condition's white, adapted to axDestination's
// illuminant and observer; the result carries axDestination. Throws as
// AdaptationMatrix does.
NXBASE_EXPORT XYZVector Adapt(const XYZVector& axXYZ, const MeasuringCondition& axDestination,
                              AdaptationMethod axMethod = AdaptationMethod::kBradford);

}  // namespace nxbase

#endif  // NXBASE_ADAPTATION_H_
