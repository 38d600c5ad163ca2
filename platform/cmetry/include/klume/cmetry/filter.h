// CMetryFilter: the tristimulus weighting factors of one illuminant and
// observer on the 36-sample grid (380..730 nm, 10 nm). Filters are computed
// once per pair on first request and shared; a filter is immutable, so any
// thread may read it. Find takes a lock; reading weights never does.
//
// The weights are ASTM E2022 tristimulus weighting factors for a 10 nm
// measurement interval over 360..780 nm, built from the observer's 1 nm
// colour-matching functions and the illuminant interpolated linearly to 1 nm
// (end values held), then adjusted to the measured range 380..730 nm as
// ASTM E308 asks (the 360 and 370 nm rows added to 380 nm, the 740..780 nm
// rows to 730 nm). They are scaled so that the y weights sum to 100: a
// perfect white (all reflectances 1.0) gives Y = 100.
#ifndef KLUME_CMETRY_FILTER_H_
#define KLUME_CMETRY_FILTER_H_

#include <boost/shared_ptr.hpp>
#include <string>

#include "klume/cmetry/data.h"
#include "nxbase/export.h"

namespace klume {
namespace cmetry {

// The 36 x 3 weight table of an illuminant and observer as defined above,
// rows 380..730 nm, columns x, y, z, in double precision.
struct WeightTable {
    SampleTable channel[3] = {};
};

// Computes the table defined above for any illuminant and observer.
NXBASE_EXPORT WeightTable ComputeWeights(const IIlluminant& illuminant, const IObserver& observer);

class NXBASE_EXPORT CMetryFilter {
  public:
    // The shared filter of the illuminant and observer named (names as the
    // repositories take them); computed on the first request for the pair.
    // An empty pointer when either name is unknown.
    static boost::shared_ptr<const CMetryFilter> Find(const std::string& illuminant,
                                                      const std::string& observer);

    // The filter of these objects: shared when both are the repositories' own,
    // computed afresh for any other illuminant. Empty pointer for a null one
    // and for an illuminant without power in 360..780 nm.
    static boost::shared_ptr<const CMetryFilter> Find(boost::shared_ptr<IIlluminant> illuminant,
                                                      boost::shared_ptr<IObserver> observer);

    // Computes the weights. REQUIRES: both pointers non-null.
    CMetryFilter(boost::shared_ptr<IIlluminant> illuminant, boost::shared_ptr<IObserver> observer);
    CMetryFilter(const CMetryFilter&) = delete;
    CMetryFilter& operator=(const CMetryFilter&) = delete;

    // Weights of channel 0 (X), 1 (Y) or 2 (Z): 36 doubles, 380..730 nm.
    // REQUIRES: 0 <= channel <= 2.
    const SampleTable& GetWeights(int channel) const { return amWeights.channel[channel]; }
    // The same weights rounded to single precision, contiguous float[36]; the
    // three channels follow each other in one float[3][36] block.
    const float* GetFloatWeights(int channel) const { return amFloatWeights[channel]; }

    boost::shared_ptr<IObserver> GetObserver() const { return amObserver; }
    boost::shared_ptr<IIlluminant> GetIlluminant() const { return amIlluminant; }

  private:
    boost::shared_ptr<IIlluminant> amIlluminant;
    boost::shared_ptr<IObserver> amObserver;
    WeightTable amWeights;
    alignas(32) float amFloatWeights[3][kSampleCount] = {};
};

}  // namespace cmetry
}  // namespace klume

#endif  // KLUME_CMETRY_FILTER_H_
