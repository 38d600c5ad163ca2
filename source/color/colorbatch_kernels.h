// Internal: the entry points of the batch kernels, one set per instruction
// set, each built in a file of its own with that set's flags (see
// CMakeLists.txt); colorbatch.cpp picks one. What the kernels share is in
// colorbatch_simd.h.
#ifndef NXBASE_SOURCE_COLOR_COLORBATCH_KERNELS_H_
#define NXBASE_SOURCE_COLOR_COLORBATCH_KERNELS_H_

#include <cstddef>

#include "nxbase/colorbatch.h"

namespace nxbase::batch {

using PaddedWeights = detail::BatchTables;

// What a kernel saw of the results it wrote: the largest Y (XYZ) or L*
// (Lab), NaN skipped, -infinity for none; and whether every component was
// finite. A plain aggregate: the kernel files, each built for its own
// instruction set, must not define functions the linker could share.
struct Seen {
    float brightest;
    bool finite;
};

using Kernel = Seen (*)(const PaddedWeights& w, const float* src, std::size_t count, float* out);
using DoubleKernel = Seen (*)(const PaddedWeights& w, const double* src, std::size_t count,
                              float* out);

// Eight spectra per step, any count.
struct NarrowKernels {
    Kernel xyz;
    Kernel lab;
    void (*cbrt)(const float* in, std::size_t count, float* out);
};
// Sixteen spectra per step; count a multiple of sixteen.
struct WideForms {
    Kernel xyz;
    Kernel lab;
    DoubleKernel xyzDouble;
    DoubleKernel labDouble;
};
// The `streamed` forms write whole 64-byte lines around the cache, for `out`
// on a 64-byte boundary, and fence their stores before they return.
struct WideKernels {
    WideForms cached;
    WideForms streamed;
};

// colorbatch_baseline.cpp: the compiler's default target.
NarrowKernels BaselineKernels();
// colorbatch_avx2.cpp (x86-64-v3) and colorbatch_avx512.cpp (AVX-512 F, DQ,
// VL): built on x86-64 with GCC only.
NarrowKernels Avx2Kernels();
WideKernels Avx512Kernels();

constexpr int kSamples = BatchWeights::kSamples;
constexpr int kLanes = 8;

}  // namespace nxbase::batch

#endif  // NXBASE_SOURCE_COLOR_COLORBATCH_KERNELS_H_
