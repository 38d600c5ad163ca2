// The fine-grid kernels built for x86-64-v3 (AVX2).
#include "finegrid_sum.h"

namespace nxbase::finegrid {

Kernels Avx2Kernels() {
    return TheseKernels();
}

}  // namespace nxbase::finegrid
