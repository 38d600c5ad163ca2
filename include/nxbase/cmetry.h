// CMetry is the process-wide colorimetry facade: the current colorimetric
// filter (illuminant and observer), the equal-energy sum filter, the density
// standard, the physical conditions and the paper spectrum. It is created on
// first use (thread-safe) and lives until the end of the process. Set it up
// from one thread before colour values are computed elsewhere: the setters
// are not synchronised with readers. This header also brings in the value
// classes of the colorimetry (spectra, filters, measuring conditions).
#ifndef NXBASE_CMETRY_H_
#define NXBASE_CMETRY_H_

#include <boost/shared_ptr.hpp>

#include "klume/cmetry/cmetry.h"
#include "nxbase/cmetryfilter.h"
#include "nxbase/export.h"
#include "nxbase/meascond.h"
#include "nxbase/spectrum.h"

class NXBASE_EXPORT CMetry {
  public:
    // The facade; made on the first call with illuminant D50 and observer
    // type 0. The reference stays valid for the life of the process.
    static const boost::shared_ptr<CMetry>& Instance();

    CMetry(const CMetry&) = delete;
    CMetry& operator=(const CMetry&) = delete;

    // Makes the filter of (illuminant, observer) current and rebuilds the
    // equal-energy sum filter (W0 + W1 + W2 under illuminant E) for the
    // observer. Filters held by colour values stay alive while shared.
    void SetCMetry(const IllumClass& illuminant, const ObserverClass& observer);
    // SetCMetry with the condition's illuminant and observer, then its
    // density standard, then its physical conditions.
    void SetMeasuringConditions(const MeasuringCondition& condition);
    MeasuringCondition GetMeasuringConditions() const;
    void GetMeasuringConditions(MeasuringCondition& condition) const;
    const PhysicalConditions& GetPhysicalConditions() const { return amPhysical; }

    IllumClass GetIllum() const;
    ObserverClass GetObserver() const;

    // The current filter, used by every colour value made without an explicit
    // filter or condition. The reference is valid until the next SetCMetry;
    // copy the pointer to keep the filter.
    const boost::shared_ptr<CMetryFilter>& GetLXYZFilter() const { return amFilter; }
    // The equal-energy sum filter of the current observer.
    const Filter& GetSumFilter() const { return amSumFilter; }
    // The filter of illuminant D65 and observer type 0, made on the first
    // call (thread-safe) and kept for the process; it ignores SetCMetry.
    static const CMetryFilter& GetRGBFilter();

    void SetDensityStandard(const DStdClass& standard);
    void SetDensityStandard(boost::shared_ptr<klume::cmetry::IDensityStandard> standard);
    boost::shared_ptr<klume::cmetry::IDensityStandard> GetDensityStandard() const;
    // The density filters of the current standard.
    const DichteFilter& GetDichteFilter() const { return amDichteFilter; }
    // Density of a channel of the current standard (see DichteFilter). With
    // relativeToPaper and a defined paper spectrum, the spectrum is divided
    // by the paper first (samples where the paper is 0.0 are left as they are).
    bool GetDensity(const ReflectanceSpectrum& spectrum, unsigned short channel, float& density,
                    bool relativeToPaper = false) const;

    // Makes `paper` the paper spectrum and marks it defined.
    void SetPaperSpectrum(const ReflectanceSpectrum& paper);
    const ReflectanceSpectrum& GetPaperSpectrum() const { return amPaper; }
    bool IsPaperSpectrumDefined() const { return amPaperDefined; }
    // A white whose 36 values sum to exactly 0.0 resets the paper spectrum to
    // undefined; any other becomes the paper spectrum.
    void EnterWhite(const ReflectanceSpectrum& white);

    // The wavelength (nm) of the largest spectral density over 410..700 nm,
    // storing that density (-log10 of the reflectance, optionally relative to
    // the paper). Equal maxima go to the sample nearest 560 nm, the later of
    // two equally near. No positive sample: 380, density -4.0.
    short GetMaxDensity(const ReflectanceSpectrum& spectrum, float& density,
                        bool relativeToPaper) const;

    // Kubelka-Munk strength matching in single precision: scales the sample's
    // K/S = (1 - R)^2 / (2 R) so that its sum equals the reference's, and
    // converts back to reflectance. The reference is not changed.
    static void ToEqualStrength(ReflectanceSpectrum& sample, const ReflectanceSpectrum& reference);

  private:
    CMetry();

    Filter amSumFilter;
    boost::shared_ptr<CMetryFilter> amFilter;
    DStdClass amDStd;
    DichteFilter amDichteFilter;
    PhysicalConditions amPhysical;
    ReflectanceSpectrum amPaper;
    bool amPaperDefined = false;
    IllumClass amIllum;
    ObserverClass amObserver;
};

#endif  // NXBASE_CMETRY_H_
