#include "nxbase/cmetry.h"

#include <cmath>
#include <cstdlib>

namespace {

// Samples of the density-maximum search: 410..700 nm.
constexpr int kMaxDensityFirst = 3;
constexpr int kMaxDensityLast = 32;
// The sample (560 nm) toward which equal density maxima are resolved.
constexpr int kMaxDensityCentre = 18;
// Density reported when no sample is positive.
constexpr float kNoDensity = -4.0f;
// Lower bound of the K/S sums in ToEqualStrength.
constexpr float kMinStrengthSum = 0.0001f;

}  // namespace

CMetry::CMetry() {
    SetCMetry(IllumClass(ILLUM_D50, 0), ObserverClass(OBSERVER_2DEG));
}

const boost::shared_ptr<CMetry>& CMetry::Instance() {
    static const boost::shared_ptr<CMetry> instance(new CMetry());
    return instance;
}

void CMetry::SetCMetry(const IllumClass& illuminant, const ObserverClass& observer) {
    const CMetryFilter equalEnergy(Lichtart(IllumClass(ILLUM_E, 0)), Observer(observer));
    float sums[Filter::kSize];
    for (int i = 0; i < Filter::kSize; ++i) {
        sums[i] = equalEnergy.GetWeights(0)[i] + equalEnergy.GetWeights(1)[i] +
                  equalEnergy.GetWeights(2)[i];
    }
    amSumFilter = Filter(sums);

    amFilter.reset(new CMetryFilter(Lichtart(illuminant), Observer(observer)));
    amIllum = illuminant;
    amObserver = observer;
}

void CMetry::SetMeasuringConditions(const MeasuringCondition& condition) {
    SetCMetry(condition.GetIllum(), condition.GetObserver());
    SetDensityStandard(condition.GetDStd());
    amPhysical = condition.GetPhysicalConditions();
}

MeasuringCondition CMetry::GetMeasuringConditions() const {
    return MeasuringCondition(amIllum, amObserver, amDStd, amPhysical);
}

void CMetry::GetMeasuringConditions(MeasuringCondition& condition) const {
    condition = GetMeasuringConditions();
}

IllumClass CMetry::GetIllum() const {
    return amIllum;
}

ObserverClass CMetry::GetObserver() const {
    return amObserver;
}

const CMetryFilter& CMetry::GetRGBFilter() {
    static const CMetryFilter filter(Lichtart(IllumClass(ILLUM_D65, 0)),
                                     Observer(ObserverClass(OBSERVER_2DEG)));
    return filter;
}

void CMetry::SetDensityStandard(const DStdClass& standard) {
    amDStd = standard;
    amDichteFilter = DichteFilter(standard);
}

void CMetry::SetDensityStandard(boost::shared_ptr<klume::cmetry::IDensityStandard> standard) {
    SetDensityStandard(DStdClass(std::move(standard)));
}

boost::shared_ptr<klume::cmetry::IDensityStandard> CMetry::GetDensityStandard() const {
    return amDStd.GetDensityStandard();
}

bool CMetry::GetDensity(const ReflectanceSpectrum& spectrum, unsigned short channel, float& density,
                        bool relativeToPaper) const {
    if (!relativeToPaper || !amPaperDefined) {
        return amDichteFilter.GetDensity(spectrum, channel, density);
    }
    Spectrum relative(spectrum);
    for (int i = 0; i < Spectrum::kSize; ++i) {
        if (amPaper[i] != 0.0f) relative[i] /= amPaper[i];
    }
    return amDichteFilter.GetDensity(relative, channel, density);
}

void CMetry::SetPaperSpectrum(const ReflectanceSpectrum& paper) {
    amPaper = paper;
    amPaperDefined = true;
}

void CMetry::EnterWhite(const ReflectanceSpectrum& white) {
    if (white.Summe() == 0.0f) {
        amPaperDefined = false;
        return;
    }
    SetPaperSpectrum(white);
}

short CMetry::GetMaxDensity(const ReflectanceSpectrum& spectrum, float& density,
                            bool relativeToPaper) const {
    Spectrum work(spectrum);
    density = kNoDensity;
    int best = 0;
    if (amPaperDefined && relativeToPaper) {
        for (int i = kMaxDensityFirst; i <= kMaxDensityLast; ++i) {
            if (amPaper[i] != 0.0f) work[i] /= amPaper[i];
        }
    }
    for (int i = kMaxDensityFirst; i <= kMaxDensityLast; ++i) {
        if (!(work[i] > 0.0f)) continue;
        const float d = -std::log10(work[i]);
        if (d > density) {
            density = d;
            best = i;
        } else if (d == density &&
                   std::abs(i - kMaxDensityCentre) <= std::abs(best - kMaxDensityCentre)) {
            best = i;
        }
    }
    return static_cast<short>(Spectrum::kFirstWavelength + Spectrum::kStep * best);
}

// Kubelka-Munk single-constant theory: K/S = (1 - R)^2 / (2 R) and back
// R = 1 + K/S - sqrt((K/S)^2 + 2 K/S).
void CMetry::ToEqualStrength(ReflectanceSpectrum& sample, const ReflectanceSpectrum& reference) {
    const auto toKS = [](float r) {
        return (r > 0.0f && r <= 1.0f) ? (1.0f - r) * (1.0f - r) / (2.0f * r) : 0.0f;
    };
    float sampleSum = 0.0f;
    float referenceSum = 0.0f;
    for (int i = 0; i < Spectrum::kSize; ++i) {
        sample[i] = toKS(sample[i]);
        sampleSum += sample[i];
        referenceSum += toKS(reference[i]);
    }
    if (sampleSum < kMinStrengthSum) sampleSum = kMinStrengthSum;
    if (referenceSum < kMinStrengthSum) referenceSum = kMinStrengthSum;
    const float ratio = sampleSum / referenceSum;
    for (int i = 0; i < Spectrum::kSize; ++i) {
        const float k = sample[i] / ratio;
        const float root = k * (k + 2.0f);
        sample[i] = root > 0.0f ? k + 1.0f - std::sqrt(root) : k + 1.0f;
    }
}
