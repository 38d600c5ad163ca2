// The eight-lane batch kernels built for x86-64-v3 (AVX2, FMA unused: no contraction).
#include "colorbatch_simd.h"

namespace nxbase::batch {

NarrowKernels Avx2Kernels() {
    return ThisFilesNarrowKernels();
}

}  // namespace nxbase::batch
