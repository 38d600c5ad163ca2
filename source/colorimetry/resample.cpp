// Spectral resampling; see nxbase/resample.h.
#include "nxbase/resample.h"

#include <algorithm>
#include <cmath>
#include <stdexcept>

#include "nxbase/spectrafile.h"
#include "nxbase/strhelp.h"
#include "spectrafile_parse.h"

namespace nxbase {
namespace {

// Sprague's polynomial on [P0, P1]: P(x) = sum of a_k x^k with
// a_k = sum of kSprague[k][j] P_(j-2) / 24, j = 0..5 for P-2..P3.
constexpr double kSprague[6][6] = {
    {0, 0, 24, 0, 0, 0},       {2, -16, 0, 16, -2, 0},        {-1, 16, -30, 16, -1, 0},
    {-9, 39, -70, 66, -33, 7}, {13, -64, 126, -124, 61, -12}, {-5, 25, -50, 50, -25, 5},
};
// The two points before the data (P-2, P-1) from its first six; mirrored for
// the two after the data. Each row sums to 209.
constexpr double kBeforeStart[2][6] = {
    {884, -1960, 3033, -2648, 1080, -180},
    {508, -540, 488, -367, 144, -24},
};

constexpr double kSameWavelength = 1e-9;  // nm
constexpr double kEvenStep = 1e-6;        // relative spread of steps still "equal"
constexpr std::size_t kSpragueMinPoints = 6;

bool EvenlySpaced(const std::vector<double>& grid) {
    const double step = grid[1] - grid[0];
    for (std::size_t i = 2; i < grid.size(); ++i) {
        if (std::fabs(grid[i] - grid[i - 1] - step) > kEvenStep * step) return false;
    }
    return true;
}

}  // namespace

std::vector<double> StandardWavelengths() {
    std::vector<double> grid(kSpectrumSize);
    for (int i = 0; i < kSpectrumSize; ++i) grid[i] = kFirstWavelength + kWavelengthStep * i;
    return grid;
}

std::string VisibleCoverageProblem(const std::vector<double>& wavelengths) {
    if (wavelengths.empty()) return "no wavelengths";
    const double first = wavelengths.front(), last = wavelengths.back();
    if (first <= kVisibleFrom && last >= kVisibleTo) return "";
    const std::string range =
        StringHelpers::Shortest(first) + ".." + StringHelpers::Shortest(last) + " nm";
    const std::string visible =
        StringHelpers::Shortest(kVisibleFrom) + ".." + StringHelpers::Shortest(kVisibleTo) + " nm";
    if (last < kVisibleFrom || first > kVisibleTo)
        return "the spectra cover " + range + ", outside the visible " + visible;
    return "the spectra cover " + range + ", not the whole visible " + visible +
           "; holding their end values across the rest would invent colour";
}

std::string HeldEnds(const std::vector<double>& wavelengths, double from, double to) {
    std::string held;
    if (!wavelengths.empty() && wavelengths.front() > from) {
        held = "the value at " + StringHelpers::Shortest(wavelengths.front()) +
               " nm is held down to " + StringHelpers::Shortest(from) + " nm";
    }
    if (!wavelengths.empty() && wavelengths.back() < to) {
        held += (held.empty() ? "the value at " : ", the value at ") +
                StringHelpers::Shortest(wavelengths.back()) + " nm up to " +
                StringHelpers::Shortest(to) + " nm";
    }
    return held;
}

SpectralResampler::SpectralResampler(std::vector<double> source, std::vector<double> target)
    : amSource(std::move(source)) {
    if (amSource.size() < 2)
        throw std::invalid_argument("resampling needs at least two source wavelengths");
    if (target.empty()) throw std::invalid_argument("resampling needs a target wavelength");
    for (std::size_t i = 0; i < amSource.size(); ++i) {
        if (!std::isfinite(amSource[i]) || (i > 0 && amSource[i] <= amSource[i - 1])) {
            throw std::invalid_argument("source wavelengths must be finite and increase");
        }
    }
    const bool sprague = amSource.size() >= kSpragueMinPoints && EvenlySpaced(amSource);
    for (const double nm : target) {
        if (!std::isfinite(nm)) throw std::invalid_argument("target wavelengths must be finite");
        Taps taps;
        const std::size_t n = amSource.size();
        if (nm <= amSource.front() + kSameWavelength) {
            taps.first = 0;  // at or before the data: the first value
        } else if (nm >= amSource.back() - kSameWavelength) {
            taps.first = static_cast<int>(n - 1);
        } else {
            // The interval [i, i+1] holding nm.
            const std::size_t i =
                static_cast<std::size_t>(std::upper_bound(amSource.begin(), amSource.end(), nm) -
                                         amSource.begin()) -
                1;
            const double fraction = (nm - amSource[i]) / (amSource[i + 1] - amSource[i]);
            if (std::fabs(nm - amSource[i]) <= kSameWavelength) {
                taps.first = static_cast<int>(i);
            } else if (std::fabs(nm - amSource[i + 1]) <= kSameWavelength) {
                taps.first = static_cast<int>(i + 1);
            } else {
                taps = sprague ? SpragueTaps(i, fraction) : LinearTaps(i, fraction);
                amMethod = sprague ? Method::kSprague : Method::kLinear;
            }
        }
        if (taps.count == 0) {
            taps.count = 1;
            taps.weights[0] = 1.0;
        }
        amTaps.push_back(taps);
    }
}

SpectralResampler::Taps SpectralResampler::LinearTaps(std::size_t axInterval,
                                                      double axFraction) const {
    Taps taps;
    taps.first = static_cast<int>(axInterval);
    taps.count = 2;
    taps.weights[0] = 1.0 - axFraction;
    taps.weights[1] = axFraction;
    return taps;
}

SpectralResampler::Taps SpectralResampler::SpragueTaps(std::size_t axInterval,
                                                       double axFraction) const {
    const int n = static_cast<int>(amSource.size());
    const int i = static_cast<int>(axInterval);
    Taps taps;
    taps.count = kMaxTaps;
    taps.first = std::clamp(i - 2, 0, n - kMaxTaps);
    for (int j = 0; j < 6; ++j) {
        // Weight of P_(i + j - 2) at this fraction.
        double weight = 0.0;
        double power = 1.0;
        for (int k = 0; k < 6; ++k) {
            weight += kSprague[k][j] * power;
            power *= axFraction;
        }
        weight /= 24.0;
        const int point = i + j - 2;
        if (point >= 0 && point < n) {
            taps.weights[point - taps.first] += weight;
        } else if (point < 0) {
            // P-2 or P-1, made from the first six points.
            const double* row = kBeforeStart[point + 2];
            for (int m = 0; m < 6; ++m) taps.weights[m - taps.first] += weight * row[m] / 209.0;
        } else {
            // P(n) or P(n+1), made from the last six: the rows mirrored.
            const double* row = kBeforeStart[n + 1 - point];
            for (int m = 0; m < 6; ++m)
                taps.weights[n - 1 - m - taps.first] += weight * row[m] / 209.0;
        }
    }
    return taps;
}

const char* SpectralResampler::MethodName() const {
    switch (amMethod) {
        case Method::kSelection:
            return "as read";
        case Method::kSprague:
            return "Sprague";
        case Method::kLinear:
            return "linear";
    }
    return "?";
}

void SpectralResampler::Resample(const float* pIn, float* pOut) const {
    for (std::size_t t = 0; t < amTaps.size(); ++t) {
        const Taps& taps = amTaps[t];
        const float* in = pIn + taps.first;
        if (taps.count == 1) {
            pOut[t] = in[0];
            continue;
        }
        double sum = 0.0;
        for (int k = 0; k < taps.count; ++k) sum += taps.weights[k] * in[k];
        pOut[t] = static_cast<float>(sum);
    }
}

void SpectralResampler::Resample(const double* pIn, double* pOut) const {
    for (std::size_t t = 0; t < amTaps.size(); ++t) {
        const Taps& taps = amTaps[t];
        double sum = 0.0;
        for (int k = 0; k < taps.count; ++k) sum += taps.weights[k] * pIn[taps.first + k];
        pOut[t] = taps.count == 1 ? pIn[taps.first] : sum;
    }
}

void SpectralResampler::ResampleMany(const float* pIn, std::size_t alCount, float* pOut) const {
    const std::size_t in = amSource.size();
    const std::size_t out = amTaps.size();
    if (amMethod == Method::kSelection) {
        // Copies only: one index per target, no weights.
        std::vector<int> index(out);
        for (std::size_t t = 0; t < out; ++t) index[t] = amTaps[t].first;
        for (std::size_t s = 0; s < alCount; ++s) {
            const float* from = pIn + s * in;
            float* to = pOut + s * out;
            for (std::size_t t = 0; t < out; ++t) to[t] = from[index[t]];
        }
        return;
    }
    for (std::size_t s = 0; s < alCount; ++s) Resample(pIn + s * in, pOut + s * out);
}

std::vector<float> ResampleToStandard(const std::vector<double>& wavelengths,
                                      const std::vector<float>& values) {
    if (values.size() != wavelengths.size()) {
        throw std::invalid_argument("resampling needs one value per wavelength");
    }
    const SpectralResampler resampler(wavelengths);
    std::vector<float> out(resampler.TargetSize());
    resampler.Resample(values.data(), out.data());
    return out;
}

}  // namespace nxbase
