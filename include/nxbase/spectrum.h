// Spectra: Spectrum is 36 single-precision samples, 380..730 nm in 10 nm
// steps (index i is 380 + 10 i nm); ReflectanceSpectrum adds the physical
// conditions of the measurement and additional information keyed by type.
// Spectra are values: distinct objects may be used on distinct threads; the
// shared additional-information objects must be safe to read concurrently.
// Error model: SetValues with a size other than 36 throws
// std::logic_error("Illegal spectrum size"); arithmetic follows IEEE rules.
#ifndef NXBASE_SPECTRUM_H_
#define NXBASE_SPECTRUM_H_

#include <boost/shared_ptr.hpp>
#include <map>
#include <type_traits>
#include <vector>

#include "nxbase/export.h"
#include "nxbase/meascond.h"
#include "nxbase/spectralgrid.h"

// Additional information a reflectance spectrum carries, one object per type.
// Concrete kinds are defined by the applications.
class NXBASE_EXPORT IAdditionalSpectrumInfo {
  public:
    // Applications define their own keys; the library only orders them.
    enum InfoType : int {};

    IAdditionalSpectrumInfo() = default;
    IAdditionalSpectrumInfo(const IAdditionalSpectrumInfo&) = default;
    IAdditionalSpectrumInfo& operator=(const IAdditionalSpectrumInfo&) = default;
    virtual ~IAdditionalSpectrumInfo();
    virtual InfoType GetType() const = 0;
};

class NXBASE_EXPORT Spectrum {
  public:
    static constexpr int kSize = nxbase::kSpectrumSize;
    static constexpr int kFirstWavelength = nxbase::kFirstWavelength;
    static constexpr int kStep = nxbase::kWavelengthStep;

    // All values 0.0.
    Spectrum() = default;
    // All values `value`.
    explicit Spectrum(float value);
    // Copies 36 floats.
    explicit Spectrum(const float* values);
    // Copy the elements in order, converted to float. REQUIRES: size() == 36
    // (not checked).
    explicit Spectrum(const std::vector<double>& values);
    explicit Spectrum(const std::vector<float>& values);
    Spectrum(const Spectrum&) = default;
    Spectrum& operator=(const Spectrum&) = default;
    virtual ~Spectrum();

    void Init(float value);

    // No range check.
    float operator[](int index) const { return amValues[index]; }
    float& operator[](int index) { return amValues[index]; }
    // The 36 contiguous values (for sums against weight tables).
    const float* GetData() const { return amValues; }
    float* GetData() { return amValues; }

    std::vector<float> GetValues() const;
    // Throws std::logic_error("Illegal spectrum size") unless values.size()
    // is 36; the spectrum is then unchanged.
    void SetValues(const std::vector<float>& values);

    float Summe() const;
    // The largest value, scanning up from 380 nm with a running maximum that
    // starts at 0.0: the first of equal maxima wins; no positive value gives
    // 0.0 at 380 nm. The second form stores the wavelength in nm.
    float Maximum() const;
    float Maximum(int& wavelength) const;
    // Sum of |this - other| over 400..700 nm (indices 2..32), in double.
    double GetSpectralDeviation(const Spectrum& other) const;

    static Spectrum CreateWhiteSpectrum();
    static Spectrum CreateBlackSpectrum();

    // Element by element; division does not test for zero.
    Spectrum& operator+=(const Spectrum& other);
    Spectrum& operator-=(const Spectrum& other);
    Spectrum& operator*=(const Spectrum& other);
    Spectrum& operator/=(const Spectrum& other);
    Spectrum& operator*=(float factor);
    Spectrum& operator/=(float divisor);

    // Exact comparison of all 36 values.
    bool operator==(const Spectrum& other) const;
    bool operator!=(const Spectrum& other) const { return !(*this == other); }

  private:
    float amValues[kSize] = {};
};

