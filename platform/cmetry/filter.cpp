#include "klume/cmetry/filter.h"

#include <cmath>
#include <map>
#include <mutex>
#include <utility>

#include "klume/cmetry/repository.h"

namespace klume {
namespace cmetry {

namespace {

// ASTM E308 practice range of the weight computation and its 10 nm grid.
constexpr int kRangeStart = 360;
constexpr int kRangeEnd = 780;
constexpr int kInterval = 10;
constexpr int kOneNmCount = kRangeEnd - kRangeStart + 1;                // 421
constexpr int kPointCount = (kRangeEnd - kRangeStart) / kInterval + 1;  // 43
constexpr int kInnerCount = kInterval - 1;  // interpolated points per interval
// Rows of the 43-row table that the E308 adjustment folds into the first and
// last measured wavelength (360, 370 -> 380; 740..780 -> 730).
constexpr int kFirstMeasuredRow = (kFirstWavelength - kRangeStart) / kInterval;  // 2
constexpr int kLastMeasuredRow = (kLastWavelength - kRangeStart) / kInterval;    // 37

static_assert(kLastMeasuredRow - kFirstMeasuredRow + 1 == kSampleCount, "grid mismatch");

// Lagrange basis polynomials of degree n - 1 through the nodes 0..n-1,
// evaluated at r: L_j(r) = prod over i != j of (r - i) / (j - i).
void LagrangeCoefficients(double r, int n, double* out) {
    for (int j = 0; j < n; ++j) {
        double product = 1.0;
        for (int i = 0; i < n; ++i) {
            if (i != j) product *= (r - i) / static_cast<double>(j - i);
        }
        out[j] = product;
    }
}

double CmfAt(const IObserver& observer, int channel, int nm) {
    const int index = nm - observer.GetFirstWavelength();
    if (index < 0 || index >= observer.GetSampleCount()) return 0.0;
    return observer.GetCMF(channel)[index];
}

}  // namespace

// ASTM E2022-16 weighting factors for a 10 nm measurement interval from 1 nm
// data over 360..780 nm, then the ASTM E308-15 end adjustment to 380..730 nm.
//
// With P(l) = S(l) * cmf(l) at 1 nm, each 10 nm point k starts with P at its
// own wavelength; every 1 nm point between two 10 nm points adds its P times
// the Lagrange coefficients of the surrounding points: cubic (4 points, the
// point lying in the middle interval) inside, quadratic (3 points) in the
// first and last interval. The table is scaled so that the y column sums to
// 100.
WeightTable ComputeWeights(const IIlluminant& illuminant, const IObserver& observer) {
    double s[kOneNmCount];
    for (int i = 0; i < kOneNmCount; ++i) s[i] = illuminant.GetPower(kRangeStart + i);

    // Coefficients for the 9 points inside an interval: boundary (quadratic,
    // r = 0.1..0.9 from the first node) and inner (cubic, r = 1.1..1.9).
    double boundary[kInnerCount][3];
    double inner[kInnerCount][4];
    for (int j = 0; j < kInnerCount; ++j) {
        const double r = (j + 1) / static_cast<double>(kInterval);
        LagrangeCoefficients(r, 3, boundary[j]);
        LagrangeCoefficients(r + 1.0, 4, inner[j]);
    }

    double w[kPointCount][3];
    for (int c = 0; c < 3; ++c) {
        double p[kOneNmCount];
        for (int i = 0; i < kOneNmCount; ++i) p[i] = s[i] * CmfAt(observer, c, kRangeStart + i);
        for (int k = 0; k < kPointCount; ++k) w[k][c] = p[k * kInterval];

        // First interval: nodes 0, 1, 2.
        for (int j = 0; j < kInnerCount; ++j) {
            for (int k = 0; k < 3; ++k) w[k][c] += boundary[j][k] * p[j + 1];
        }
        // Last interval: nodes last, last - 1, last - 2, mirrored.
        const int last = kPointCount - 1;
        const int lastFirst = (kPointCount - 1) * kInterval - kInnerCount;
        for (int j = 0; j < kInnerCount; ++j) {
            for (int k = last; k > last - 3; --k) {
                w[k][c] += boundary[kInnerCount - j - 1][last - k] * p[j + lastFirst];
            }
        }
        // Intervals between: nodes j .. j + 3 around the interval (j+1, j+2).
        for (int j = 0; j < kPointCount - 3; ++j) {
            for (int k = 0; k < kInnerCount; ++k) {
                const double v = p[kInterval * (j + 1) + 1 + k];
                for (int m = 0; m < 4; ++m) w[j + m][c] += inner[k][m] * v;
            }
        }
    }

    double sumY = 0.0;
    for (int k = 0; k < kPointCount; ++k) sumY += w[k][1];
    const double scale = 100.0 / sumY;

    WeightTable table;
    for (int c = 0; c < 3; ++c) {
        double rows[kPointCount];
        for (int k = 0; k < kPointCount; ++k) rows[k] = w[k][c] * scale;
        for (int k = 0; k < kFirstMeasuredRow; ++k) rows[kFirstMeasuredRow] += rows[k];
        for (int k = kPointCount - 1; k > kLastMeasuredRow; --k) rows[kLastMeasuredRow] += rows[k];
        for (int i = 0; i < kSampleCount; ++i) table.channel[c][i] = rows[kFirstMeasuredRow + i];
    }
    return table;
}

CMetryFilter::CMetryFilter(boost::shared_ptr<IIlluminant> illuminant,
                           boost::shared_ptr<IObserver> observer)
    : amIlluminant(std::move(illuminant)), amObserver(std::move(observer)) {
    amWeights = ComputeWeights(*amIlluminant, *amObserver);
    for (int c = 0; c < 3; ++c) {
        for (int i = 0; i < kSampleCount; ++i) {
            amFloatWeights[c][i] = static_cast<float>(amWeights.channel[c][i]);
        }
    }
}

namespace {

struct FilterCache {
    std::mutex mutex;
    std::map<std::pair<const IIlluminant*, const IObserver*>, boost::shared_ptr<const CMetryFilter>>
        filters;
};

FilterCache& GetFilterCache() {
    static FilterCache cache;
    return cache;
}

// The cached filter of repository objects (which live for the process, so
// their addresses are stable keys).
boost::shared_ptr<const CMetryFilter> Cached(const boost::shared_ptr<IIlluminant>& illuminant,
                                             const boost::shared_ptr<IObserver>& observer) {
    FilterCache& cache = GetFilterCache();
    std::lock_guard<std::mutex> lock(cache.mutex);
    auto& slot = cache.filters[{illuminant.get(), observer.get()}];
    if (!slot) slot.reset(new CMetryFilter(illuminant, observer));
    return slot;
}

}  // namespace

boost::shared_ptr<const CMetryFilter> CMetryFilter::Find(const std::string& illuminant,
                                                         const std::string& observer) {
    boost::shared_ptr<IIlluminant> i = IlluminantRepository::Find(illuminant);
    boost::shared_ptr<IObserver> o = ObserverRepository::Get(observer);
    if (!i || !o) return {};
    return Cached(i, o);
}

boost::shared_ptr<const CMetryFilter> CMetryFilter::Find(boost::shared_ptr<IIlluminant> illuminant,
                                                         boost::shared_ptr<IObserver> observer) {
    if (!illuminant || !observer) return {};
    const bool shared = IlluminantRepository::Find(illuminant->GetName()) == illuminant &&
                        ObserverRepository::Get(observer->GetName()) == observer;
    if (shared) return Cached(illuminant, observer);
    // Objects made elsewhere were not checked by the repository: a light without
    // power in 360..780 nm has no weights.
    boost::shared_ptr<const CMetryFilter> filter(new CMetryFilter(illuminant, observer));
    for (int c = 0; c < 3; ++c) {
        for (double w : filter->GetWeights(c)) {
            if (!std::isfinite(w)) return {};
        }
    }
    return filter;
}

}  // namespace cmetry
}  // namespace klume
