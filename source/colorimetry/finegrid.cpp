// Tristimulus values at the spectra's own interval; see nxbase/finegrid.h.
#include "nxbase/finegrid.h"

#include <algorithm>
#include <cmath>
#include <limits>
#include <stdexcept>

#include "finegrid_sum.h"
#include "klume/cmetry/data.h"
#include "nxbase/cielab.h"
#include "nxbase/meascond.h"
#include "nxbase/thread.h"
#include "toolkit/system.h"

namespace nxbase {
namespace {

// The range the colour-matching functions are summed over (CIE 15).
constexpr double kSumFrom = 360.0;
constexpr double kSumTo = 830.0;
// Equal steps within this much make a regular grid.
constexpr double kStepTolerance = 0.01;
constexpr double kCoarsestStep = 10.0;

// A colour-matching function at `nm`: linear between its 1 nm values, zero
// outside its table.
double CmfAt(const klume::cmetry::IObserver& observer, int channel, double nm) {
    const double position = nm - observer.GetFirstWavelength();
    const int count = observer.GetSampleCount();
    if (position < 0.0 || position > count - 1) return 0.0;
    const int below = std::min(static_cast<int>(position), count - 2);
    const double t = position - below;
    const double* cmf = observer.GetCMF(channel);
    return cmf[below] + t * (cmf[below + 1] - cmf[below]);
}

}  // namespace

namespace {
// CIELAB divides by the white: each of its components must be positive and
// finite, and normal, so that its reciprocal is finite too.
bool UsableWhite(const std::array<double, 3>& axWhite) {
    for (double component : axWhite) {
        if (!(component >= std::numeric_limits<double>::min() && std::isfinite(component)))
            return false;
    }
    return true;
}
constexpr double kNaN = std::numeric_limits<double>::quiet_NaN();

// The widest instruction set kernels are built for that the machine has.
toolkit::VectorIsa Widest() {
#ifdef NXBASE_FINEGRID_X86_KERNELS
    return toolkit::MachineVectorIsa();
#else
    return toolkit::VectorIsa::kBaseline;
#endif
}

finegrid::Kernels KernelsFor([[maybe_unused]] toolkit::VectorIsa isa) {
#ifdef NXBASE_FINEGRID_X86_KERNELS
    switch (isa) {
        case toolkit::VectorIsa::kAvx512:
            return finegrid::Avx512Kernels();
        case toolkit::VectorIsa::kAvx2:
            return finegrid::Avx2Kernels();
        case toolkit::VectorIsa::kBaseline:
            break;
    }
#endif
    return finegrid::BaselineKernels();
}

// The kernels in use: the widest, chosen once; the tests switch them.
finegrid::Kernels& TheKernels() {
    static finegrid::Kernels kernels = KernelsFor(Widest());
    return kernels;
}
}  // namespace

std::array<double, 3> CielabOf(const std::array<double, 3>& axXYZ,
                               const std::array<double, 3>& axWhite) {
    std::array<double, 3> lab = axXYZ;
    CielabInPlace(lab.data(), 1, axWhite);
    return lab;
}

void CielabInPlace(double* pXYZ, std::size_t alCount, const std::array<double, 3>& axWhite) {
    if (!UsableWhite(axWhite)) {
        std::fill(pXYZ, pXYZ + 3 * alCount, kNaN);
        return;
    }
    TheKernels().lab(pXYZ, alCount, axWhite.data());
}

std::array<double, 3> XyzOfCielab(const std::array<double, 3>& axLab,
                                  const std::array<double, 3>& axWhite) {
    if (!UsableWhite(axWhite) ||
        !std::all_of(axLab.begin(), axLab.end(), [](double v) { return std::isfinite(v); }))
        return {kNaN, kNaN, kNaN};
    const double fy = (axLab[0] + 16.0) / 116.0;
    return {cielab::FInverse(axLab[1] / 500.0 + fy) * axWhite[0], cielab::FInverse(fy) * axWhite[1],
            cielab::FInverse(fy - axLab[2] / 200.0) * axWhite[2]};
}

namespace {

using Weights = std::array<std::vector<double>, 3>;

// The step of a regular grid (equal steps within kStepTolerance), or 0.
double RegularStep(const std::vector<double>& wavelengths) {
    const std::size_t n = wavelengths.size();
    const double step = (wavelengths.back() - wavelengths.front()) / static_cast<double>(n - 1);
    for (std::size_t k = 0; k < n; ++k) {
        if (std::fabs(wavelengths[k] - (wavelengths.front() + step * static_cast<double>(k))) >
            kStepTolerance) {
            return 0.0;
        }
    }
    return step;
}

// On a regular grid: every grid wavelength within the summation range, the
// measured ones and those beyond the ends, where the end values are held.
double AddRegularWeights(const std::vector<double>& grid, double step,
                         const klume::cmetry::IIlluminant& illuminant,
                         const klume::cmetry::IObserver& observer, Weights& weights) {
    const std::size_t n = grid.size();
    const double first = grid.front();
    const long from = static_cast<long>(std::ceil((kSumFrom - first) / step - 1e-9));
    const long to = static_cast<long>(std::floor((kSumTo - first) / step + 1e-9));
    double ySum = 0.0;
    for (long j = from; j <= to; ++j) {
        const double nm = first + step * static_cast<double>(j);
        const std::size_t k =
            static_cast<std::size_t>(std::clamp<long>(j, 0, static_cast<long>(n) - 1));
        const double power = illuminant.GetPower(nm);
        for (int c = 0; c < 3; ++c) weights[c][k] += power * CmfAt(observer, c, nm);
        ySum += power * CmfAt(observer, 1, nm);
    }
    return ySum;
}

// On an uneven grid: every whole nanometre of the summation range, over the
// samples interpolated linearly (held beyond the ends); each nanometre's
// product goes to its two neighbouring samples in proportion.
double AddUnevenWeights(const std::vector<double>& grid,
                        const klume::cmetry::IIlluminant& illuminant,
                        const klume::cmetry::IObserver& observer, Weights& weights) {
    const std::size_t last = grid.size() - 1;
    std::size_t k = 0;  // grid[k] <= nm < grid[k + 1] inside the grid
    double ySum = 0.0;
    for (double nm = kSumFrom; nm <= kSumTo; nm += 1.0) {
        const double power = illuminant.GetPower(nm);
        while (k + 1 < last && grid[k + 1] <= nm) ++k;
        double share = 1.0;  // of sample k; the rest goes to k + 1
        std::size_t at = k;
        if (nm <= grid.front()) {
            at = 0;
        } else if (nm >= grid[last]) {
            at = last;
        } else {
            share = (grid[k + 1] - nm) / (grid[k + 1] - grid[k]);
        }
        for (int c = 0; c < 3; ++c) {
            const double product = power * CmfAt(observer, c, nm);
            weights[c][at] += share * product;
            if (share < 1.0) weights[c][at + 1] += (1.0 - share) * product;
        }
        ySum += power * CmfAt(observer, 1, nm);
    }
    return ySum;
}

}  // namespace

bool FineGridTristimulus::Applies(const std::vector<double>& wavelengths) {
    const std::size_t n = wavelengths.size();
    if (n < 3) return false;
    double smallest = std::numeric_limits<double>::infinity();
    for (std::size_t k = 1; k < n; ++k) {
        const double step = wavelengths[k] - wavelengths[k - 1];
        if (!(step > 0.0) || !std::isfinite(step)) return false;
        smallest = std::min(smallest, step);
    }
    const double regular = RegularStep(wavelengths);
    return (regular > 0.0 ? regular : smallest) < kCoarsestStep - kStepTolerance;
}

FineGridTristimulus::FineGridTristimulus(const MeasuringCondition& axCondition,
                                         std::vector<double> wavelengths)
    : amWavelengths(std::move(wavelengths)) {
    if (!Applies(amWavelengths)) {
        throw std::invalid_argument(
            "FineGridTristimulus: not an increasing grid with steps below 10 nm");
    }
    const auto illuminant = axCondition.GetIllum().GetIlluminant();
    const auto observer = axCondition.GetObserver().GetObserver();
    for (auto& channel : amWeights) channel.assign(amWavelengths.size(), 0.0);
    const double step = RegularStep(amWavelengths);
    const double ySum =
        step > 0.0 ? AddRegularWeights(amWavelengths, step, *illuminant, *observer, amWeights)
                   : AddUnevenWeights(amWavelengths, *illuminant, *observer, amWeights);
    // Zeros after the last weight, up to a whole step of the sum's lanes.
    constexpr std::size_t kStep = finegrid::kLanes;
    for (auto& channel : amWeights)
        channel.resize((channel.size() + kStep - 1) / kStep * kStep, 0.0);
    const double scale = ySum > 0.0 ? 100.0 / ySum : 0.0;
    for (int c = 0; c < 3; ++c) {
        double white = 0.0;
        for (double& w : amWeights[c]) {
            w *= scale;
            white += w;
        }
        amWhite[c] = white;
    }
}

namespace {

// Spectra per thread below which starting a thread costs more than it saves,
// for spectra of 36 values; longer spectra need proportionally fewer.
constexpr std::size_t kMinValuesPerThread = 16384 * 36;

}  // namespace

finegrid::Kernels finegrid::BaselineKernels() {
    return finegrid::TheseKernels();
}

void FineGridTristimulus::Sum(const float* pSpectra, std::size_t alCount, double* pXYZ) const {
    TheKernels().sum(amWeights[0].data(), amWeights[1].data(), amWeights[2].data(),
                     amWavelengths.size(), pSpectra, alCount, pXYZ);
}

std::array<double, 3> FineGridTristimulus::ToXYZ(const float* pValues) const {
    std::array<double, 3> xyz{};
    Sum(pValues, 1, xyz.data());
    return xyz;
}

std::array<double, 3> FineGridTristimulus::ToLab(const float* pValues) const {
    return CielabOf(ToXYZ(pValues), amWhite);
}

template <bool kLab>
void FineGridTristimulus::Convert(const float* pSpectra, std::size_t alCount, float* pOut) const {
    if (kLab && !UsableWhite(amWhite)) {
        std::fill(pOut, pOut + 3 * alCount, std::numeric_limits<float>::quiet_NaN());
        return;
    }
    TheKernels().convert(amWeights[0].data(), amWeights[1].data(), amWeights[2].data(),
                         amWavelengths.size(), pSpectra, alCount, kLab ? amWhite.data() : nullptr,
                         pOut);
}

template <bool kLab>
void FineGridTristimulus::ConvertParallel(const float* pSpectra, std::size_t alCount, float* pOut,
                                          unsigned alThreads) const {
    const std::size_t n = amWavelengths.size();
    const std::size_t minPerThread = std::max<std::size_t>(kMinValuesPerThread / n, 1);
    RunInParts(alCount, alThreads, minPerThread, 1, [&](std::size_t first, std::size_t count) {
        Convert<kLab>(pSpectra + first * n, count, pOut + 3 * first);
    });
}

void FineGridTristimulus::ToXYZ(const float* pSpectra, std::size_t alCount, float* pOut) const {
    Convert<false>(pSpectra, alCount, pOut);
}

void FineGridTristimulus::ToLab(const float* pSpectra, std::size_t alCount, float* pOut) const {
    Convert<true>(pSpectra, alCount, pOut);
}

void FineGridTristimulus::ToXYZParallel(const float* pSpectra, std::size_t alCount, float* pOut,
                                        unsigned alThreads) const {
    ConvertParallel<false>(pSpectra, alCount, pOut, alThreads);
}

void FineGridTristimulus::ToLabParallel(const float* pSpectra, std::size_t alCount, float* pOut,
                                        unsigned alThreads) const {
    ConvertParallel<true>(pSpectra, alCount, pOut, alThreads);
}

namespace detail {

bool UseFineGridIsa(toolkit::VectorIsa isa) {
    if (isa > Widest()) return false;
    TheKernels() = KernelsFor(isa);
    return true;
}

}  // namespace detail
}  // namespace nxbase
