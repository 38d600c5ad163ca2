// CIE 1976 L*a*b*'s function f and its inverse (CIE 15:2004, 8.2.1), with the
// constants the library uses, in double and in single precision:
//   f(t)     = t^(1/3)                 for t > 0.008856, else 7.787 t + 16/116
//   f^-1(f)  = f^3                     for f > 0.206893034423 (= f(0.008856)),
//              else (f - 16/116) / 7.787
// The boundaries take the linear branch. Every CIELAB computation of the
// library (the vectors, the batch path, the fine grid, the screen colours)
// takes its constants from here.
#ifndef NXBASE_CIELAB_H_
#define NXBASE_CIELAB_H_

#include <cmath>

namespace nxbase::cielab {

constexpr double kEpsilon = 0.008856;  // t at or below: linear branch
constexpr double kKappa = 7.787;
constexpr double kOffset = 16.0 / 116.0;
constexpr double kInverseEpsilon = 0.206893034423;  // f at or below: linear branch

constexpr float kEpsilonF = 0.008856f;
constexpr float kKappaF = 7.787f;
constexpr float kOffsetF = 16.0f / 116.0f;
constexpr float kInverseEpsilonF = 0.206893034423f;
// The single-precision path takes the cube root as pow(t, 1/3 in float).
constexpr float kExponentF = 0.33333334f;

inline double F(double t) {
    return t > kEpsilon ? std::cbrt(t) : kKappa * t + kOffset;
}

inline double FInverse(double f) {
    return f > kInverseEpsilon ? f * f * f : (f - kOffset) / kKappa;
}

inline float FInverse(float f) {
    return f > kInverseEpsilonF ? f * f * f : (f - kOffsetF) / kKappaF;
}

}  // namespace nxbase::cielab

#endif  // NXBASE_CIELAB_H_
