// Internal: the weighted sums of one spectrum in the order the batch kernels
// form them, so that colour vectors and ColorBatch agree bit for bit. Both
// translation units that include this are compiled without floating-point
// contraction (see CMakeLists.txt).
#ifndef NXBASE_SOURCE_COLOR_TRISTIMULUS_H_
#define NXBASE_SOURCE_COLOR_TRISTIMULUS_H_

#include "nxbase/cielab.h"

namespace nxbase {
namespace detail {

// S_c = sum over the 36 samples of pW[c][k] * pR[k], c = 0..2. The samples
// are taken in eight lanes j: lane j sums the products at j, 8 + j, 16 + j,
// 24 + j as ((j + 8+j) + (16+j + 24+j)) and then adds the product at 28 + j
// (with weight zero for j < 4, those samples being in the fourth chunk
// already); the lanes are added pairwise, ((0+1) + (2+3)) + ((4+5) + (6+7)).
inline void LaneSums(const float* const pW[3], const float* pR, float pOut[3]) {
    for (int c = 0; c < 3; ++c) {
        const float* w = pW[c];
        float lane[8];
        for (int j = 0; j < 8; ++j) {
            const float last = j < 4 ? pR[28 + j] * 0.0f : pR[28 + j] * w[28 + j];
            lane[j] = ((pR[j] * w[j] + pR[8 + j] * w[8 + j]) +
                       (pR[16 + j] * w[16 + j] + pR[24 + j] * w[24 + j])) +
                      last;
        }
        pOut[c] = ((lane[0] + lane[1]) + (lane[2] + lane[3])) +
                  ((lane[4] + lane[5]) + (lane[6] + lane[7]));
    }
}

// CIELAB's constants in single precision, as the batch and the vectors use them.
constexpr float kLabExponent = cielab::kExponentF;
constexpr float kLabEpsilon = cielab::kEpsilonF;
constexpr float kLabKappa = cielab::kKappaF;
constexpr float kLabOffset = cielab::kOffsetF;
static_assert(cielab::kOffsetF == 0.13793103448275862f, "16/116 in single precision");

}  // namespace detail
}  // namespace nxbase

#endif  // NXBASE_SOURCE_COLOR_TRISTIMULUS_H_
