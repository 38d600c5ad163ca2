// Illuminants, observers and colorimetric filters: IllumClass and
// ObserverClass name an illuminant and an observer of the colorimetry data
// provider, Filter is one 36-value weight table and CMetryFilter the X, Y, Z
// tables of one illuminant/observer pair. Values of these classes may be read
// from any thread; the process-wide degree string is set at start-up.
//
// How weights are stored: the provider computes each pair's table once (in
// double precision) and shares it; a CMetryFilter holds three Filters with
// the weights rounded to float, each a contiguous float[36] (380..730 nm)
// reached through GetWeights(channel). Copies of a CMetryFilter share the
// Filters. Summing a spectrum (Tristimulus) allocates nothing and takes no lock.
#ifndef NXBASE_CMETRYFILTER_H_
#define NXBASE_CMETRYFILTER_H_

#include <boost/shared_ptr.hpp>
#include <string>
#include <vector>

#include "klume/cmetry/cmetry.h"
#include "nxbase/export.h"
#include "toolkit/string.h"

// Illuminant types and the repository names they select.
enum IllumType : int {
    ILLUM_UNKNOWN = -1,  // an illuminant without a type (installed ones)
    ILLUM_A = 0,
    ILLUM_C = 1,
    ILLUM_D65 = 2,
    ILLUM_D50 = 3,
    ILLUM_FL1 = 24,  // FL1..FL12 are 24..35
    ILLUM_FL2 = 25,
    ILLUM_FL3 = 26,
    ILLUM_FL4 = 27,
    ILLUM_FL5 = 28,
    ILLUM_FL6 = 29,
    ILLUM_FL7 = 30,
    ILLUM_FL8 = 31,
    ILLUM_FL9 = 32,
    ILLUM_FL10 = 33,
    ILLUM_FL11 = 34,
    ILLUM_FL12 = 35,
    ILLUM_D55 = 40,
    ILLUM_D75 = 41,
    ILLUM_E = 50
};

// Standard observers. Type 0 is the observer used for screen colours.
enum ObserverType : int {
    OBSERVER_UNKNOWN = -1,
    OBSERVER_2DEG = 0,  // CIE 1931, provider name "2"
    OBSERVER_10DEG = 1  // CIE 1964, provider name "10"
};

// An illuminant of the provider. Never empty: unknown types and names fall
// back to the provider's default (D50).
class NXBASE_EXPORT IllumClass {
  public:
    IllumClass();
    // Types outside the table give the default illuminant. The variant is kept
    // for callers that pass a colour temperature hint (IllumClass(ILLUM_D65,
    // 65)); the type alone selects the illuminant.
    IllumClass(IllumType type, short variant);
    explicit IllumClass(const std::string& name);
    explicit IllumClass(boost::shared_ptr<klume::cmetry::IIlluminant> illuminant);
    explicit IllumClass(klume::cmetry::IIlluminant& illuminant);

    std::string GetName() const;
    // The text shown to users: the name ("D50", "FL11", ...).
    std::string GetDisplayString() const;
    // The type whose table name equals GetName(), or ILLUM_UNKNOWN.
    IllumType GetIllumType() const;
    boost::shared_ptr<klume::cmetry::IIlluminant> GetIlluminant() const { return amIlluminant; }

    // The repository name of a type, or "" for a type outside the table.
    static std::string NameOfType(IllumType type);

    bool operator==(const IllumClass& other) const { return GetName() == other.GetName(); }
    bool operator!=(const IllumClass& other) const { return !(*this == other); }

  private:
    boost::shared_ptr<klume::cmetry::IIlluminant> amIlluminant;
};

// A standard observer. An unknown name gives type OBSERVER_UNKNOWN; its
// filters then use the 2 degree observer.
class NXBASE_EXPORT ObserverClass {
  public:
    ObserverClass(ObserverType type = OBSERVER_2DEG);  // NOLINT: implicit, as callers expect
    // "2" or "10"; a trailing degree string or "deg" is ignored.
    explicit ObserverClass(const String& name);
    explicit ObserverClass(boost::shared_ptr<klume::cmetry::IObserver> observer);
    ObserverClass(const ObserverClass&) = default;
    ObserverClass& operator=(const ObserverClass&) = default;

    // The provider name ("2", "10"), or the name given for an unknown observer.
    String GetName() const { return amName; }
    // The provider's observer; the 2 degree observer for an unknown one.
    boost::shared_ptr<klume::cmetry::IObserver> GetObserver() const { return amObserver; }
    ObserverType GetObserverType() const { return amType; }
    operator ObserverType() const { return amType; }  // NOLINT
    // Display text: the name followed by the degree string, e.g. "2\xB0".
    operator String() const;  // NOLINT

