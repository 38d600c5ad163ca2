#include "nxbase/colorbatch.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <random>
#include <string>
#include <vector>

#include "color_test_util.h"
#include "nxbase/colorvector.h"
#include "nxbase/spectrafile.h"

namespace {

using nxbase::ColorBatch;
using nxbase::SpectraToLab;
using nxbase::SpectraToXYZ;

// The batch promise: equal to the object path to 1e-5 of the vector's length
// (lengths below 1 count as 1, so that black is compared absolutely).
constexpr double kBatchRelative = 1e-5;
// The batch cube root against the double cube root, in units of the result.
constexpr double kCbrtRelative = 4e-7;

double Scale(const float* v) {
    return std::max(1.0,
                    std::sqrt(double(v[0]) * v[0] + double(v[1]) * v[1] + double(v[2]) * v[2]));
}

// The ColorChecker chart followed by random spectra: smooth ones, dark ones
// near the linear branch, flat ones, and a count that leaves a tail of seven.
std::vector<float> TestSpectra() {
    std::vector<float> spectra;
    for (const auto& row : nxtest::ReadPatchCsv(nxtest::ChartPath())) {
        for (double v : row.values) spectra.push_back(static_cast<float>(v));
    }
    std::mt19937 random(20261122);
    std::uniform_real_distribution<float> unit(0.0f, 1.0f);
    for (int s = 0; s < 4000 + 7; ++s) {
        const int kind = s % 4;
        const float level = kind == 1 ? 0.004f * unit(random) : 1.1f * unit(random);
        float value = level;
        for (int k = 0; k < 36; ++k) {
            if (kind == 2) {
                spectra.push_back(level);
                continue;
            }
            value =
                std::clamp(value + (unit(random) - 0.5f) * (kind == 1 ? 0.001f : 0.1f), 0.0f, 1.2f);
            spectra.push_back(kind == 3 ? unit(random) : value);
        }
    }
    for (int k = 0; k < 36; ++k) spectra.push_back(0.0f);  // black
    return spectra;
}

void ExpectBatchEqualsObjects(const MeasuringCondition& condition) {
    const std::vector<float> spectra = TestSpectra();
    const std::size_t count = spectra.size() / 36;
    const ColorBatch batch(condition);
    std::vector<float> xyz(3 * count);
    std::vector<float> lab(3 * count);
    batch.ToXYZ(spectra.data(), count, xyz.data());
    batch.ToLab(spectra.data(), count, lab.data());
    for (std::size_t s = 0; s < count; ++s) {
        const ReflectanceSpectrum spectrum(&spectra[36 * s], PhysicalConditions());
        const LABVector object(spectrum, condition);
        const float* b = &lab[3 * s];
        const double scale = Scale(object.getV());
        for (int i = 0; i < 3; ++i)
            ASSERT_NEAR(b[i], object[i], kBatchRelative * scale)
                << "spectrum " << s << " Lab " << i;
    }
    // Doubles (here with bits below float resolution) are rounded to float as
    // they are read: the same results as from a float copy, including the
    // tail after the last block of sixteen.
    std::vector<double> doubles(spectra.begin(), spectra.end());
    for (std::size_t i = 0; i < doubles.size(); ++i)
        doubles[i] += 3e-9 * static_cast<double>(i % 11);
    const std::vector<float> floatCopy(doubles.begin(), doubles.end());
    for (const bool labs : {true, false}) {
        std::vector<float> fromDoubles(3 * count);
        std::vector<float> fromCopy(3 * count);
        labs ? batch.ToLab(doubles.data(), count, fromDoubles.data())
             : batch.ToXYZ(doubles.data(), count, fromDoubles.data());
        labs ? batch.ToLab(floatCopy.data(), count, fromCopy.data())
             : batch.ToXYZ(floatCopy.data(), count, fromCopy.data());
        EXPECT_EQ(fromDoubles, fromCopy) << (labs ? "Lab" : "XYZ");
    }
    // A table read from a file gives the same numbers, row by row, across
    // the pieces it is converted in.
    nxbase::SpectraTable table;
    table.rows.resize(count);
    for (std::size_t s = 0; s < count; ++s) {
        std::copy(&spectra[36 * s], &spectra[36 * s] + 36, table.rows[s].values.begin());
    }
    EXPECT_EQ(batch.ToLab(table), lab);
    EXPECT_EQ(batch.ToXYZ(table), xyz);
    const CMetryFilter filter(Lichtart(condition.GetIllum()), Observer(condition.GetObserver()));
    for (std::size_t s = 0; s < count; ++s) {
        const XYZVector object(filter, ReflectanceSpectrum(&spectra[36 * s], PhysicalConditions()));
        for (int i = 0; i < 3; ++i) {
            // Same products, same order, no contraction: bit-identical by design.
            ASSERT_EQ(xyz[3 * s + i], object[i]) << "spectrum " << s;
        }
    }
}

TEST(ColorBatch, EqualsTheObjectPathUnderSeveralConditions) {
    const std::pair<const char*, ObserverType> conditions[] = {
        {"D50", OBSERVER_2DEG}, {"D65", OBSERVER_10DEG}, {"FL11", OBSERVER_2DEG}};
    for (const auto& [illuminant, observer] : conditions) {
        SCOPED_TRACE(illuminant);
        ExpectBatchEqualsObjects(MeasuringCondition(IllumClass(illuminant), ObserverClass(observer),
                                                    PhysicalConditions()));
    }
}

TEST(ColorBatch, HandlesEveryTailLengthAndWritesNothingBeyond) {
    const std::vector<float> spectra = TestSpectra();
    const ColorBatch batch;  // the facade's current filter
    for (std::size_t count = 0; count <= 17; ++count) {
        std::vector<float> out(3 * count + 3, -999.0f);
        batch.ToLab(spectra.data(), count, out.data());
        for (std::size_t s = 0; s < count; ++s) {
            const LABVector object(ReflectanceSpectrum(&spectra[36 * s], PhysicalConditions()));
            EXPECT_NEAR(out[3 * s], object[0], kBatchRelative * Scale(object.getV()));
        }
        for (int i = 0; i < 3; ++i) EXPECT_EQ(out[3 * count + i], -999.0f) << "count " << count;
    }
}

// The model of BatchRange: what the results themselves show.
nxbase::BatchRange RangeOfResults(const float* results, std::size_t count, int light) {
    nxbase::BatchRange range;
    for (std::size_t i = 0; i < 3 * count; ++i) {
        range.allFinite = range.allFinite && std::isfinite(results[i]);
        if (i % 3 == static_cast<std::size_t>(light) && results[i] > range.brightest)
            range.brightest = results[i];
    }
    return range;
}

// Every instruction set the machine has against the baseline kernels, bit
// for bit, on random spectra and counts (float and double input, XYZ, Lab
// and the cube root); and each conversion's BatchRange against its results.
// Some spectra are percentages, negative, huge, or hold a NaN or an infinity.
TEST(ColorBatch, EveryInstructionSetGivesTheBaselinesBitsAndTheRangeOfItsResults) {
    using nxbase::detail::BatchIsa;
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_real_distribution<float> value(-0.1f, 1.5f);
    // 100 and -1 scale a whole spectrum; 0 stands for one huge value (it
    // overflows some channels and not others, depending on where it lies);
    // NaN and the infinities replace one value.
    const double odd[] = {100.0, -1.0, 0.0, NAN, INFINITY, -INFINITY};
    const BatchIsa chosen = nxbase::detail::BatchIsaInUse();
    const ColorBatch batch;
    for (int round = 0; round < 40; ++round) {
        const std::size_t count = random() % 300;
        std::vector<double> doubles(36 * count);
        // Every fourth round all negative: the brightest result is below zero.
        const double sign = round % 4 == 0 ? -1.0 : 1.0;
        for (double& v : doubles) v = sign * value(random) * (random() % 9 == 0 ? 0.003 : 1.0);
        // Odd spectra in every other even round; odd rounds hold only the one below.
        for (std::size_t s = 0; s < count && round % 4 == 2; ++s) {
            if (random() % 10 != 0) continue;
            const double kind = odd[random() % 6];
            double* spectrum = &doubles[36 * s];
            if (kind == 0.0) {
                spectrum[random() % 36] = std::pow(10.0, 30.0 + 8.5 * value(random) / 1.5);
            } else if (std::isfinite(kind)) {
                for (int k = 0; k < 36; ++k) spectrum[k] *= kind;
            } else {
                spectrum[random() % 36] = kind;
            }
        }
        // In odd rounds one spectrum whose Z alone overflows (5e37 at 440
        // nm) or X alone (2e38 at 650 nm), anywhere or last (in the tail).
        if (count > 0 && round % 2 == 1) {
            const bool z = round % 4 == 1, last = round % 8 >= 5;
            double* spectrum = &doubles[36 * (last ? count - 1 : random() % count)];
            std::fill(spectrum, spectrum + 36, 0.5);
            spectrum[z ? 6 : 27] = z ? 5e37 : 2e38;
        }
        const std::vector<float> floats(doubles.begin(), doubles.end());
        auto results = [&] {
            std::vector<float> all(15 * count), part(3 * count);
            auto keep = [&](nxbase::BatchRange range, int light, std::size_t at) {
                const nxbase::BatchRange model = RangeOfResults(part.data(), count, light);
                EXPECT_EQ(range.allFinite, model.allFinite) << at;
                EXPECT_EQ(range.brightest, model.brightest) << at;
                std::copy(part.begin(), part.end(), all.begin() + at);
            };
            keep(batch.ToXYZ(floats.data(), count, part.data()), 1, 0);
            keep(batch.ToLab(floats.data(), count, part.data()), 0, 3 * count);
            keep(batch.ToXYZ(doubles.data(), count, part.data()), 1, 6 * count);
            keep(batch.ToLab(doubles.data(), count, part.data()), 0, 9 * count);
            nxbase::detail::BatchCbrt(floats.data(), 3 * count, all.data() + 12 * count);
            // NaN as one pattern: how a NaN is spelt may differ between instruction sets.
            for (float& v : all) v = std::isnan(v) ? NAN : v;
            return all;
        };
        ASSERT_TRUE(nxbase::detail::UseBatchIsa(BatchIsa::kBaseline));
        const std::vector<float> baseline = results();
        for (BatchIsa isa : {BatchIsa::kAvx2, BatchIsa::kAvx512}) {
            if (!nxbase::detail::UseBatchIsa(isa)) continue;
            const std::vector<float> wider = results();
            // Compared as bits (no memcmp of the empty vectors of zero
            // spectra: their data may be null).
            ASSERT_TRUE(wider.empty() || std::memcmp(wider.data(), baseline.data(),
                                                     sizeof(float) * wider.size()) == 0)
                << "instruction set " << static_cast<int>(isa) << ", " << count << " spectra";
        }
        if (HasFailure()) break;
    }
    nxbase::detail::UseBatchIsa(chosen);
}

TEST(ColorBatch, ThreadSplitGivesTheSameResults) {
    const std::vector<float> base = TestSpectra();
    std::vector<float> spectra;
    while (spectra.size() < 36u * 70001u) spectra.insert(spectra.end(), base.begin(), base.end());
    spectra.resize(36u * 70001u);  // not a multiple of eight or of the thread count
    const std::size_t count = spectra.size() / 36;
    const ColorBatch batch;
    std::vector<float> serial(3 * count);
    batch.ToLab(spectra.data(), count, serial.data());
    for (unsigned threads : {0u, 1u, 2u, 3u, 7u}) {
        std::vector<float> parallel(3 * count + 1, -1.0f);
        batch.ToLabParallel(spectra.data(), count, parallel.data(), threads);
        EXPECT_TRUE(std::equal(serial.begin(), serial.end(), parallel.begin())) << threads;
        EXPECT_EQ(parallel.back(), -1.0f);
    }
    std::vector<float> xyz(3 * count);
    std::vector<float> xyzParallel(3 * count);
    batch.ToXYZ(spectra.data(), count, xyz.data());
    batch.ToXYZParallel(spectra.data(), count, xyzParallel.data(), 2);
    EXPECT_EQ(xyz, xyzParallel);
    const std::vector<double> doubles(spectra.begin(), spectra.end());
    batch.ToXYZParallel(doubles.data(), count, xyzParallel.data(), 3);
    EXPECT_EQ(xyz, xyzParallel);
    std::vector<float> labFromDoubles(3 * count);
    batch.ToLabParallel(doubles.data(), count, labFromDoubles.data(), 2);
    EXPECT_TRUE(std::equal(serial.begin(), serial.end(), labFromDoubles.begin()));

    // The parts' ranges come together: the brightest result lies in the
    // first part, a NaN in the last.
    spectra[36 * 5 + 3] = 100.0f;
    spectra[36 * (count - 9) + 30] = NAN;
    const nxbase::BatchRange range = batch.ToLab(spectra.data(), count, serial.data());
    for (unsigned threads : {2u, 3u}) {
        const nxbase::BatchRange split =
            batch.ToLabParallel(spectra.data(), count, labFromDoubles.data(), threads);
        EXPECT_EQ(split.brightest, range.brightest) << threads;
        EXPECT_FALSE(split.allFinite) << threads;
    }
    EXPECT_EQ(range.brightest, RangeOfResults(serial.data(), count, 0).brightest);
    EXPECT_GT(range.brightest, 100.0f);
}

// A call with 1 MiB of results or more writes them around the cache from
// their first whole 64-byte line on: the same bits as calls of 1000 spectra
// (through the cache), wherever the output starts, nothing before or after
// it, and the range its results show.
TEST(ColorBatch, LargeResultsWrittenAroundTheCacheKeepTheirBitsWhereverTheyStart) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    const std::vector<float> base = TestSpectra();
    const std::size_t count = (1u << 20) / 12 + 1 + random() % 999;
    std::vector<float> spectra(36 * count);
    for (std::size_t i = 0; i < spectra.size(); ++i)
        spectra[i] = base[(i + 36 * 977) % base.size()];
    spectra[36 * (random() % count) + 7] = 40.0f;  // percentages somewhere
    const std::vector<double> doubles(spectra.begin(), spectra.end());
    const ColorBatch batch;
    for (int round = 0; round < 4; ++round) {
        const bool lab = round % 2, fromDoubles = round >= 2;
        const std::size_t offset = random() % 16;  // floats before the output
        SCOPED_TRACE(std::string(lab ? "Lab" : "XYZ") + (fromDoubles ? " of doubles" : "") +
                     ", output at float " + std::to_string(offset));
        auto convert = [&](std::size_t first, std::size_t n, float* out) {
            return fromDoubles ? (lab ? batch.ToLab(&doubles[36 * first], n, out)
                                      : batch.ToXYZ(&doubles[36 * first], n, out))
                               : (lab ? batch.ToLab(&spectra[36 * first], n, out)
                                      : batch.ToXYZ(&spectra[36 * first], n, out));
        };
        std::vector<float> small(3 * count), large(3 * count + 32, -1.0f);
        for (std::size_t first = 0; first < count; first += 1000)
            convert(first, std::min<std::size_t>(1000, count - first), &small[3 * first]);
        const nxbase::BatchRange range = convert(0, count, &large[offset]);
        ASSERT_EQ(std::memcmp(small.data(), &large[offset], small.size() * sizeof(float)), 0);
        for (std::size_t i = 0; i < offset; ++i) ASSERT_EQ(large[i], -1.0f);
        for (std::size_t i = offset + small.size(); i < large.size(); ++i)
            ASSERT_EQ(large[i], -1.0f);
        const nxbase::BatchRange model = RangeOfResults(small.data(), count, lab ? 0 : 1);
        EXPECT_EQ(range.brightest, model.brightest);
        EXPECT_EQ(range.allFinite, model.allFinite);
    }
}

