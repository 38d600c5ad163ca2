// How a value was measured and is evaluated: PhysicalConditions (measurement
// filter, white base, surface type), MeasuringCondition (plus illuminant,
// observer and density standard), DStdClass (a density standard) and
// DichteFilter (the density weights of one standard). These are values: any
// thread may use its own copies. The display-name table of ActualFilterClass
// is process-wide and guarded by a lock.
#ifndef NXBASE_MEASCOND_H_
#define NXBASE_MEASCOND_H_

#include <boost/shared_ptr.hpp>
#include <cstdint>
#include <string>
#include <vector>

#include "klume/cmetry/cmetry.h"
#include "nxbase/cmetryfilter.h"
#include "nxbase/export.h"
#include "toolkit/string.h"

class Spectrum;

// Measurement filters and geometries. Values below 0x100 are filters of a
// 45/0 instrument; 0x100 and above name a sphere (d/8) geometry.
enum ValueFilterType : std::int32_t {
    FILTER_NO = 0,               // "No": no filter
    FILTER_POL = 1,              // "Pol": polarisation filter
    FILTER_D65 = 2,              // "D65": daylight filter
    FILTER_UV = 3,               // "UV": UV included
    FILTER_UVCUT = 4,            // "UVCut": UV cut
    FILTER_CUSTOM = 5,           // "Custom" (also "Cust")
    FILTER_REPRO = 6,            // "Repro"
    FILTER_D8T = 0x100,          // "D8t"
    FILTER_D8E = 0x101,          // "D8e": d/8, specular component excluded
    FILTER_D8I = 0x102,          // "D8i": d/8, specular component included
    FILTER_DEFAULT = 0x1FFFFFFF  // the filter of a default-made spectrum
};

class NXBASE_EXPORT ActualFilterClass {
  public:
    enum Geometry : std::int32_t {
        GEOMETRY_UNDEFINED = -1,  // FILTER_DEFAULT and unknown values
        GEOMETRY_45_0 = 0,        // FILTER_NO .. FILTER_REPRO
        GEOMETRY_D8T = 1,
        GEOMETRY_D8E = 2,
        GEOMETRY_D8I = 3
    };

    ActualFilterClass(ValueFilterType type = FILTER_DEFAULT);  // NOLINT: implicit
    // One of the names listed at ValueFilterType (exact, else ignoring ASCII
    // case); any other name gives FILTER_DEFAULT.
    explicit ActualFilterClass(const String& name);
    ActualFilterClass(const ActualFilterClass&) = default;
    ActualFilterClass& operator=(const ActualFilterClass&) = default;

    operator ValueFilterType() const { return amType; }  // NOLINT
    ValueFilterType GetType() const { return amType; }
    // The filter's name ("No", "D8i", ...); "Default" for FILTER_DEFAULT and
    // the decimal value for a value without a name.
    operator String() const;  // NOLINT
    Geometry GetGeometry() const;
    String GetDisplayName() const { return GetDisplayName(amType); }

    // The display name of a filter: the one set by SetDisplayFilterName, else
    // the filter's name.
    static String GetDisplayName(ValueFilterType type);
    static void SetDisplayFilterName(ValueFilterType type, const String& name);

    bool operator==(const ActualFilterClass& other) const { return amType == other.amType; }
    bool operator!=(const ActualFilterClass& other) const { return amType != other.amType; }

  private:
    ValueFilterType amType = FILTER_DEFAULT;
};

// White bases: reflectances relative to the instrument's absolute white or to
// the paper (substrate).
enum StoredWBaseType : std::int32_t {
    WBASE_ABSOLUTE = 0,  // "Absolute"
    WBASE_PAPER = 1      // "Paper"
};

class NXBASE_EXPORT WBaseClass {
  public:
    WBaseClass(StoredWBaseType type = WBASE_ABSOLUTE);  // NOLINT: implicit
    // "Absolute" or "Paper" (ignoring ASCII case); anything else is absolute.
    explicit WBaseClass(const String& name);

    operator StoredWBaseType() const { return amType; }  // NOLINT
    StoredWBaseType GetType() const { return amType; }
    operator String() const;  // NOLINT

    bool operator==(const WBaseClass& other) const { return amType == other.amType; }
    bool operator!=(const WBaseClass& other) const { return amType != other.amType; }

  private:
    StoredWBaseType amType = WBASE_ABSOLUTE;
};

class NXBASE_EXPORT PhysicalConditions {
  public:
    enum SurfaceType : std::int32_t {
        SURFACE_UNDEFINED = 0,
        SURFACE_DRY = 1,  // dry ink or coating
        SURFACE_WET = 2   // wet ink, measured straight from the press
    };

    PhysicalConditions() = default;
    explicit PhysicalConditions(const ActualFilterClass& filter) : amFilter(filter) {}
    PhysicalConditions(const ActualFilterClass& filter, const WBaseClass& wbase,
                       SurfaceType surface)
        : amFilter(filter), amWBase(wbase), amSurface(surface) {}
    PhysicalConditions(const PhysicalConditions&) = default;
    PhysicalConditions& operator=(const PhysicalConditions&) = default;

