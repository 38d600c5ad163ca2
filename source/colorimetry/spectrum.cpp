#include "nxbase/spectrum.h"

#include <algorithm>
#include <cstddef>
#include <stdexcept>

namespace {

// Copies at most kSize elements in order, converted to float; the rest stay 0.
template <typename T>
void CopyElements(const std::vector<T>& from, float* to) {
    const std::size_t count = std::min<std::size_t>(from.size(), Spectrum::kSize);
    for (std::size_t i = 0; i < count; ++i) to[i] = static_cast<float>(from[i]);
}

}  // namespace

IAdditionalSpectrumInfo::~IAdditionalSpectrumInfo() = default;

Spectrum::Spectrum(float value) {
    Init(value);
}

Spectrum::Spectrum(const float* values) {
    std::copy(values, values + kSize, amValues);
}

Spectrum::Spectrum(const std::vector<double>& values) {
    CopyElements(values, amValues);
}

Spectrum::Spectrum(const std::vector<float>& values) {
    CopyElements(values, amValues);
}

Spectrum::~Spectrum() = default;

void Spectrum::Init(float value) {
    std::fill(amValues, amValues + kSize, value);
}

std::vector<float> Spectrum::GetValues() const {
    return std::vector<float>(amValues, amValues + kSize);
}

void Spectrum::SetValues(const std::vector<float>& values) {
    if (values.size() != static_cast<std::size_t>(kSize)) {
        throw std::logic_error("Illegal spectrum size");
    }
    std::copy(values.begin(), values.end(), amValues);
}

float Spectrum::Summe() const {
    float sum = 0.0f;
    for (float v : amValues) sum += v;
    return sum;
}

float Spectrum::Maximum() const {
    int wavelength = 0;
    return Maximum(wavelength);
}

float Spectrum::Maximum(int& wavelength) const {
    float best = 0.0f;
    int bestIndex = 0;
    for (int i = 0; i < kSize; ++i) {
        if (amValues[i] > best) {
            best = amValues[i];
            bestIndex = i;
        }
    }
    wavelength = kFirstWavelength + kStep * bestIndex;
    return best;
}

double Spectrum::GetSpectralDeviation(const Spectrum& other) const {
    // 400..700 nm: the edges of the range are too noisy on most instruments.
    constexpr int kFirst = 2;
    constexpr int kLast = 32;
    double sum = 0.0;
    for (int i = kFirst; i <= kLast; ++i) {
        const double d = static_cast<double>(amValues[i]) - static_cast<double>(other.amValues[i]);
        sum += d < 0.0 ? -d : d;
    }
    return sum;
}

Spectrum Spectrum::CreateWhiteSpectrum() {
    return Spectrum(1.0f);
}

Spectrum Spectrum::CreateBlackSpectrum() {
    return Spectrum(0.0f);
}

Spectrum& Spectrum::operator+=(const Spectrum& other) {
    for (int i = 0; i < kSize; ++i) amValues[i] += other.amValues[i];
    return *this;
}

Spectrum& Spectrum::operator-=(const Spectrum& other) {
    for (int i = 0; i < kSize; ++i) amValues[i] -= other.amValues[i];
    return *this;
}

Spectrum& Spectrum::operator*=(const Spectrum& other) {
    for (int i = 0; i < kSize; ++i) amValues[i] *= other.amValues[i];
    return *this;
}

Spectrum& Spectrum::operator/=(const Spectrum& other) {
    for (int i = 0; i < kSize; ++i) amValues[i] /= other.amValues[i];
    return *this;
}

Spectrum& Spectrum::operator*=(float factor) {
    for (float& v : amValues) v *= factor;
    return *this;
}

Spectrum& Spectrum::operator/=(float divisor) {
    for (float& v : amValues) v /= divisor;
    return *this;
}

bool Spectrum::operator==(const Spectrum& other) const {
    return std::equal(amValues, amValues + kSize, other.amValues);
}

ReflectanceSpectrum::ReflectanceSpectrum(const float* values, const PhysicalConditions& physical)
    : Spectrum(values), amPhysical(physical) {}

ReflectanceSpectrum::ReflectanceSpectrum(float value, const PhysicalConditions& physical)
    : Spectrum(value), amPhysical(physical) {}

ReflectanceSpectrum::ReflectanceSpectrum(const std::vector<float>& values,
                                         const PhysicalConditions& physical)
    : Spectrum(values), amPhysical(physical) {}

ReflectanceSpectrum::ReflectanceSpectrum(const std::vector<double>& values,
                                         const PhysicalConditions& physical)
    : Spectrum(values), amPhysical(physical) {}

ReflectanceSpectrum& ReflectanceSpectrum::operator=(const ReflectanceSpectrum& other) {
    if (this != &other) {
        Spectrum::operator=(other);
        amPhysical = other.amPhysical;
        // The additional information stays the receiver's own.
    }
    return *this;
}

ReflectanceSpectrum::~ReflectanceSpectrum() = default;

void ReflectanceSpectrum::SetAdditionalInfo(boost::shared_ptr<IAdditionalSpectrumInfo> info) {
    if (!info) return;
    const IAdditionalSpectrumInfo::InfoType type = info->GetType();
    amInfo[type] = std::move(info);
}

boost::shared_ptr<IAdditionalSpectrumInfo> ReflectanceSpectrum::GetAdditionalInfo(
    IAdditionalSpectrumInfo::InfoType type) const {
    const auto it = amInfo.find(type);
    return it == amInfo.end() ? boost::shared_ptr<IAdditionalSpectrumInfo>() : it->second;
}

std::vector<boost::shared_ptr<IAdditionalSpectrumInfo>> ReflectanceSpectrum::GetAdditionalInfo()
    const {
    std::vector<boost::shared_ptr<IAdditionalSpectrumInfo>> all;
    all.reserve(amInfo.size());
    for (const auto& entry : amInfo) all.push_back(entry.second);
    return all;
}

ReflectanceSpectrum& ReflectanceSpectrum::operator+=(const Spectrum& other) {
    Spectrum::operator+=(other);
    return *this;
}

ReflectanceSpectrum& ReflectanceSpectrum::operator-=(const Spectrum& other) {
    Spectrum::operator-=(other);
    return *this;
}

ReflectanceSpectrum& ReflectanceSpectrum::operator*=(const Spectrum& other) {
    Spectrum::operator*=(other);
    return *this;
}

ReflectanceSpectrum& ReflectanceSpectrum::operator/=(const Spectrum& other) {
    Spectrum::operator/=(other);
    return *this;
}

ReflectanceSpectrum& ReflectanceSpectrum::operator*=(float factor) {
    Spectrum::operator*=(factor);
    return *this;
}

ReflectanceSpectrum& ReflectanceSpectrum::operator/=(float divisor) {
    Spectrum::operator/=(divisor);
    return *this;
}

bool ReflectanceSpectrum::operator==(const ReflectanceSpectrum& other) const {
    return Spectrum::operator==(other) && amPhysical == other.amPhysical;
}