    // Appended to observer names in display texts; initially "\xB0" (the
    // degree sign in the toolkit's code page, Windows-1252). Set at start-up.
    static String GetDegreeString();
    static void SetDegreeString(const String& degree);

    bool operator==(const ObserverClass& other) const {
        return amType == other.amType && amName == other.amName;
    }
    bool operator!=(const ObserverClass& other) const { return !(*this == other); }

  private:
    ObserverType amType = OBSERVER_2DEG;
    String amName;
    boost::shared_ptr<klume::cmetry::IObserver> amObserver;
};

// The illuminant as used to build a filter.
class NXBASE_EXPORT Lichtart : public IllumClass {
  public:
    explicit Lichtart(const IllumClass& illuminant) : IllumClass(illuminant) {}
};

// The observer as used to build a filter.
class NXBASE_EXPORT Observer : public ObserverClass {
  public:
    explicit Observer(const ObserverClass& observer) : ObserverClass(observer) {}
};

// One weight table on the spectrum grid (36 floats, 380..730 nm) with a cached
// sum. Taking the non-const float pointer invalidates the cached sum (the
// caller may write through it) and the non-const FilterSumme() caches it
// again; a Filter shared between threads must therefore be read through const
// access only (the const forms never write).
class NXBASE_EXPORT Filter {
  public:
    static constexpr int kSize = klume::cmetry::kSampleCount;

    // All weights 0.0, undefined.
    Filter();
    // Copies 36 weights, marks the filter defined and computes the sum.
    explicit Filter(const float* weights);

    // Sets every weight to `value` and recomputes the sum.
    void Init(float value);
    void CalculateSumme();
    // The sum of the weights, recomputed first when not valid.
    float FilterSumme();
    float FilterSumme() const;
    // The dot product of the weights with the first 36 elements of `values`;
    // throws std::logic_error("Illegal spectrum size") when there are fewer.
    float operator*(const std::vector<float>& values) const;
    // The dot product with 36 contiguous floats, summed in ascending order.
    float Dot(const float* values) const;
    // A new filter of the element-wise products, defined, with its sum.
    Filter FilterXFilter(const Filter& other) const;

    bool isDefined() const { return amDefined != 0; }
    void Define(unsigned char defined) { amDefined = defined; }

    // The 36 weights. Changing them through the non-const forms invalidates
    // the cached sum.
    operator float*() {  // NOLINT
        amSumValid = 0;
        return amWeights;
    }
    operator const float*() const { return amWeights; }  // NOLINT
    const float* GetWeights() const { return amWeights; }

  private:
    unsigned char amSumValid = 0;
    float amSumme = 0.0f;
    float amWeights[kSize] = {};
    unsigned char amDefined = 0;
};

// The X, Y, Z weights of one illuminant and observer (index 0 = X, 1 = Y,
// 2 = Z). Copies share the provider's table and the three Filters.
class NXBASE_EXPORT CMetryFilter {
  public:
    // Illuminant "D65", observer "2".
    CMetryFilter();
    // The provider's filter of that illuminant and observer.
    CMetryFilter(const Lichtart& illuminant, const Observer& observer);

    // REQUIRES: channel <= 2.
    Filter& operator[](unsigned short channel) { return *amFilters[channel]; }
    const Filter& operator[](unsigned short channel) const { return *amFilters[channel]; }

    // The contiguous float[36] weights of channel 0 (X), 1 (Y) or 2 (Z).
    const float* GetWeights(unsigned short channel) const {
        return amFilters[channel]->GetWeights();
    }
    // The provider's weights as one contiguous, 32-byte aligned float[3][36]
    // block (X row, Y row, Z row) shared by every filter of the pair, for
    // vectorised and batch sums. It shows the weights as computed: changes
    // made through a Filter's non-const pointer do not reach it.
    const float* GetWeightTable() const { return amFilter->GetFloatWeights(0); }
    // The sum of the weights of a channel (Y: 100 up to float rounding). Reads
    // only, so any number of threads may ask at once.
    float GetWeightSum(unsigned short channel) const {
        return static_cast<const Filter&>(*amFilters[channel]).FilterSumme();
    }
    // Raw weighted sums S_i = sum over the 36 samples of W_i * R, in single
    // precision in ascending wavelength order; no allocation, no lock.
    void Tristimulus(const float* values, float sums[3]) const;

    ObserverClass GetObserver() const;
    IllumClass GetIllum() const;
    boost::shared_ptr<const klume::cmetry::CMetryFilter> GetProviderFilter() const {
        return amFilter;
    }

  private:
    void Build(boost::shared_ptr<klume::cmetry::IIlluminant> illuminant,
               boost::shared_ptr<klume::cmetry::IObserver> observer);

    boost::shared_ptr<const klume::cmetry::CMetryFilter> amFilter;
    boost::shared_ptr<Filter> amFilters[3];
};

#endif  // NXBASE_CMETRYFILTER_H_
