// Spectra: value semantics, the size check, maximum and deviation rules, and
// the copy-versus-assignment asymmetry of reflectance spectra.
#include "nxbase/spectrum.h"

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>
#include <random>
#include <stdexcept>
#include <string>
#include <vector>

namespace {

class Note : public IAdditionalSpectrumInfo {
  public:
    Note(InfoType type, int value) : amType(type), amValue(value) {}
    InfoType GetType() const override { return amType; }
    int Value() const { return amValue; }

  private:
    InfoType amType;
    int amValue;
};

const auto kFirstKey = static_cast<IAdditionalSpectrumInfo::InfoType>(1);
const auto kSecondKey = static_cast<IAdditionalSpectrumInfo::InfoType>(7);

std::vector<float> Ramp() {
    std::vector<float> values;
    for (int i = 0; i < Spectrum::kSize; ++i) values.push_back(0.01f * static_cast<float>(i));
    return values;
}

}  // namespace

TEST(Spectrum, SetValuesRejectsAnyOtherSizeAndKeepsTheOldValues) {
    Spectrum spectrum(Ramp());
    for (std::size_t size : {0u, 35u, 37u, 360u}) {
        try {
            spectrum.SetValues(std::vector<float>(size, 9.0f));
            ADD_FAILURE() << "no exception for size " << size;
        } catch (const std::logic_error& e) {
            EXPECT_STREQ(e.what(), "Illegal spectrum size");
        }
        EXPECT_EQ(spectrum.GetValues(), Ramp());
    }
    spectrum.SetValues(std::vector<float>(36, 0.5f));
    EXPECT_EQ(spectrum, Spectrum(0.5f));
    // The vector constructors do not check; a short vector leaves zeros.
    EXPECT_EQ(Spectrum(std::vector<double>{0.25, 0.5})[1], 0.5f);
    EXPECT_EQ(Spectrum(std::vector<double>{0.25, 0.5})[35], 0.0f);
}

TEST(Spectrum, MaximumTakesTheFirstPositiveMaximumAndDefaultsTo380) {
    int wavelength = -1;
    EXPECT_EQ(Spectrum::CreateBlackSpectrum().Maximum(wavelength), 0.0f);
    EXPECT_EQ(wavelength, 380);
    wavelength = -1;
    EXPECT_EQ(Spectrum(-0.5f).Maximum(wavelength), 0.0f);
    EXPECT_EQ(wavelength, 380);

    Spectrum peaks(0.1f);
    peaks[(500 - 380) / 10] = 0.9f;
    peaks[(600 - 380) / 10] = 0.9f;
    EXPECT_EQ(peaks.Maximum(wavelength), 0.9f);
    EXPECT_EQ(wavelength, 500);
    peaks[35] = 1.5f;
    EXPECT_EQ(peaks.Maximum(wavelength), 1.5f);
    EXPECT_EQ(wavelength, 730);
}

TEST(Spectrum, SpectralDeviationCoversOnly400To700Nanometres) {
    const Spectrum a(0.5f);
    Spectrum b(a);
    for (int i : {0, 1, 33, 34}) b[i] = 0.9f;  // outside 400..700 nm
    b[35] = 0.0f;
    EXPECT_EQ(a.GetSpectralDeviation(b), 0.0);
    b[2] = 0.75f;   // 400 nm
    b[32] = 0.25f;  // 700 nm
    EXPECT_DOUBLE_EQ(a.GetSpectralDeviation(b), 0.5);
    EXPECT_DOUBLE_EQ(b.GetSpectralDeviation(a), 0.5);
}

