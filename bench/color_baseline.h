// Baselines of the colour benchmarks, built with their own compiler flags.
#ifndef NXBASE_BENCH_COLOR_BASELINE_H_
#define NXBASE_BENCH_COLOR_BASELINE_H_

#include <cstddef>

namespace colorbench {

// Lab of `count` spectra (36 floats each) with weights w[3][36] and their sums.
void VectorisedLab(const float* w, const float* sums, const float* spectra, std::size_t count,
                   float* lab);
// Sum of `count` floats, read once: the memory-bandwidth yardstick.
float StreamingSum(const float* data, std::size_t count);
double StreamingSum(const double* data, std::size_t count);

}  // namespace colorbench

#endif  // NXBASE_BENCH_COLOR_BASELINE_H_
