// The fine-grid kernels built for AVX-512 F, DQ and VL.
#include "finegrid_sum.h"

namespace nxbase::finegrid {

Kernels Avx512Kernels() {
    return TheseKernels();
}

}  // namespace nxbase::finegrid