TEST(ColorBatch, StaysCieLabWhenObjectsAreSetToDin99) {
    const std::vector<float> spectra = TestSpectra();
    const ColorBatch batch;
    float before[3];
    float after[3];
    batch.ToLab(spectra.data(), 1, before);
    LABVector::SetColorSpaceType(LAB_DIN99);
    batch.ToLab(spectra.data(), 1, after);
    LABVector::SetColorSpaceType(LAB_CIE1976);
    for (int i = 0; i < 3; ++i) EXPECT_EQ(before[i], after[i]);
}

TEST(ColorBatch, OneCallFormsAndWhitePointMatchTheFilter) {
    const MeasuringCondition condition(IllumClass("A"), ObserverClass(OBSERVER_10DEG),
                                       PhysicalConditions());
    const std::vector<float> white(36, 1.0f);
    float xyz[3];
    float lab[3];
    SpectraToXYZ(condition, white.data(), 1, xyz);
    SpectraToLab(condition, white.data(), 1, lab);
    const ColorBatch batch(condition);
    // The A/10 degree white point of the reference weights.
    EXPECT_NEAR(batch.WhitePoint(0), 111.14224728562849, nxtest::kFloatSumAgainstDouble);
    EXPECT_NEAR(batch.WhitePoint(2), 35.20615588398067, nxtest::kFloatSumAgainstDouble);
    for (int i = 0; i < 3; ++i) EXPECT_NEAR(xyz[i], batch.WhitePoint(i), nxtest::kFloatAtHundred);
    for (int i = 0; i < 3; ++i)
        EXPECT_NEAR(lab[i], i == 0 ? 100.0f : 0.0f, nxtest::kFloatAtHundred);
}

TEST(ColorBatch, CubeRootIsAccurateOverTheLabRange) {
    std::vector<float> in;
    for (float t = 0.008f; t < 2.0f; t *= 1.0137f) in.push_back(t);
    in.push_back(1.0f);
    in.push_back(0.125f);
    std::vector<float> out(in.size());
    nxbase::detail::BatchCbrt(in.data(), in.size(), out.data());
    for (std::size_t i = 0; i < in.size(); ++i) {
        const double exact = std::cbrt(static_cast<double>(in[i]));
        EXPECT_NEAR(out[i], exact, kCbrtRelative * exact) << in[i];
    }
}

}  // namespace
