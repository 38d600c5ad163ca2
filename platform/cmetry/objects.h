// Concrete data objects of the provider, made by the repositories.
#ifndef KLUME_CMETRY_OBJECTS_H_
#define KLUME_CMETRY_OBJECTS_H_

#include <boost/shared_ptr.hpp>
#include <string>
#include <vector>

#include "embedded.h"
#include "klume/cmetry/data.h"

namespace klume {
namespace cmetry {
namespace detail {

// The observer of an embedded 1 nm table (columns wavelength, x, y, z).
boost::shared_ptr<IObserver> MakeObserver(const embedded::EmbeddedTable& table,
                                          const std::string& description, int fieldSize);

// A density standard from ISO 5-3 log10 spectral products: for each channel
// `logProducts[c][row]` at `wavelengths[row]`. Rows on the 36-sample grid
// give the linear product 10^(P - 5); rows off the grid or outside 380..730
// nm are not used. Empty pointer, with the reason in `error`, when a grid
// row is off the 10 nm grid inside 380..730 nm, a value exceeds 10, or a
// channel has no response on the grid.
boost::shared_ptr<IDensityStandard> MakeDensityStandard(
    const std::string& name, const std::vector<std::string>& channelNames,
    const std::vector<double>& wavelengths, const std::vector<std::vector<double>>& logProducts,
    std::string& error);

}  // namespace detail
}  // namespace cmetry
}  // namespace klume

#endif  // KLUME_CMETRY_OBJECTS_H_
