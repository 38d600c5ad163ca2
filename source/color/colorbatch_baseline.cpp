// The eight-lane batch kernels built for the compiler's default target.
#include "colorbatch_simd.h"

namespace nxbase::batch {

NarrowKernels BaselineKernels() {
    return ThisFilesNarrowKernels();
}

}  // namespace nxbase::batch