    const ActualFilterClass& GetActualFilter() const { return amFilter; }
    const WBaseClass& GetWBase() const { return amWBase; }
    SurfaceType GetSurfaceType() const { return amSurface; }
    void SetActualFilterClass(ActualFilterClass filter) { amFilter = filter; }
    void SetWhiteBase(const WBaseClass& wbase) { amWBase = wbase; }
    void SetSurfaceType(SurfaceType surface) { amSurface = surface; }

    // "<filter>,<white base>,<surface number>", e.g. "Pol,Absolute,1".
    operator String() const;  // NOLINT

    bool operator==(const PhysicalConditions& other) const {
        return amFilter == other.amFilter && amWBase == other.amWBase &&
               amSurface == other.amSurface;
    }
    bool operator!=(const PhysicalConditions& other) const { return !(*this == other); }

  private:
    ActualFilterClass amFilter;
    WBaseClass amWBase;
    SurfaceType amSurface = SURFACE_UNDEFINED;
};

// Density standards and the repository names they select.
enum DStdType : int {
    DSTD_UNKNOWN = -1,  // a standard without a type (installed ones)
    DSTD_STATUS_A = 0,
    DSTD_STATUS_T = 1,
    DSTD_DIN = 2,
    DSTD_DIN_NB = 3,
    DSTD_SPI = 4,
    DSTD_STATUS_M = 6,
    DSTD_STATUS_E = 9,
    DSTD_STATUS_I = 10
};

// A density standard of the provider. Never empty: a type outside the table,
// an unknown name and a standard without installed table give the default
// standard ("Status E"); the last two are logged.
class NXBASE_EXPORT DStdClass {
  public:
    DStdClass();
    DStdClass(DStdType type);  // NOLINT: implicit
    explicit DStdClass(const std::string& name);
    explicit DStdClass(boost::shared_ptr<klume::cmetry::IDensityStandard> standard);

    std::string GetName() const;
    std::string GetDisplayString() const;
    // The type whose table name equals GetName(), or DSTD_UNKNOWN.
    DStdType GetDStdType() const;
    boost::shared_ptr<klume::cmetry::IDensityStandard> GetDensityStandard() const {
        return amStandard;
    }
    // The repository name of a type, or "" for a type outside the table.
    static std::string NameOfType(DStdType type);

    bool operator==(const DStdClass& other) const { return GetName() == other.GetName(); }
    bool operator!=(const DStdClass& other) const { return !(*this == other); }

  private:
    boost::shared_ptr<klume::cmetry::IDensityStandard> amStandard;
};

class NXBASE_EXPORT MeasuringCondition {
  public:
    // Default illuminant (D50), 2 degree observer, default density standard,
    // default physical conditions.
    MeasuringCondition() = default;
    MeasuringCondition(const IllumClass& illuminant, const ObserverClass& observer,
                       const PhysicalConditions& physical);
    MeasuringCondition(const DStdClass& standard, const PhysicalConditions& physical);
    MeasuringCondition(const IllumClass& illuminant, const ObserverClass& observer,
                       const DStdClass& standard, const PhysicalConditions& physical);
    MeasuringCondition(const MeasuringCondition&) = default;
    MeasuringCondition& operator=(const MeasuringCondition&) = default;

    const IllumClass& GetIllum() const { return amIllum; }
    const ObserverClass& GetObserver() const { return amObserver; }
    const DStdClass& GetDStd() const { return amDStd; }
    const PhysicalConditions& GetPhysicalConditions() const { return amPhysical; }

    // "<illuminant>,<observer>": the illuminant's display string ("?" when it
    // has no type) and the observer's text ("?" for an unknown observer).
    std::string GetMeasuringConditionString() const;
    // GetMeasuringConditionString() followed by ",", the density standard and
    // ",", the physical conditions.
    operator String() const;  // NOLINT

    bool operator==(const MeasuringCondition& other) const;
    bool operator!=(const MeasuringCondition& other) const { return !(*this == other); }

  private:
    IllumClass amIllum;
    ObserverClass amObserver;
    DStdClass amDStd;
    PhysicalConditions amPhysical;
};

// The density filters of one standard: one Filter per channel holding the
// standard's linear spectral products on the spectrum grid.
//
// Densities are evaluated as D = -log10(sum(P * R) / sum(P)) over the 36
// samples 380..730 nm, P the linear ISO 5-3 spectral product of the channel
// and R the reflectance factor (0..1): the form colormath and ArgyllCMS use
// for spectral data. Product values outside 380..730 nm are not used.
class NXBASE_EXPORT DichteFilter {
  public:
    // The filters of the default standard.
    DichteFilter();
    explicit DichteFilter(const DStdClass& standard);

    // REQUIRES: channel < GetChannelCount().
    Filter& operator[](unsigned short channel) { return amFilters[channel]; }
    const Filter& operator[](unsigned short channel) const { return amFilters[channel]; }
    unsigned short GetChannelCount() const { return static_cast<unsigned short>(amFilters.size()); }
    const DStdClass& GetDStd() const { return amDStd; }

    // The density of a channel as defined above, summed in double precision.
    // False (and density unchanged) when the weighted reflectance is not
    // positive or the channel does not exist.
    bool GetDensity(const Spectrum& spectrum, unsigned short channel, float& density) const;

  private:
    DStdClass amDStd;
    std::vector<Filter> amFilters;
};

#endif  // NXBASE_MEASCOND_H_