class NXBASE_EXPORT ReflectanceSpectrum : public Spectrum {
  public:
    using InfoMap =
        std::map<IAdditionalSpectrumInfo::InfoType, boost::shared_ptr<IAdditionalSpectrumInfo>>;

    // Values 0.0, physical conditions with the default filter (FILTER_DEFAULT).
    ReflectanceSpectrum() = default;
    ReflectanceSpectrum(const float* values, const PhysicalConditions& physical);
    ReflectanceSpectrum(float value, const PhysicalConditions& physical);
    ReflectanceSpectrum(const std::vector<float>& values, const PhysicalConditions& physical);
    ReflectanceSpectrum(const std::vector<double>& values, const PhysicalConditions& physical);
    // Copies values, physical conditions and the information map (the
    // information objects are shared, not cloned).
    ReflectanceSpectrum(const ReflectanceSpectrum& other) = default;
    // Copies values and physical conditions only: the receiver keeps its own
    // additional information.
    ReflectanceSpectrum& operator=(const ReflectanceSpectrum& other);
    ~ReflectanceSpectrum() override;

    const PhysicalConditions& GetPhysicalConditions() const { return amPhysical; }
    void SetPhysicalConditions(const PhysicalConditions& physical) { amPhysical = physical; }
    void SetPhysicalFilter(const ActualFilterClass& filter) {
        amPhysical.SetActualFilterClass(filter);
    }
    void SetSurfaceType(PhysicalConditions::SurfaceType surface) {
        amPhysical.SetSurfaceType(surface);
    }

    // Stores `info` under info->GetType(), replacing what was there. A null
    // pointer is ignored.
    void SetAdditionalInfo(boost::shared_ptr<IAdditionalSpectrumInfo> info);
    // The object stored under `type`, or an empty pointer.
    boost::shared_ptr<IAdditionalSpectrumInfo> GetAdditionalInfo(
        IAdditionalSpectrumInfo::InfoType type) const;
    // Every stored object in ascending type order.
    std::vector<boost::shared_ptr<IAdditionalSpectrumInfo>> GetAdditionalInfo() const;

    double GetSpectralDeviation(const ReflectanceSpectrum& other) const {
        return Spectrum::GetSpectralDeviation(other);
    }

    ReflectanceSpectrum& operator+=(const Spectrum& other);
    ReflectanceSpectrum& operator-=(const Spectrum& other);
    ReflectanceSpectrum& operator*=(const Spectrum& other);
    ReflectanceSpectrum& operator/=(const Spectrum& other);
    ReflectanceSpectrum& operator*=(float factor);
    ReflectanceSpectrum& operator/=(float divisor);

    // Equal values (exactly) and equal physical conditions; the additional
    // information takes no part.
    bool operator==(const ReflectanceSpectrum& other) const;
    bool operator!=(const ReflectanceSpectrum& other) const { return !(*this == other); }

  private:
    PhysicalConditions amPhysical;
    InfoMap amInfo;
};

// The binary operators of Spectrum and ReflectanceSpectrum: a copy of the
// spectrum operand (of a ReflectanceSpectrum, its physical conditions and
// information included) with the operation applied; factors are taken as
// float, as by the compound operators.
template <class S>
using SpectrumResult = std::enable_if_t<std::is_base_of_v<Spectrum, S>, S>;

template <class S>
SpectrumResult<S> operator+(S a, const Spectrum& b) {
    a += b;
    return a;
}
template <class S>
SpectrumResult<S> operator-(S a, const Spectrum& b) {
    a -= b;
    return a;
}
template <class S>
SpectrumResult<S> operator*(S a, double factor) {
    a *= static_cast<float>(factor);
    return a;
}
template <class S>
SpectrumResult<S> operator*(double factor, S a) {
    a *= static_cast<float>(factor);
    return a;
}
template <class S>
SpectrumResult<S> operator/(S a, double divisor) {
    a /= static_cast<float>(divisor);
    return a;
}

#endif  // NXBASE_SPECTRUM_H_