// Both types' binary operators against element-wise float arithmetic on
// random spectra; a reflectance result keeps its left operand's conditions
// and information, whichever side a factor stands on.
TEST(Spectrum, BinaryOperatorsOfBothTypesMatchElementWiseFloatArithmetic) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_real_distribution<float> value(-2.0f, 2.0f);
    PhysicalConditions physical;
    physical.SetSurfaceType(static_cast<PhysicalConditions::SurfaceType>(1));
    for (int round = 0; round < 200; ++round) {
        std::vector<float> x(Spectrum::kSize), y(Spectrum::kSize);
        // Now and then a zero, so that x / 0 and 0 / 0 occur.
        for (int i = 0; i < Spectrum::kSize; ++i)
            x[i] = random() % 11 ? value(random) : 0.0f, y[i] = random() % 7 ? value(random) : 0.0f;
        const double factor = value(random) + 3.0;  // never 0
        ReflectanceSpectrum r(x, physical);
        r.SetAdditionalInfo(boost::make_shared<Note>(kFirstKey, round));
        const Spectrum a(x), b(y);
        Spectrum product(a), quotient(a);
        product *= b;
        quotient /= b;  // a random 0 in b gives an infinity or NaN, as IEEE says
        const Spectrum results[] = {a + b,      a - b,   a * factor, factor * a,
                                    a / factor, product, quotient};
        const ReflectanceSpectrum reflectances[] = {r + b, r - b, r * factor, factor * r,
                                                    r / factor};
        const float f = static_cast<float>(factor);
        for (int i = 0; i < Spectrum::kSize; ++i) {
            const float expected[] = {x[i] + y[i], x[i] - y[i], x[i] * f,   x[i] * f,
                                      x[i] / f,    x[i] * y[i], x[i] / y[i]};
            for (int op = 0; op < 7; ++op) {
                ASSERT_TRUE(results[op][i] == expected[op] ||
                            (std::isnan(results[op][i]) && std::isnan(expected[op])))
                    << op << " at " << i;
                if (op < 5) {
                    ASSERT_EQ(reflectances[op][i], expected[op]) << op << " at " << i;
                }
            }
        }
        ASSERT_NE(a, a + Spectrum(1e-7f));
        ASSERT_EQ(Spectrum(0.5f).Summe(), 18.0f);
        // The compound operators stay within the 36 values: the float after
        // each operand shows a read or write beyond them.
        struct Guarded {
            Spectrum s;
            float guard;
        } target{a, 7.0f}, operand{b, 2.0f};
        ASSERT_EQ(static_cast<const void*>(target.s.GetData() + Spectrum::kSize),
                  static_cast<const void*>(&target.guard));
        for (int op = 0; op < 4; ++op) {
            op == 0   ? target.s += operand.s
            : op == 1 ? target.s -= operand.s
            : op == 2 ? target.s *= operand.s
                      : target.s /= operand.s;
            ASSERT_EQ(target.guard, 7.0f) << op;
        }
        for (const ReflectanceSpectrum& result : reflectances) {
            EXPECT_EQ(result.GetPhysicalConditions(), physical);
            EXPECT_EQ(result.GetAdditionalInfo(kFirstKey), r.GetAdditionalInfo(kFirstKey));
        }
    }
}

TEST(ReflectanceSpectrum, CopySharesTheInformationButAssignmentKeepsTheReceivers) {
    ReflectanceSpectrum source(Ramp(), PhysicalConditions(ActualFilterClass(FILTER_POL)));
    const boost::shared_ptr<IAdditionalSpectrumInfo> sourceNote(new Note(kSecondKey, 1));
    source.SetAdditionalInfo(sourceNote);

    const ReflectanceSpectrum copy(source);
    ASSERT_EQ(copy.GetAdditionalInfo().size(), 1u);
    EXPECT_EQ(copy.GetAdditionalInfo(kSecondKey), sourceNote);  // shared, not cloned

    ReflectanceSpectrum target(0.3f, PhysicalConditions());
    const boost::shared_ptr<IAdditionalSpectrumInfo> targetNote(new Note(kFirstKey, 2));
    target.SetAdditionalInfo(targetNote);
    target = source;
    EXPECT_EQ(target.GetValues(), Ramp());
    EXPECT_EQ(target.GetPhysicalConditions(), source.GetPhysicalConditions());
    ASSERT_EQ(target.GetAdditionalInfo().size(), 1u);
    EXPECT_EQ(target.GetAdditionalInfo(kFirstKey), targetNote);
    EXPECT_FALSE(target.GetAdditionalInfo(kSecondKey));
    EXPECT_EQ(target, source);  // information takes no part in equality

    target = *&target;  // self-assignment changes nothing
    EXPECT_EQ(target.GetAdditionalInfo(kFirstKey), targetNote);

    // Free operators copy the left operand, information included.
    const ReflectanceSpectrum sum = source + Spectrum(1.0f);
    EXPECT_EQ(sum.GetAdditionalInfo(kSecondKey), sourceNote);
    EXPECT_EQ(sum[10], 0.1f + 1.0f);
}

TEST(ReflectanceSpectrum, InformationIsKeyedByTypeAndOrderedByKey) {
    ReflectanceSpectrum spectrum;
    spectrum.SetAdditionalInfo(boost::shared_ptr<IAdditionalSpectrumInfo>(new Note(kSecondKey, 1)));
    spectrum.SetAdditionalInfo(boost::shared_ptr<IAdditionalSpectrumInfo>(new Note(kFirstKey, 2)));
    spectrum.SetAdditionalInfo(boost::shared_ptr<IAdditionalSpectrumInfo>(new Note(kSecondKey, 3)));
    spectrum.SetAdditionalInfo(boost::shared_ptr<IAdditionalSpectrumInfo>());
    const auto all = spectrum.GetAdditionalInfo();
    ASSERT_EQ(all.size(), 2u);
    EXPECT_EQ(all[0]->GetType(), kFirstKey);
    EXPECT_EQ(static_cast<const Note&>(*all[1]).Value(), 3);  // replaced
}

TEST(ReflectanceSpectrum, EqualityNeedsEqualValuesAndPhysicalConditions) {
    const ReflectanceSpectrum dry(
        0.5f, PhysicalConditions(FILTER_NO, WBASE_ABSOLUTE, PhysicalConditions::SURFACE_DRY));
    ReflectanceSpectrum wet(dry);
    EXPECT_EQ(dry, wet);
    wet.SetSurfaceType(PhysicalConditions::SURFACE_WET);
    EXPECT_NE(dry, wet);
    ReflectanceSpectrum filtered(dry);
    filtered.SetPhysicalFilter(ActualFilterClass(FILTER_UVCUT));
    EXPECT_NE(dry, filtered);
}
