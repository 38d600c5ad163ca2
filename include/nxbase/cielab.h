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
#include <cstdint>
#include <cstring>
#include <limits>

namespace nxbase::cielab {

constexpr double kEpsilon = 0.008856;  // t at or below: linear branch
constexpr double kKappa = 7.787;
constexpr double kOffset = 16.0 / 116.0;
constexpr double kInverseEpsilon = 0.206893034423;  // f at or below: linear branch

// A constant, not a call: the kernels built for other instruction sets must
// not define (and so offer the linker) their own copy of a library function.
constexpr double kLargestFinite = std::numeric_limits<double>::max();

constexpr float kEpsilonF = 0.008856f;
constexpr float kKappaF = 7.787f;
constexpr float kOffsetF = 16.0f / 116.0f;
constexpr float kInverseEpsilonF = 0.206893034423f;
// The single-precision path takes the cube root as pow(t, 1/3 in float).
constexpr float kExponentF = 0.33333334f;

// t^(1/3) of a positive normal t (and of +infinity, which it keeps), within
// an ulp of the exact root, without a call: a first guess of t^(-1/3) from
// t's bits (within 3.5 %), three Newton steps for it without a division
// (3.5e-2 -> 2.5e-3 -> 1.3e-5 -> 3e-10), its square times t, and a last
// Newton step for the root itself, which squares the error once more. Faster
// than std::cbrt, which splits and scales its argument by calls, and
// computable in the lanes of a vector. Real is double, or a vector of
// doubles (GCC's vector extension) with Bits the vector of 64-bit integers
// of its size: every lane then gets the scalar's bits. In place, as a vector
// passed by value would change the ABI with the instruction set. Code built
// for another instruction set passes as Tag a type of its own unnamed
// namespace, which makes the instantiation its own.
template <class Real, class Bits, class Tag = void>
inline void TakeCubeRoot(Real& t) {
    Bits bits;
    std::memcpy(&bits, &t, sizeof bits);
    // The high word over three: times 0xAAAAAAAB, then 33 bits down (exact
    // for every 32-bit value).
    const Bits third = ((bits >> 32) * 0xAAAAAAABull) >> 33;
    const Bits guess = (0x553EF0FFull - third) << 32;
    Real r;
    std::memcpy(&r, &guess, sizeof r);
    // r (4 - t r^3) / 3 as r (4/3 - t/3 r^3): a multiplication fewer a step.
    const Real tThird = t * (1.0 / 3.0);
    r = r * ((4.0 / 3.0) - tThird * (r * r * r));
    r = r * ((4.0 / 3.0) - tThird * (r * r * r));
    r = r * ((4.0 / 3.0) - tThird * (r * r * r));
    const Real y = t * (r * r);
    const Real root = y - (y - t / (y * y)) * (1.0 / 3.0);
    t = t <= kLargestFinite ? root : t;
}

// t^(1/3) of any t: zero, subnormal, negative and NaN arguments, outside the
// steps' range, go to std::cbrt.
inline double CubeRoot(double t) {
    if (!(t >= std::numeric_limits<double>::min())) return std::cbrt(t);
    TakeCubeRoot<double, std::uint64_t>(t);
    return t;
}

inline double F(double t) {
    return t > kEpsilon ? CubeRoot(t) : kKappa * t + kOffset;
}

// F of every lane of a vector of doubles, in place (see TakeCubeRoot): both
// branches computed, each lane taking its own.
template <class Real, class Bits, class Tag = void>
inline void TakeFOfLanes(Real& t) {
    Real root = t;
    TakeCubeRoot<Real, Bits, Tag>(root);
    const Real line = kKappa * t + kOffset;
    t = t > kEpsilon ? root : line;
}

inline double FInverse(double f) {
    return f > kInverseEpsilon ? f * f * f : (f - kOffset) / kKappa;
}

inline float FInverse(float f) {
    return f > kInverseEpsilonF ? f * f * f : (f - kOffsetF) / kKappaF;
}

}  // namespace nxbase::cielab

#endif  // NXBASE_CIELAB_H_
