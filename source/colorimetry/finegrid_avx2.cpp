// The fine-grid sum built for x86-64-v3 (AVX2).
#include "finegrid_sum.h"

namespace nxbase::finegrid {

void SumAvx2(const double* w0, const double* w1, const double* w2, std::size_t n,
             const float* spectra, std::size_t count, double* xyz) {
    SumSpectra(w0, w1, w2, n, spectra, count, xyz);
}

}  // namespace nxbase::finegrid
