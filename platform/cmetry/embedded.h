// The CIE tables compiled into the library (generated from data/ by
// EmbedTables.cmake). Constant data; any thread may read it.
#ifndef KLUME_CMETRY_EMBEDDED_H_
#define KLUME_CMETRY_EMBEDDED_H_

namespace klume {
namespace cmetry {
namespace embedded {

struct EmbeddedTable {
    const char* key;       // repository name
    const char* file;      // source file below data/
    const char* header;    // the CSV header row
    const double* values;  // rows x columns, row-major, column 0 the wavelength
    int rows;
    int columns;
};

extern const EmbeddedTable kObservers[];
extern const int kObserversCount;
extern const EmbeddedTable kIlluminants[];
extern const int kIlluminantsCount;
extern const EmbeddedTable kDensityStandards[];
extern const int kDensityStandardsCount;

}  // namespace embedded
}  // namespace cmetry
}  // namespace klume

#endif  // KLUME_CMETRY_EMBEDDED_H_
